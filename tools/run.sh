#!/usr/bin/env bash
# Builds the monitor on the default platform and runs its main job: check the example control
# file as the monitor reads it at start.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
"$top/tools/install-deps.sh"
"$top/tools/build.sh" "$top/build" -DTARN_TESTS=OFF -DTARN_BENCH=OFF
export TELV_DATA_DIR="${TELV_DATA_DIR:-$top/build/data}"
mkdir -p "$TELV_DATA_DIR"
exec "$top/build/tarnmon" check-config "$top/examples/telvzopt.trm"
