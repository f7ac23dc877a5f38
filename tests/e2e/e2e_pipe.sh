#!/bin/sh
# e2e_pipe.sh host|wine SERVICE CLIENT: the command channel end to end; on the
# host also the live block, and the last one a client holds after the stop.
set -u
SVC=$2
CLIENT=$3
case $1 in
  host) RUN= ;;
  wine) RUN=wine ;;
  *) echo "unknown mode $1" >&2 && exit 2 ;;
esac
. "$(dirname "$0")/e2e_lib.sh"
if [ "$RUN" = wine ]; then
  export WINEDEBUG=-all
  export WINEDLLOVERRIDES="mscoree,mshtml="
else
  private_emulation e2epipe
fi
# Output through a file: a helper process Wine starts may inherit the
# client's standard output and hold a pipe open long after the client ended.
ask() { timeout 60 $RUN "$CLIENT" "$@" >"$WORK/client.txt" 2>&1; }
# expect RC TEXT ARGS...
expect() {
  want=$1
  text=$2
  shift 2
  ask "$@"
  rc=$?
  [ "$rc" = "$want" ] || fail "skyvane $*: exit $rc, wanted $want"
  grep -qF -- "$text" "$WORK/client.txt" || fail "skyvane $*: no '$text' in the output"
}
answers() {
  ask send 10920 4 && grep -q "result: 4294966519" "$WORK/client.txt" && return 0
  running "$SVC_PID" || fail "the service ended before its pipe answered"
  return 1
}

start_service
within 600 answers || fail "the service's pipe never answered"
if [ -z "$RUN" ]; then
  live_block
  [ "$(field driveCount "$WORK/live.json")" -ge 4 ] || fail "driveCount"
  [ "$(field channelCount "$WORK/live.json")" = 4 ] || fail "channelCount"
  # A client that keeps the mapping open sees the last block after the stop.
  start_holder
  holder_holds
else
  ask status --wait-open --wait-status 102 --timeout-ms 60000 || echo "note: status word did not reach 102; going on"
fi

expect 0 "result: 1" set-status 4321
expect 0 "4321" status --wait-status 4321 --timeout-ms 10000
expect 0 "result: 0 (done)" pause
expect 0 "result: 0 (done)" resume

value="SkyvaneE2E-$$"
expect 0 "result: 0 (success)" reg set HKCU "$value" sz "hello through the pipe"
expect 0 "data: hello through the pipe" reg get HKCU "$value"
expect 0 "result: 0 (success)" reg set HKCU "$value-n" dword 0x1234
expect 0 "data: 4660" reg get HKCU "$value-n"
expect 1 "result: 2 (not found)" reg get HKCU "$value-absent"
expect 0 "reply length: 0" send 9895 10 77
expect 0 "4321" status # the short request changed nothing
running "$SVC_PID" || fail "the service ended during the test"
if [ -z "$RUN" ]; then
  stop_service
  grep -q "^Debugging Skyvane Service\.$" "$WORK/service.txt" || fail "no debugging line"
  grep -q "^Stopping Skyvane Service\.$" "$WORK/service.txt" || fail "no stopping line"
  holder_saw_500
else
  kill -INT "$SVC_PID"
  within 50 eval '! running $SVC_PID'
fi
echo "all checks passed"
