# shellcheck shell=bash disable=SC2154
# Shared by the tests of the install tree and of the package: the files an install must hold,
# with their modes, and the runs of the installed tarnmon. Sourced; the caller has set -euo
# pipefail. (The layout's variables come from load_layout.)

fail() {
  echo "FAIL: $*" >&2
  exit 1
}

# expect_file MODE PATH: PATH is a regular file of mode MODE (octal, as stat prints it).
expect_file() {
  { [ -f "$2" ] && [ ! -L "$2" ]; } || fail "missing: $2"
  local mode
  mode="$(stat -c %a "$2")"
  [ "$mode" = "$1" ] || fail "$2 has mode $mode, not $1"
}

# expect_root_only_writable PATH: PATH belongs to root and no one else may write to it, as
# runAsRoot's folder and its scripts must.
expect_root_only_writable() {
  [ "$(stat -c %u "$1")" = 0 ] || fail "$1 does not belong to root"
  local mode
  mode="$(stat -c %a "$1")"
  (((8#$mode & 8#022) == 0)) || fail "$1 is writable by others than its owner (mode $mode)"
}

# load_layout BUILD_DIR: the full paths where BUILD_DIR installs its files (prefix, bindir, libdir,
# libexecdir, datadir, includedir, docdir, controlfile, unitdir).
load_layout() {
  [ -f "$1/packaging/install-layout.sh" ] || fail "no install layout in $1"
  # shellcheck source=/dev/null
  . "$1/packaging/install-layout.sh"
}

# expect_layout ROOT: every file of the loaded layout under ROOT, with its mode.
expect_layout() {
  local root="$1"
  expect_file 755 "$root$bindir/tarnmon"
  local library
  for library in libtelvzmnd.so libtelvplatform.so libtelvzjava.so libtelvzextra.so; do
    expect_file 644 "$root$libdir/$library"
  done
  local program
  for program in runAsRoot cleanupPartition rundu.sh lsmon.sh telvzstba; do
    expect_file 755 "$root$libexecdir/$program"
    expect_root_only_writable "$root$libexecdir/$program"
  done
  expect_root_only_writable "$root$libexecdir"
  expect_file 644 "$root$datadir/java/telvzmnd.jar"
  local header
  for header in filesvc.h jcb.h jcb_jni.h logsvc.h memsvc.h modsvc.h telvmemdebug.h tracesvc.h; do
    expect_file 644 "$root$includedir/$header"
  done
  expect_file 644 "$root$docdir/examples/telvzopt.trm"
  expect_file 644 "$root$docdir/README.md"
  expect_file 644 "$root$controlfile"
  expect_file 644 "$root$unitdir/telvzmnd.service"
}

# valid_config TARNMON FILE OUT: tarnmon check-config finds FILE valid; what it prints goes to OUT.
valid_config() {
  local status=0
  "$1" check-config "$2" >"$3" 2>&1 || status=$?
  [ "$status" = 0 ] || fail "$1 check-config $2: status $status: $(cat "$3")"
  grep -q '^VALID:' "$3" || fail "no VALID: line from $1 check-config $2"
}

# one_pass TARNMON LIBEXEC CONFIG DATA OUT: one pass of tarnmon run in an IPC namespace of its own,
# with a plain PATH and none of the variables that would move the monitor's files elsewhere; it
# must end with 0, find LIBEXEC's runAsRoot by itself and run it, and write a snapshot into DATA.
# What tarnmon prints goes to OUT.
one_pass() {
  local tarnmon="$1" libexec="$2" config="$3" data="$4" out="$5" status=0
  env -u TELV_DATA_DIR -u TELV_EVENT_LOG -u TELV_TRACE_FILE \
    PATH="/usr/sbin:/usr/bin:/sbin:/bin" \
    unshare --ipc "$tarnmon" run --once --config "$config" --data-dir "$data" >"$out" 2>&1 ||
    status=$?
  [ "$status" = 0 ] || fail "$tarnmon run --once: status $status: $(cat "$out")"
  grep -q -F "runAsRoot: $libexec/runAsRoot (this tarnmon's, put first on PATH)" "$out" ||
    fail "$tarnmon run does not run $libexec/runAsRoot: $(cat "$out")"
  grep -q '^=START=' "$data/telvzmnd.trm" || fail "no snapshot written into $data/telvzmnd.trm"
  [ ! -e "$data/telvzopt.trm" ] || fail "the link to the control file stayed in $data"
}

# The private IPC namespace the runs need, or exit 77 (skipped) where the machine gives none.
need_private_ipc() {
  unshare --ipc true 2>/dev/null || {
    echo "SKIP: no IPC namespace of its own here (unshare --ipc needs root)"
    exit 77
  }
}
