#!/bin/sh
# The Windows executable installed, started, read, stopped and removed under
# Wine's own service control manager. Needs WINEPREFIX (the build's prefix).
set -u
SVC=$1
CLIENT=$2
WORK=$(mktemp -d)
HOLDER_PID=
w() { timeout -k 5 120 wine "$@"; }
cleanup() {
  [ -n "$HOLDER_PID" ] && kill -9 "$HOLDER_PID" 2>/dev/null
  # Never leave the service installed in the shared prefix.
  w "$SVC" -remove >/dev/null 2>&1
  rm -rf "$WORK"
}
trap cleanup EXIT
fail() {
  echo "FAIL: $*"
  for f in "$WORK"/*; do [ -f "$f" ] && { echo "--- $f"; cat "$f"; }; done
  exit 1
}
field() { sed -n "s/^  \"$1\": \([0-9]*\),*\r*$/\1/p" "$2"; }
has_line() { tr -d '\r' <"$2" | grep -qx -- "$1"; }
wait_state() {  # wait until sc reports state $1
  i=0
  until w sc query SkyvaneSvc 2>/dev/null | tr -d '\r' | grep -q "STATE *: *[0-9]* *$1"; do
    i=$((i + 1))
    [ $i -gt 60 ] && return 1
    sleep 0.5
  done
}

# A client holds the block from the service's start across its stop; it
# also keeps the prefix's wineserver (and so the service) up meanwhile.
w "$CLIENT" status --json --wait-open --wait-status 500 --timeout-ms 90000 >"$WORK/last.json" 2>"$WORK/holder.txt" &
HOLDER_PID=$!

w "$SVC" -install >"$WORK/install.txt" 2>&1
has_line "Skyvane Service installed." "$WORK/install.txt" || fail "install line"
has_line "Added description for Skyvane Service." "$WORK/install.txt" || fail "description line"
has_line "Started service: Skyvane Service" "$WORK/install.txt" || fail "start line"

w "$CLIENT" status --json --wait-open --wait-status 102 --timeout-ms 60000 >"$WORK/live.json" 2>"$WORK/live.txt" ||
  fail "no live block with statusWord 102"
[ "$(field size "$WORK/live.json")" = 1215512 ] || fail "block size"
SEQ=$(field sequence "$WORK/live.json")
w "$CLIENT" status --json --wait-sequence $((SEQ + 1)) --timeout-ms 30000 >"$WORK/live2.json" 2>&1 ||
  fail "sequence did not grow"
i=0
until grep -q "holding the state block" "$WORK/holder.txt" 2>/dev/null; do
  i=$((i + 1))
  [ $i -gt 600 ] && fail "holder did not open the block"
  sleep 0.1
done

w sc stop SkyvaneSvc >"$WORK/stop.txt" 2>&1 || fail "sc stop"
wait_state STOPPED || fail "service did not stop"
wait $HOLDER_PID || fail "holder did not see statusWord 500"
HOLDER_PID=
[ "$(field statusWord "$WORK/last.json")" = 500 ] || fail "last statusWord"

# A stop while a client streams gauge refreshes (command 9 aborts on the
# pipe stop) reaches STOPPED within 5 s.
w sc start SkyvaneSvc >/dev/null 2>&1
wait_state RUNNING || fail "service did not start for the streaming stop"
(while :; do w "$CLIENT" send 10920 9 0 1 >/dev/null 2>&1 || sleep 0.1; done) &
STREAM_PID=$!
sleep 2
w sc stop SkyvaneSvc >"$WORK/stop2.txt" 2>&1
# Counted from the delivered control; each query starts a Wine process, so
# the bound is checked in whole seconds.
START=$(date +%s)
wait_state STOPPED || fail "service did not stop while a client streamed"
ELAPSED=$(($(date +%s) - START))
kill "$STREAM_PID" 2>/dev/null
wait "$STREAM_PID" 2>/dev/null
[ "$ELAPSED" -le 5 ] || fail "stop took $ELAPSED s while a client streamed"

# Installing again names the existing service.
w "$SVC" -install >"$WORK/install2.txt" 2>&1
tr -d '\r' <"$WORK/install2.txt" | grep -q "^CreateService failed - .* (0x431)$" || fail "second install"

# -remove stops a running service, then deletes it.
w sc start SkyvaneSvc >/dev/null 2>&1
wait_state RUNNING || fail "service did not start again"
w "$SVC" -remove >"$WORK/remove.txt" 2>&1
tr -d '\r' <"$WORK/remove.txt" | grep -q "^Stopping Skyvane Service\." || fail "remove did not stop"
tr -d '\r' <"$WORK/remove.txt" | grep -q "Skyvane Service stopped\.$" || fail "stopped line"
has_line "Skyvane Service removed." "$WORK/remove.txt" || fail "removed line"
w sc query SkyvaneSvc >/dev/null 2>&1 && fail "service still installed"

# Installed from a path with blanks, the image path is quoted.
mkdir -p "$WORK/with blanks"
cp "$SVC" "$WORK/with blanks/SkyvaneSvc.exe"
w "$WORK/with blanks/SkyvaneSvc.exe" -install >"$WORK/install3.txt" 2>&1
has_line "Skyvane Service installed." "$WORK/install3.txt" || fail "install from a path with blanks"
w reg query 'HKLM\System\CurrentControlSet\Services\SkyvaneSvc' /v ImagePath >"$WORK/image.txt" 2>&1
tr -d '\r' <"$WORK/image.txt" | grep -q 'ImagePath.*REG_EXPAND_SZ *".*with blanks.SkyvaneSvc\.exe"$' ||
  tr -d '\r' <"$WORK/image.txt" | grep -q 'ImagePath.*REG_SZ *".*with blanks.SkyvaneSvc\.exe"$' ||
  fail "image path not quoted"
w "$WORK/with blanks/SkyvaneSvc.exe" -remove >"$WORK/remove3.txt" 2>&1
has_line "Skyvane Service removed." "$WORK/remove3.txt" || fail "remove after install with blanks"

# Nothing of ours keeps running (Wine shows a program as its Windows path).
OURS='^[A-Za-z]:.*[\\/](SkyvaneSvc|skyvane)\.exe'
i=0
while pgrep -f "$OURS" >/dev/null; do
  i=$((i + 1))
  [ $i -gt 100 ] && fail "a process was left behind: $(pgrep -af "$OURS")"
  sleep 0.1
done
echo "e2e wine: ok"
