#!/usr/bin/env bash
# Fuzzes the command channel with libFuzzer under ASan + UBSan, starting from
# the committed corpus:
#   scripts/fuzz.sh [pipe|drive] [SECONDS] [extra libFuzzer options...]
# pipe (default): the command message through the dispatcher, and the
#   registry request; drive: the commands that reach the drives of the
#   embedded default machine. SECONDS defaults to 300. New inputs go to
#   build/host-fuzz/corpus-<target>; a crash leaves its input in the current
#   folder.
set -euo pipefail
cd "$(dirname "$0")/.."
target="${1:-pipe}"
seconds="${2:-300}"
shift $(($# < 2 ? $# : 2))
case "$target" in
  pipe) seeds=tests/fuzz/corpus options=() ;;
  # The drive target keeps the machine and its records from one input to the
  # next, so a leak check after each input would only find that state.
  drive) seeds=tests/fuzz/corpus_drives options=(-detect_leaks=0) ;;
  *) echo "usage: $0 [pipe|drive] [SECONDS] [libFuzzer options]" >&2; exit 2 ;;
esac
bash scripts/install-deps.sh host
# Optimised (-O1), as libFuzzer advises: unoptimised, the targets run several
# times slower.
cmake --preset host-fuzz -DCMAKE_CXX_FLAGS_DEBUG="-g -O1" -DCMAKE_C_FLAGS_DEBUG="-g -O1" >/dev/null
cmake --build --preset host-fuzz -j "${SKYVANE_JOBS:-2}" --target "${target}_fuzzer"
mkdir -p "build/host-fuzz/corpus-$target"
# The registry store is read and written on every registry call: keep it in
# memory.
export SKYVANE_NAMESPACE="${target}fuzz-$$" SKYVANE_REGISTRY="/dev/shm/${target}fuzz-$$-registry"
trap 'rm -f "$SKYVANE_REGISTRY"*' EXIT
"build/host-fuzz/tests/fuzz/${target}_fuzzer" -max_total_time="$seconds" -print_final_stats=1 \
  "${options[@]}" "$@" "build/host-fuzz/corpus-$target" "$seeds"
