#!/usr/bin/env bash
# Builds the monitor on the default platform and runs its main job on this host: one pass of the
# monitor with the example control file, in a fresh data directory, then the plain snapshot that the
# pass wrote and the events it raised. It builds into build-run/, a directory of its own, so that it
# never changes the build that tools/test.sh keeps in build/.
set -euo pipefail
top="$(cd "$(dirname "$0")/.." && pwd)"
"$top/tools/install-deps.sh"
"$top/tools/build.sh" "$top/build-run" -DTARN_TESTS=OFF -DTARN_BENCH=OFF -DTARN_FUZZ=OFF \
  -DTARN_SANITIZE=OFF -DTARN_SANITIZE_THREAD=OFF
tarnmon="$top/build-run/tarnmon"

# Every file of the pass goes into the fresh data directory.
data="$top/build-run/data"
rm -rf "$data"
mkdir -p "$data"
export TELV_DATA_DIR="$data"
unset TELV_EVENT_LOG TELV_TRACE_FILE

# A control block of the pass's own where the machine allows it, so that the pass never touches the
# block of a monitor running on this host.
private_ipc=()
if unshare --ipc true 2>/dev/null; then
  private_ipc=(unshare --ipc)
fi
"${private_ipc[@]}" "$tarnmon" run --once --config "$top/examples/telvzopt.trm"

echo
"$tarnmon" snapshots
# The pass's plain snapshot is the file's last block; a finding's problem snapshot comes before it.
blocks="$("$tarnmon" snapshots | sed -n '1s/.*, \([0-9][0-9]*\) blocks\{0,1\}$/\1/p')"
echo
"$tarnmon" snapshots "$blocks"

echo
events="$data/telvzmnd.events"
if [ -s "$events" ]; then
  echo "Events ($events):"
  cat "$events"
else
  echo "Events: none ($events is empty or absent: the pass found nothing to report)"
fi
