#!/bin/sh
# `skyvane watch` in a tmux terminal shows what the `sim` verbs did to the
# service's simulated machine.
set -u
SVC=$1
CLIENT=$2
. "$(dirname "$0")/e2e_lib.sh"
private_emulation e2e-watch
# Ticks of 300 ms: watch (which looks every 100 ms) sees every publish.
export SKYVANE_TIME_SCALE=0.3
SOCKET="skyvane-e2e-watch-$$"
CLEANUP='tmux -L "$SOCKET" kill-server 2>/dev/null; rm -f "${TMUX_TMPDIR:-/tmp}/tmux-$(id -u)/$SOCKET"'
screen() { tmux -L "$SOCKET" capture-pane -p -t watch; }
SHOW='echo "--- screen"; screen'
on_screen() { screen | grep -Eq -- "$1"; }
appears() { within "${2:-600}" on_screen "$1"; }
shows() { appears "$1" || fail "the screen never showed /$1/ ($2)"; }
# A press while a rescan reopens the drive's channel is lost, as on the device.
press_until() {
  for _ in 1 2 3 4 5; do
    sim press "$1" "$2"
    appears "$3" 150 && return 0
  done
  fail "pressing $2 on $1 never showed /$3/"
}
drive_rows() { screen | sed -n '/^Drives/,/^Channels/p'; }
sim() { client sim "$@" >"$WORK/sim.txt" 2>&1 || fail "sim $* exited $?"; }
# A refused request: exit 2, one line on stderr, nothing on stdout.
refused() {
  client sim "$@" >"$WORK/out.txt" 2>"$WORK/err.txt"
  rc=$?
  [ $rc = 2 ] || fail "sim $*: exit $rc, wanted 2"
  [ "$(wc -l <"$WORK/err.txt")" = 1 ] || fail "sim $*: not one line on stderr"
  [ -s "$WORK/out.txt" ] && fail "sim $*: wrote to stdout"
  return 0
}

refused list # no service running yet
grep -q "no simulated machine answers" "$WORK/err.txt" || fail "no-service message"

start_service
client status --wait-open --wait-status 102 --timeout-ms 60000 >/dev/null 2>&1 || fail "service never ready"

tmux -L "$SOCKET" new-session -d -s watch -x 132 -y 60 \
  -e SKYVANE_NAMESPACE="$SKYVANE_NAMESPACE" -e SKYVANE_TIME_SCALE="$SKYVANE_TIME_SCALE" \
  "$CLIENT watch --wait-open" || fail "tmux did not start"
tmux -L "$SOCKET" set-option -t watch remain-on-exit on >/dev/null
shows "status word 102: ready" "first view"
shows "^  [0-9]+ +E: .*\[[#-]{4}\]" "gauge drive with its 4-segment bar"

sim fill E 80
shows "^  [0-9]+ +E: .*\[###-\]  80%" "E: at 80 %"

press_until gauge eject "went away \(E:\)"
drive_rows | grep -q " E: " && fail "E: still listed after the eject"
sim plug gauge
shows "^  [0-9]+ +E: " "E: back after plug"

# Another program holds the volume: the removal fails, the status word says so.
sim hold E
press_until gauge eject "status word 60[0-9]: removal of drive [0-9]+ failed"
drive_rows | grep -q " E: " || fail "E: gone although the removal failed"
sim release E

sim unplug firewire
within 600 eval '! drive_rows | grep -q " H: "' || fail "H: still listed after the unplug"
sim sleep enclosure 2
shows "^  [0-9]+ +I: .* 2 *$" "sleep state 2 on I:"

printf 'drive spare\n  bus usb\n  channel hid\n  serial QX-5P4R3S21\n  volume J fixed 250G 200G\nend\n' >"$WORK/spare.txt"
sim add "$WORK/spare.txt"
shows "arrived \(J:\)" "added drive"

# Bad input changes nothing and says why in one line.
printf 'drive x\n  bus usb\n  nonsense key\nend\n' >"$WORK/bad.txt"
client sim list --json >"$WORK/before.txt" 2>&1 || fail "sim list --json"
grep -q '"name": "gauge"' "$WORK/before.txt" || fail "list --json has no gauge drive"
while read -r args; do
  # shellcheck disable=SC2086 # the row is the argument list
  refused $args
done <<ROWS
press nosuch eject
press 99 eject
press gauge nosuch
press enclosure panel1
fill E 101
fill E -1
fill Q 50
status gauge 12zz5678
status gauge 1234
sleep gauge 4
fault gauge melt
fault gauge slow-cancel x
plug gauge
unplug firewire
hold 1
add $WORK/absent.txt
add $WORK/spare.txt
add $WORK/bad.txt
ROWS
client sim list --json >"$WORK/after.txt" 2>&1 || fail "sim list --json after"
cmp -s "$WORK/before.txt" "$WORK/after.txt" || fail "bad input changed the machine"

# Without a terminal: plain text, no escape codes.
client watch --once >"$WORK/plain.txt" 2>&1 || fail "watch --once"
grep -q "status word" "$WORK/plain.txt" || fail "watch --once printed no view"
grep -q "$(printf '\033')" "$WORK/plain.txt" && fail "escape codes in plain output"

# A hung device does not keep the service from stopping.
sim fault enclosure hang
sim press enclosure eject
stop_service 300
shows "status word 500: stopped" "stopped"
echo "e2e watch: ok"
