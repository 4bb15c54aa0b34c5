#!/usr/bin/env bash
# shellcheck disable=SC2154 # the layout's variables come from load_layout
# package_test.sh SOURCE_DIR SCRATCH: builds the Debian package with tools/package.sh into
# SCRATCH, checks its control fields, maintainer scripts and file list (owners and modes in the
# archive), extracts it with dpkg -x into SCRATCH/root (nothing is installed on this machine),
# checks every file there with its mode, and runs the extracted tarnmon: check-config on the
# installed control file, and one pass in an IPC namespace of its own.
set -euo pipefail
here="$(cd "$(dirname "$0")" && pwd)"
# shellcheck source=tests/install_support.sh
. "$here/install_support.sh"
source_dir="$1"
scratch="$2"

mkdir -p "$scratch"
rm -rf "$scratch/root" "$scratch/control" "$scratch/out" "$scratch/data"
deb="$(TARN_JOBS="${TARN_JOBS:-2}" "$source_dir/tools/package.sh" "$scratch/build" "$scratch/out")"
[ -f "$deb" ] || fail "tools/package.sh printed '$deb', which is no file"
case "$deb" in
*.deb) ;;
*) fail "tools/package.sh printed '$deb', not a .deb" ;;
esac

field() {
  dpkg-deb -f "$deb" "$1"
}
[ "$(field Package)" = telvzmnd ] || fail "Package is '$(field Package)'"
[ -n "$(field Version)" ] || fail "no Version"
[ -n "$(field Maintainer)" ] || fail "no Maintainer"
[ "$(field Architecture)" = "$(dpkg --print-architecture)" ] ||
  fail "Architecture is '$(field Architecture)'"
depends="$(field Depends)"
for needed in libc6 libstdc++6 procps coreutils; do
  [[ ", $depends," == *", $needed"[\ ,]* ]] || fail "Depends '$depends' lacks $needed"
done

dpkg-deb -e "$deb" "$scratch/control"
grep -q -x /etc/telvzmnd/telvzopt.trm "$scratch/control/conffiles" ||
  fail "the control file is not a conffile: $(cat "$scratch/control/conffiles")"
for script in postinst prerm postrm; do
  expect_file 755 "$scratch/control/$script"
  sh -n "$scratch/control/$script" || fail "$script is not a valid shell script"
done

# In the archive every entry belongs to root.
listing="$(dpkg-deb -c "$deb")"
! grep -v -E '^[-dlrwxst]{10} root/root ' <<<"$listing" || fail "entries not root's in the archive"

load_layout "$scratch/build"
[ "$prefix" = /usr ] || fail "the package is built for the prefix $prefix"
dpkg -x "$deb" "$scratch/root"
expect_layout "$scratch/root"
{ [ "$libexecdir" = /usr/libexec/telvzmnd ] && [ "$controlfile" = /etc/telvzmnd/telvzopt.trm ] &&
  [ "$unitdir" = /lib/systemd/system ]; } ||
  fail "the package's layout: $libexecdir $controlfile $unitdir"
for file in "$bindir/tarnmon" "$libdir/libtelvzmnd.so" "$libdir/libtelvplatform.so" "$libdir/libtelvzextra.so" \
  "$libdir/libtelvzjava.so" "$libexecdir/runAsRoot" "$controlfile" "$unitdir/telvzmnd.service"; do
  grep -q -E " \.${file//./\\.}\$" <<<"$listing" || fail "$file is not in the archive's list"
done

# The unit names the files the package installs.
unit="$scratch/root$unitdir/telvzmnd.service"
grep -q -x 'ExecStart=/usr/bin/tarnmon run --config /etc/telvzmnd/telvzopt.trm' "$unit" ||
  fail "the unit does not run /usr/bin/tarnmon with /etc/telvzmnd/telvzopt.trm"
grep -q -x 'Environment=PATH=/usr/libexec/telvzmnd:/usr/sbin:/usr/bin:/sbin:/bin' "$unit" ||
  fail "the unit does not put /usr/libexec/telvzmnd first on PATH"

valid_config "$scratch/root$bindir/tarnmon" "$scratch/root$controlfile" "$scratch/check-config.out"

# A pass of the extracted, stripped programs, where the machine gives an IPC namespace of its own.
if unshare --ipc true 2>/dev/null; then
  one_pass "$scratch/root$bindir/tarnmon" "$scratch/root$libexecdir" "$scratch/root$controlfile" \
    "$scratch/data" "$scratch/run.out"
else
  echo "no IPC namespace of its own here: the extracted tarnmon runs no pass"
fi
echo "PASS: $deb"
