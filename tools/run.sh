#!/usr/bin/env bash
# Builds the monitor on the default platform and runs its main job: check the example control
# file as the monitor reads it at start. It builds into build-run/, a directory of its own, so that
# it never changes the build that tools/test.sh keeps in build/.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
"$top/tools/install-deps.sh"
"$top/tools/build.sh" "$top/build-run" -DTARN_TESTS=OFF -DTARN_BENCH=OFF -DTARN_FUZZ=OFF \
  -DTARN_SANITIZE=OFF -DTARN_SANITIZE_THREAD=OFF
export TELV_DATA_DIR="${TELV_DATA_DIR:-$top/build-run/data}"
mkdir -p "$TELV_DATA_DIR"
exec "$top/build-run/tarnmon" check-config "$top/examples/telvzopt.trm"
