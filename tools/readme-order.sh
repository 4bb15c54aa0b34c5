#!/usr/bin/env bash
# The README's two commands, in the README's order and then the other way round, on a fresh clone
# of the committed tree whose build/ holds the cache an older run command left there (tests off):
# the run command must build, find the example valid and run a pass that writes its plain snapshot,
# and the test command must still find and pass its tests.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
clone="$(mktemp -d)"
trap 'rm -rf "$clone"' EXIT
git clone --quiet "$top" "$clone/tree"
cd "$clone/tree"
cmake -S . -B build -G Ninja -DTARN_TESTS=OFF -DTARN_BENCH=OFF >/dev/null

check_run() {
  local out
  out="$(tools/run.sh)"
  printf '%s\n' "$out" | tail -n 1
  [[ "$out" == *"VALID: the monitor would run with this control file"* ]] &&
    [[ "$out" == *"=START=============================================="* ]]
}

check_run
TARN_STAGES=gcc tools/test.sh
check_run
echo "README order: both commands passed in either order"
