#!/bin/sh
# Under Wine's service control manager; needs WINEPREFIX.
set -u
SVC=$1
CLIENT=$2
RUN=w
. "$(dirname "$0")/e2e_lib.sh"
# Never leave the service installed in the shared prefix.
CLEANUP='w "$SVC" -remove >/dev/null 2>&1'
has_line() { tr -d '\r' <"$2" | grep -qx -- "$1"; }
has_match() { tr -d '\r' <"$2" | grep -q -- "$1"; }
sc_state() { w sc query SkyvaneSvc 2>/dev/null | tr -d '\r' | grep -q "STATE *: *[0-9]* *$1"; }
wait_state() { within 120 sc_state "$1"; }

# The holder also keeps the prefix's wineserver (and so the service) up.
start_holder
w "$SVC" -install >"$WORK/install.txt" 2>&1
has_line "Skyvane Service installed." "$WORK/install.txt" || fail "install line"
has_line "Added description for Skyvane Service." "$WORK/install.txt" || fail "description line"
has_line "Started service: Skyvane Service" "$WORK/install.txt" || fail "start line"
live_block
holder_holds
w sc stop SkyvaneSvc >"$WORK/stop.txt" 2>&1 || fail "sc stop"
wait_state STOPPED || fail "service did not stop"
holder_saw_500

# A stop while a client streams gauge refreshes (command 9) takes 5 s at most.
w sc start SkyvaneSvc >/dev/null 2>&1
wait_state RUNNING || fail "service did not start for the streaming stop"
(while :; do w "$CLIENT" send 10920 9 0 1 >/dev/null 2>&1 || sleep 0.1; done) &
STREAM_PID=$!
sleep 2
w sc stop SkyvaneSvc >"$WORK/stop2.txt" 2>&1
# Whole seconds: each query starts a Wine process.
START=$(date +%s)
wait_state STOPPED || fail "service did not stop while a client streamed"
ELAPSED=$(($(date +%s) - START))
kill "$STREAM_PID" 2>/dev/null
wait "$STREAM_PID" 2>/dev/null
[ "$ELAPSED" -le 5 ] || fail "stop took $ELAPSED s while a client streamed"

w "$SVC" -install >"$WORK/install2.txt" 2>&1
has_match "^CreateService failed - .* (0x431)$" "$WORK/install2.txt" || fail "second install"

w sc start SkyvaneSvc >/dev/null 2>&1
wait_state RUNNING || fail "service did not start again"
w "$SVC" -remove >"$WORK/remove.txt" 2>&1
has_match "^Stopping Skyvane Service\." "$WORK/remove.txt" || fail "remove did not stop"
has_match "Skyvane Service stopped\.$" "$WORK/remove.txt" || fail "stopped line"
has_line "Skyvane Service removed." "$WORK/remove.txt" || fail "removed line"
w sc query SkyvaneSvc >/dev/null 2>&1 && fail "service still installed"

# Installed from a path with blanks, the image path is quoted.
mkdir -p "$WORK/with blanks"
cp "$SVC" "$WORK/with blanks/SkyvaneSvc.exe"
w "$WORK/with blanks/SkyvaneSvc.exe" -install >"$WORK/install3.txt" 2>&1
has_line "Skyvane Service installed." "$WORK/install3.txt" || fail "install from a path with blanks"
w reg query 'HKLM\System\CurrentControlSet\Services\SkyvaneSvc' /v ImagePath >"$WORK/image.txt" 2>&1
has_match 'ImagePath.*REG_\(EXPAND_\)\{0,1\}SZ *".*with blanks.SkyvaneSvc\.exe"$' "$WORK/image.txt" ||
  fail "image path not quoted"
w "$WORK/with blanks/SkyvaneSvc.exe" -remove >"$WORK/remove3.txt" 2>&1
has_line "Skyvane Service removed." "$WORK/remove3.txt" || fail "remove after install with blanks"

# Nothing of ours keeps running (Wine shows a program as its Windows path).
OURS='^[A-Za-z]:.*[\\/](SkyvaneSvc|skyvane)\.exe'
within 100 eval '! pgrep -f "$OURS" >/dev/null' || fail "a process was left behind: $(pgrep -af "$OURS")"
echo "e2e wine: ok"
