#!/bin/sh
set -u
SVC=$1
CLIENT=$2
. "$(dirname "$0")/e2e_lib.sh"
private_emulation e2e-host
export SKYVANE_TIME_SCALE=0.1

start_service
live_block
[ "$(field driveCount "$WORK/live.json")" -ge 4 ] || fail "driveCount"
[ "$(field channelCount "$WORK/live.json")" = 4 ] || fail "channelCount"

# A client that keeps the mapping open sees the last block after the stop.
start_holder
holder_holds
stop_service
grep -q "^Debugging Skyvane Service\.$" "$WORK/service.txt" || fail "no debugging line"
grep -q "^Stopping Skyvane Service\.$" "$WORK/service.txt" || fail "no stopping line"
holder_saw_500
echo "e2e host: ok"
