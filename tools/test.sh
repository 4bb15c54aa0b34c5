#!/usr/bin/env bash
# Builds everything and passes every test: the plain build, the same suite under AddressSanitizer
# and UndefinedBehaviorSanitizer, and the fuzz targets for a bounded time.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
"$top/tools/install-deps.sh"

# The tests use the monitor's one System V key: run them in an IPC namespace of their own where
# the machine allows it, so that they never disturb a monitor on this host.
private_ipc=()
if unshare --ipc true 2>/dev/null; then
  private_ipc=(unshare --ipc)
fi
jobs="$(nproc)"

run_suite() {
  local dir="$1"
  shift
  "$top/tools/build.sh" "$dir" "$@"
  (cd "$dir" && "${private_ipc[@]}" ctest --output-on-failure -j "$jobs")
}

echo "== g++ build"
run_suite "$top/build"
# The second build also proves the code warning-free under clang, as the first does under g++.
echo "== clang with AddressSanitizer and UndefinedBehaviorSanitizer"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  run_suite "$top/build-sanitize" -DTARN_SANITIZE=ON -DTARN_BENCH=OFF \
  -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++

echo "== fuzz targets"
"$top/tools/build.sh" "$top/build-fuzz" -DTARN_FUZZ=ON -DTARN_TESTS=OFF -DTARN_BENCH=OFF \
  -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++
"$top/tools/fuzz.sh" "$top/build-fuzz" "${TARN_FUZZ_SECONDS:-60}"
