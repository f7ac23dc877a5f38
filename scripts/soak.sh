#!/usr/bin/env bash
# Soak of the host build's emulated kernel: clients streaming commands to the
# running service are killed with SIGKILL at random moments. After each kill
# the service must answer a fresh client within 100 ms; at the end it must
# stop within 2 s on SIGINT, and nothing of the namespace may be left (no
# file in /dev/shm, no socket name of the namespace).
#
#   scripts/soak.sh [--kills N] [--clients N] [--limit-ms MS] [SERVICE CLIENT SOAK_CLIENT]
#
# --limit-ms (default 100) is the answer time allowed after a kill; builds
# under a sanitizer run several times slower and are given more.
#
# Without the three programs it uses build/host-debug (building it first).
set -uo pipefail
kills=200
clients=3
limit_ms=100
while [ $# -gt 0 ]; do
  case $1 in
    --kills) kills=$2; shift 2 ;;
    --clients) clients=$2; shift 2 ;;
    --limit-ms) limit_ms=$2; shift 2 ;;
    *) break ;;
  esac
done
if [ $# -eq 3 ]; then
  svc=$1 client=$2 soak_client=$3
else
  root=$(cd "$(dirname "$0")/.." && pwd)
  (cd "$root" && cmake --preset host-debug >/dev/null && cmake --build --preset host-debug -j2 \
    --target SkyvaneSvc skyvane soak_client >/dev/null) || exit 1
  svc=$root/build/host-debug/SkyvaneSvc
  client=$root/build/host-debug/tools/skyvane/skyvane
  soak_client=$root/build/host-debug/tests/soak/soak_client
fi

work=$(mktemp -d)
export SKYVANE_NAMESPACE="soak-$$"
export SKYVANE_REGISTRY="$work/registry"
export SKYVANE_TIME_SCALE=0.1
svc_pid=
streamers=()
cleanup() {
  for pid in "${streamers[@]}" $svc_pid; do kill -9 "$pid" 2>/dev/null; done
  wait 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT
fail() {
  echo "FAIL: $*"
  [ -f "$work/service.txt" ] && { echo "--- service output"; tail -20 "$work/service.txt"; }
  if [ -n "$svc_pid" ] && kill -0 "$svc_pid" 2>/dev/null && command -v gdb >/dev/null; then
    echo "--- service threads"
    gdb -p "$svc_pid" -batch -ex 'thread apply all bt 8' 2>/dev/null | grep -E '^(Thread|#)' | head -80
  fi
  exit 1
}
names_left() { grep -c "@skyvane:$SKYVANE_NAMESPACE:" /proc/net/unix; }

"$svc" -debug >"$work/service.txt" 2>&1 &
svc_pid=$!
"$client" status --wait-open --wait-status 102 --timeout-ms 30000 >/dev/null 2>&1 ||
  fail "the service did not come up"

start_streamer() {
  "$soak_client" stream >/dev/null 2>&1 &
  streamers[$1]=$!
}
for ((i = 0; i < clients; i++)); do start_streamer $i; done

slowest=0
for ((k = 1; k <= kills; k++)); do
  sleep "0.0$((RANDOM % 10))$((RANDOM % 10))"
  victim=$((RANDOM % clients))
  kill -9 "${streamers[$victim]}" 2>/dev/null
  wait "${streamers[$victim]}" 2>/dev/null
  kill -0 "$svc_pid" 2>/dev/null || fail "the service died at kill $k"
  took=$("$soak_client" probe "$limit_ms") ||
    fail "no answer within $limit_ms ms after kill $k (${took:-none} ms)"
  awk -v a="$took" -v b="$slowest" 'BEGIN { exit !(a > b) }' && slowest=$took
  start_streamer "$victim"
done
for pid in "${streamers[@]}"; do kill -9 "$pid" 2>/dev/null; done
wait "${streamers[@]}" 2>/dev/null
streamers=()

kill -INT "$svc_pid"
for ((t = 0; t < 20; t++)); do
  kill -0 "$svc_pid" 2>/dev/null || break
  sleep 0.1
done
kill -0 "$svc_pid" 2>/dev/null && fail "the service did not stop within 2 s"
wait "$svc_pid"
rc=$?
svc_pid=
[ $rc = 0 ] || fail "the service exit code was $rc"
ls /dev/shm | grep -q "$SKYVANE_NAMESPACE" && fail "files left in /dev/shm"
[ "$(names_left)" = 0 ] || fail "socket names of the namespace left"
echo "soak: $kills kills of $clients streaming clients; slowest answer after a kill ${slowest} ms; stopped cleanly"
