#!/bin/sh
# The host executable in -debug in one process, the status client in others,
# sharing a private emulation namespace and registry.
set -u
SVC=$1
CLIENT=$2
WORK=$(mktemp -d)
export SKYVANE_NAMESPACE="e2e-host-$$"
export SKYVANE_REGISTRY="$WORK/registry"
export SKYVANE_TIME_SCALE=0.1
SVC_PID=
HOLDER_PID=
cleanup() {
  [ -n "$SVC_PID" ] && kill -9 "$SVC_PID" 2>/dev/null
  [ -n "$HOLDER_PID" ] && kill -9 "$HOLDER_PID" 2>/dev/null
  rm -rf "$WORK"
}
trap cleanup EXIT
fail() {
  echo "FAIL: $*"
  for f in "$WORK"/*.txt "$WORK"/*.json; do [ -f "$f" ] && { echo "--- $f"; cat "$f"; }; done
  exit 1
}
field() { sed -n "s/^  \"$1\": \([0-9]*\),*$/\1/p" "$2"; }

"$SVC" -debug >"$WORK/service.txt" 2>&1 &
SVC_PID=$!

"$CLIENT" status --json --wait-open --wait-status 102 --timeout-ms 30000 >"$WORK/first.json" 2>"$WORK/first.txt" ||
  fail "no block with statusWord 102"
[ "$(field size "$WORK/first.json")" = 1215512 ] || fail "block size"
# The embedded default machine has four of the maker's drives, each with one
# control channel.
[ "$(field driveCount "$WORK/first.json")" -ge 4 ] || fail "driveCount"
[ "$(field channelCount "$WORK/first.json")" = 4 ] || fail "channelCount"
FIRST=$(field sequence "$WORK/first.json")
"$CLIENT" status --json --wait-sequence $((FIRST + 1)) --timeout-ms 30000 >"$WORK/second.json" 2>"$WORK/second.txt" ||
  fail "sequence did not grow past $FIRST"

# A client that keeps the mapping open sees the last block after the stop.
"$CLIENT" status --json --wait-status 500 --timeout-ms 60000 >"$WORK/last.json" 2>"$WORK/holder.txt" &
HOLDER_PID=$!
i=0
until grep -q "holding the state block" "$WORK/holder.txt" 2>/dev/null; do
  i=$((i + 1))
  [ $i -gt 600 ] && fail "holder did not open the block"
  kill -0 $HOLDER_PID 2>/dev/null || fail "holder ended early"
  sleep 0.1
done

kill -INT $SVC_PID
wait $SVC_PID
RC=$?
SVC_PID=
[ $RC = 0 ] || fail "service exit code $RC"
grep -q "^Debugging Skyvane Service\.$" "$WORK/service.txt" || fail "no debugging line"
grep -q "^Stopping Skyvane Service\.$" "$WORK/service.txt" || fail "no stopping line"
wait $HOLDER_PID || fail "holder did not see statusWord 500"
HOLDER_PID=
[ "$(field statusWord "$WORK/last.json")" = 500 ] || fail "last statusWord"
echo "e2e host: ok"
