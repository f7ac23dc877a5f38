# Sourced by the end-to-end scripts (POSIX sh). Before sourcing: SVC and
# CLIENT; RUN=w to run the programs under Wine.
WORK=$(mktemp -d)
SVC_PID=
HOLDER_PID=
CLEANUP=: # a script's own cleanup, run first
RUN=${RUN:-}
w() { timeout -k 5 120 wine "$@"; }
cleanup() {
  eval "$CLEANUP"
  [ -n "$HOLDER_PID" ] && kill -9 "$HOLDER_PID" 2>/dev/null
  [ -n "$SVC_PID" ] && kill -9 "$SVC_PID" 2>/dev/null
  rm -rf "$WORK"
}
trap cleanup EXIT
trap "exit 1" INT TERM HUP PIPE
SHOW=: # more to show on a failure
fail() {
  echo "FAIL: $*"
  eval "$SHOW"
  for f in "$WORK"/*.txt "$WORK"/*.json; do [ -f "$f" ] && { echo "--- $f"; cat "$f"; }; done
  exit 1
}
private_emulation() {
  export SKYVANE_NAMESPACE="$1-$$"
  export SKYVANE_REGISTRY="$WORK/registry"
}
client() { $RUN "$CLIENT" "$@"; }
field() { sed -n "s/^  \"$1\": \([0-9]*\),*\r*$/\1/p" "$2"; }
# within TENTHS COMMAND...: polled every 0.1 s.
within() {
  n=$1
  shift
  i=0
  until "$@"; do
    i=$((i + 1))
    [ $i -gt "$n" ] && return 1
    sleep 0.1
  done
}
running() { kill -0 "$1" 2>/dev/null; }
start_service() {
  $RUN "$SVC" -debug >"$WORK/service.txt" 2>&1 &
  SVC_PID=$!
}
stop_service() {
  kill -INT "$SVC_PID"
  within "${1:-600}" eval '! running $SVC_PID' || fail "the service did not stop"
  wait "$SVC_PID" || fail "service exit code $?"
  SVC_PID=
}
live_block() {
  client status --json --wait-open --wait-status 102 --timeout-ms 60000 >"$WORK/live.json" \
    2>"$WORK/live.txt" || fail "no block with statusWord 102"
  [ "$(field size "$WORK/live.json")" = 1215512 ] || fail "block size"
  seq=$(field sequence "$WORK/live.json")
  client status --json --wait-sequence $((seq + 1)) --timeout-ms 30000 >"$WORK/next.json" 2>&1 ||
    fail "sequence did not grow past $seq"
}
start_holder() {
  $RUN "$CLIENT" status --json --wait-open --wait-status 500 --timeout-ms 90000 >"$WORK/last.json" \
    2>"$WORK/holder.txt" &
  HOLDER_PID=$!
}
holder_holds() {
  within 600 grep -q "holding the state block" "$WORK/holder.txt" || fail "holder did not open the block"
}
holder_saw_500() {
  wait "$HOLDER_PID" || fail "holder did not see statusWord 500"
  HOLDER_PID=
  [ "$(field statusWord "$WORK/last.json")" = 500 ] || fail "last statusWord"
}
