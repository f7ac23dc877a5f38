#!/bin/sh
# Stop/start cycles of the service on the simulated machine under faults and
# load (see tests/stress/stress_main.cpp).
#   scripts/stress.sh [--short] [--preset host-debug|host-asan|host-tsan] [stress options...]
# --short runs what CTest runs; otherwise 1000 cycles. With the host-tsan
# preset, ThreadSanitizer reports end the run with a failure.
set -eu
ROOT=$(cd "$(dirname "$0")/.." && pwd)
PRESET=host-debug
CYCLES=1000
EXTRA=
while [ $# -gt 0 ]; do
  case $1 in
    --short) CYCLES=12; EXTRA="--run-ms 200 --no-held-cancels" ;;
    --preset) PRESET=$2; shift ;;
    *) break ;;
  esac
  shift
done
cd "$ROOT"
cmake --preset "$PRESET" >/dev/null
nice -n 5 cmake --build --preset "$PRESET" -j2 --target stress >/dev/null
export SKYVANE_TIME_SCALE=${SKYVANE_TIME_SCALE:-0.01}
export SKYVANE_NAMESPACE="stress-$$"
export TSAN_OPTIONS="${TSAN_OPTIONS:-} halt_on_error=1 exitcode=66"
# shellcheck disable=SC2086
"build/$PRESET/tests/stress/stress" --cycles "$CYCLES" $EXTRA "$@"
