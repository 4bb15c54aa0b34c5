#!/usr/bin/env bash
# tools/fuzz.sh BUILD_DIR SECONDS: runs every fuzz target of BUILD_DIR for SECONDS each, starting
# from its seed corpus under fuzz/corpus/<target>/ when there is one. A target's own limits, when
# it needs others than the defaults below, are in fuzz/<target>.options: "name = value" lines under
# [libfuzzer] replace or add libFuzzer flags, those under [asan] go to ASAN_OPTIONS.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
dir="$1"
seconds="$2"
shopt -s nullglob
for target in "$dir"/fuzz/fuzz_*; do
  [ -x "$target" ] || continue
  name="$(basename "$target")"
  name="${name#fuzz_}"
  declare -A flags=([max_len]=100000 [rss_limit_mb]=4096)
  asan_options="${ASAN_OPTIONS:-}"
  options="$top/fuzz/$name.options"
  if [ -f "$options" ]; then
    section=""
    while IFS= read -r line || [ -n "$line" ]; do
      line="${line%%#*}"
      line="${line//[[:space:]]/}"
      case "$line" in
        "") ;;
        \[*\]) section="$line" ;;
        *=*)
          if [ "$section" = "[libfuzzer]" ]; then
            flags[${line%%=*}]="${line#*=}"
          elif [ "$section" = "[asan]" ]; then
            asan_options="${asan_options:+$asan_options:}$line"
          fi
          ;;
      esac
    done <"$options"
  fi
  arguments=()
  for flag in "${!flags[@]}"; do
    arguments+=("-$flag=${flags[$flag]}")
  done
  unset flags
  work="$(mktemp -d)"
  seeds=()
  [ -d "$top/fuzz/corpus/$name" ] && seeds=("$top/fuzz/corpus/$name")
  echo "fuzzing $name for ${seconds}s (${arguments[*]})"
  ASAN_OPTIONS="$asan_options" "$target" -max_total_time="$seconds" "${arguments[@]}" \
    -print_final_stats=1 "$work" "${seeds[@]}" 2>&1 | tail -n 12
  rm -rf "$work"
done
