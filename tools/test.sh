#!/usr/bin/env bash
# Builds everything and passes every test: the plain build, the same suite under AddressSanitizer
# and UndefinedBehaviorSanitizer, then under ThreadSanitizer, the fuzz targets for a bounded time,
# and last the README's two commands in their order on a fresh clone.
#
# TARN_STAGES picks stages by name (default: all of "gcc sanitize thread fuzz readme");
# TARN_FUZZ_SECONDS is the time of each fuzz target (default 60).
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
"$top/tools/install-deps.sh"
stages="${TARN_STAGES:-gcc sanitize thread fuzz readme}"

# The tests use the monitor's one System V key: run them in an IPC namespace of their own where
# the machine allows it, so that they never disturb a monitor on this host.
private_ipc=()
if unshare --ipc true 2>/dev/null; then
  private_ipc=(unshare --ipc)
fi
jobs="$(nproc)"

wanted() {
  [[ " $stages " == *" $1 "* ]]
}

# Every option that tells one build from another is given each time, so that a cache that another
# command left in the same directory cannot turn the tests off.
run_suite() {
  local dir="$1"
  shift
  "$top/tools/build.sh" "$dir" -DTARN_TESTS=ON -DTARN_FUZZ=OFF "$@"
  (cd "$dir" && "${private_ipc[@]}" ctest --output-on-failure --no-tests=error -j "$jobs")
}

clang=(-DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++)

if wanted gcc; then
  echo "== g++ build"
  run_suite "$top/build" -DTARN_BENCH=ON -DTARN_SANITIZE=OFF -DTARN_SANITIZE_THREAD=OFF
fi
# The clang builds also prove the code warning-free under clang, as the first does under g++.
if wanted sanitize; then
  echo "== clang with AddressSanitizer and UndefinedBehaviorSanitizer"
  ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
    run_suite "$top/build-sanitize" -DTARN_SANITIZE=ON -DTARN_SANITIZE_THREAD=OFF \
    -DTARN_BENCH=OFF "${clang[@]}"
fi
if wanted thread; then
  echo "== clang with ThreadSanitizer"
  TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1 \
    run_suite "$top/build-thread" -DTARN_SANITIZE_THREAD=ON -DTARN_SANITIZE=OFF \
    -DTARN_BENCH=OFF "${clang[@]}"
fi
if wanted fuzz; then
  echo "== fuzz targets"
  "$top/tools/build.sh" "$top/build-fuzz" -DTARN_FUZZ=ON -DTARN_TESTS=OFF -DTARN_BENCH=OFF \
    -DTARN_SANITIZE=OFF -DTARN_SANITIZE_THREAD=OFF "${clang[@]}"
  "$top/tools/fuzz.sh" "$top/build-fuzz" "${TARN_FUZZ_SECONDS:-60}"
fi
if wanted readme; then
  echo "== the README's two commands in their order, on a fresh clone"
  "$top/tools/readme-order.sh"
fi
