#!/usr/bin/env bash
# tools/package.sh [BUILD_DIR [OUTPUT_DIR]]: builds the Debian package of the install tree for the
# prefix /usr in BUILD_DIR (default build-package/) and writes it into OUTPUT_DIR (default
# BUILD_DIR); prints the path of the .deb. TARN_JOBS caps the parallel jobs of the build.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
dir="$(realpath -m "${1:-$top/build-package}")"
out="$(realpath -m "${2:-$dir}")"
mkdir -p "$out"

# A plain release build of the installed pieces alone: no tests, benchmarks or fuzz targets. What
# the steps print goes to a log, shown when one fails.
log="$dir/package.log"
mkdir -p "$dir"
: >"$log"
step() {
  if ! "$@" >>"$log" 2>&1; then
    cat "$log" >&2
    echo "package.sh: failed: $*" >&2
    exit 1
  fi
}
step cmake -S "$top" -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DCMAKE_INSTALL_PREFIX=/usr -DTARN_TESTS=OFF -DTARN_BENCH=OFF -DTARN_FUZZ=OFF \
  -DTARN_SANITIZE=OFF -DTARN_SANITIZE_THREAD=OFF
step cmake --build "$dir" ${TARN_JOBS:+-j "$TARN_JOBS"}
step cpack --config "$dir/CPackConfig.cmake" -G DEB -B "$out"

# The package as cpack names it.
deb="$(sed -n 's/^CPack: - package: \(.*\) generated\.$/\1/p' "$log" | tail -n 1)"
[ -f "$deb" ] || {
  cat "$log" >&2
  echo "package.sh: cpack named no package" >&2
  exit 1
}
echo "$deb"
