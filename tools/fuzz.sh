#!/usr/bin/env bash
# tools/fuzz.sh BUILD_DIR SECONDS: runs every fuzz target of BUILD_DIR for SECONDS each, starting
# from its seed corpus under fuzz/corpus/<target>/ when there is one.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
dir="$1"
seconds="$2"
shopt -s nullglob
for target in "$dir"/fuzz/fuzz_*; do
  [ -x "$target" ] || continue
  name="$(basename "$target")"
  name="${name#fuzz_}"
  work="$(mktemp -d)"
  seeds=()
  [ -d "$top/fuzz/corpus/$name" ] && seeds=("$top/fuzz/corpus/$name")
  echo "fuzzing $name for ${seconds}s"
  "$target" -max_total_time="$seconds" -max_len=100000 -rss_limit_mb=4096 -print_final_stats=1 \
    "$work" "${seeds[@]}" 2>&1 | tail -n 12
  rm -rf "$work"
done
