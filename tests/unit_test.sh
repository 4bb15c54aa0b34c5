#!/usr/bin/env bash
# shellcheck disable=SC2154 # the layout's variables come from load_layout
# unit_test.sh BUILD_DIR SCRATCH: systemd-analyze verify of the service unit that BUILD_DIR
# installs, with its ExecStart pointed at the build's tarnmon (verify wants the program to exist;
# the rest of the unit is checked as installed). Any complaint fails it, since verify reports a
# setting it ignores without failing. Skipped (77) without systemd-analyze.
set -euo pipefail
here="$(cd "$(dirname "$0")" && pwd)"
# shellcheck source=tests/install_support.sh
. "$here/install_support.sh"
build="$1"
scratch="$2"
command -v systemd-analyze >/dev/null || {
  echo "SKIP: no systemd-analyze on this machine"
  exit 77
}

load_layout "$build"
unit="$build/packaging/telvzmnd.service"
[ -f "$unit" ] || fail "no unit $unit"
installed="$bindir/tarnmon"
grep -q -x -F "ExecStart=$installed run --config $controlfile" "$unit" ||
  fail "the unit does not run $installed with $controlfile"
grep -q -x -F "Environment=PATH=$libexecdir:/usr/sbin:/usr/bin:/sbin:/bin" "$unit" ||
  fail "the unit does not put $libexecdir first on PATH"

rm -rf "$scratch"
mkdir -p "$scratch"
sed "s|^ExecStart=$installed |ExecStart=$build/tarnmon |" "$unit" >"$scratch/telvzmnd.service"
grep -q "^ExecStart=$build/tarnmon run " "$scratch/telvzmnd.service" || fail "no ExecStart to point"
status=0
systemd-analyze verify --man=no "$scratch/telvzmnd.service" >"$scratch/verify.out" 2>&1 || status=$?
{ [ "$status" = 0 ] && [ ! -s "$scratch/verify.out" ]; } ||
  fail "systemd-analyze verify: status $status: $(cat "$scratch/verify.out")"
echo "PASS: systemd-analyze verify found nothing to say"
