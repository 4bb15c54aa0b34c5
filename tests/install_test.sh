#!/usr/bin/env bash
# shellcheck disable=SC2154 # the layout's variables come from load_layout
# install_test.sh BUILD_DIR SCRATCH: installs BUILD_DIR with DESTDIR=SCRATCH/root, checks every
# installed file and its mode, and runs the installed programs from there: tarnmon check-config
# on the installed example, runAsRoot with a script of its folder, and one pass of tarnmon run in
# an IPC namespace of its own, which must load the installed library, run the installed
# runAsRoot and write a snapshot.
set -euo pipefail
here="$(cd "$(dirname "$0")" && pwd)"
# shellcheck source=tests/install_support.sh
. "$here/install_support.sh"
build="$1"
scratch="$2"
need_private_ipc
load_layout "$build"

rm -rf "$scratch"
mkdir -p "$scratch"
root="$scratch/root"
DESTDIR="$root" cmake --install "$build" >"$scratch/install.log"
expect_layout "$root"

tarnmon="$root$bindir/tarnmon"
lib="$root$libdir"
libexec="$root$libexecdir"
example="$root$docdir/examples/telvzopt.trm"

# The installed tarnmon finds the installed libraries, never the build's.
to_lib="$(realpath -m --relative-to="$bindir" "$libdir")"
runpath="$(readelf -d "$tarnmon" | sed -n 's/.*(RUNPATH).*\[\(.*\)\]$/\1/p')"
[ "$runpath" = "\$ORIGIN/$to_lib" ] || fail "tarnmon's RUNPATH is '$runpath', not \$ORIGIN/$to_lib"
for file in "$tarnmon" "$lib"/*.so; do
  ! readelf -d "$file" | grep -E 'RPATH|RUNPATH' | grep -q -F "$build" ||
    fail "$file finds its libraries in the build"
done

valid_config "$tarnmon" "$example" "$scratch/check-config.out"
cmp -s "$example" "$root$controlfile" || fail "the installed control file is not the example"

# runAsRoot runs the scripts of its own installed folder.
status=0
"$libexec/runAsRoot" lsmon.sh >"$scratch/lsmon.out" 2>&1 || status=$?
[ "$status" = 0 ] || fail "installed runAsRoot lsmon.sh: status $status"
grep -q '^/proc/[0-9]*/fd:$' "$scratch/lsmon.out" || fail "installed lsmon.sh listed no descriptors"

# One pass of the installed programs, which loads the installed library.
one_pass "$tarnmon" "$libexec" "$example" "$scratch/data" "$scratch/run.out"
grep -q -F "monitor: $lib/libtelvzmnd.so" "$scratch/run.out" ||
  fail "tarnmon run did not load the installed library: $(cat "$scratch/run.out")"
echo "PASS: installed into $root and ran from there"
