#!/usr/bin/env bash
# End to end over the command channel: the service runs in the foreground in
# one process, the command-line client talks to it from others.
#
#   e2e_pipe.sh host SERVICE CLIENT     (POSIX emulation; private namespace and registry)
#   e2e_pipe.sh wine SERVICE.exe CLIENT.exe   (under Wine, in $WINEPREFIX)
set -u
mode=$1
service=$2
client=$3
failures=0
work=$(mktemp -d)
service_pid=

if [ "$mode" = host ]; then
  export SKYVANE_NAMESPACE="e2epipe-$$"
  export SKYVANE_REGISTRY="$work/registry"
  run=()
elif [ "$mode" = wine ]; then
  export WINEDEBUG=-all
  export WINEDLLOVERRIDES="mscoree,mshtml="
  run=(wine)
else
  echo "unknown mode $mode" >&2
  exit 2
fi

cleanup() {
  if [ -n "$service_pid" ] && kill -0 "$service_pid" 2>/dev/null; then
    kill -INT "$service_pid" 2>/dev/null
    for _ in $(seq 1 50); do
      kill -0 "$service_pid" 2>/dev/null || break
      sleep 0.1
    done
    kill -KILL "$service_pid" 2>/dev/null
    wait "$service_pid" 2>/dev/null
  fi
  rm -rf "$work"
}
trap cleanup EXIT

# The client's output goes through a file: a helper process that Wine starts
# along with a program (the device host, for one) may inherit the program's
# standard output and hold a pipe open long after the program has ended.
client() {
  timeout 60 "${run[@]}" "$client" "$@" >"$work/client.out" 2>&1
  local rc=$?
  cat "$work/client.out"
  return $rc
}

fail() {
  echo "FAIL: $*"
  failures=$((failures + 1))
}

# expect NAME EXPECTED_RC PATTERN... -- ARGS: runs the client, checks its exit
# code and that its output holds every pattern.
expect() {
  local name=$1 rc_wanted=$2
  shift 2
  local patterns=()
  while [ "$1" != "--" ]; do
    patterns+=("$1")
    shift
  done
  shift
  local out rc
  out=$(client "$@")
  rc=$?
  echo "== $name: skyvane $* -> exit $rc"
  echo "$out" | sed 's/^/   /'
  [ "$rc" = "$rc_wanted" ] || fail "$name: exit $rc, wanted $rc_wanted"
  for pattern in "${patterns[@]}"; do
    grep -qF -- "$pattern" <<<"$out" || fail "$name: no '$pattern' in the output"
  done
}

"${run[@]}" "$service" -debug >"$work/service.out" 2>&1 &
service_pid=$!

# The channel is up once a request gets its answer.
up=0
for _ in $(seq 1 300); do
  if client send 10920 4 | grep -q "result: 4294966519"; then
    up=1
    break
  fi
  kill -0 "$service_pid" 2>/dev/null || break
  sleep 0.2
done
if [ "$up" != 1 ]; then
  echo "FAIL: the service's pipe never answered"
  cat "$work/service.out"
  exit 1
fi
# Let the first rescan finish: it ends by setting the status word itself.
client status --wait-open --wait-status 102 --timeout-ms 60000 >/dev/null ||
  echo "note: status word did not reach 102; going on"

expect set-status 0 "result: 1" -- set-status 4321
expect status-readback 0 "4321" -- status --wait-status 4321 --timeout-ms 10000
expect pause 0 "result: 0 (done)" -- pause
expect resume 0 "result: 0 (done)" -- resume

value="SkyvaneE2E-$$"
expect reg-set 0 "result: 0 (success)" -- reg set HKCU "$value" sz "hello through the pipe"
expect reg-get 0 "result: 0 (success)" "data: hello through the pipe" -- reg get HKCU "$value"
expect reg-set-dword 0 "result: 0 (success)" -- reg set HKCU "$value-n" dword 0x1234
expect reg-get-dword 0 "data: 4660" -- reg get HKCU "$value-n"
expect reg-get-missing 1 "result: 2 (not found)" -- reg get HKCU "$value-absent"

expect short-request 0 "reply length: 0" -- send 9895 10 77
expect unknown-code-1 0 "result: 4294966519" "detail: 4294966519" -- send 10920 4
expect unknown-code-2 0 "result: 4294966519" "detail: 4294966519" -- send 10920 5
# The short request changed nothing.
expect status-unchanged 0 "4321" -- status

if ! kill -0 "$service_pid" 2>/dev/null; then
  fail "the service ended during the test"
  cat "$work/service.out"
fi
if [ "$failures" != 0 ]; then
  echo "$failures check(s) failed"
  exit 1
fi
echo "all checks passed"
