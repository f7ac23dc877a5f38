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
  pipe) seeds=tests/fuzz/corpus ;;
  drive) seeds=tests/fuzz/corpus_drives ;;
  *) echo "usage: $0 [pipe|drive] [SECONDS] [libFuzzer options]" >&2; exit 2 ;;
esac
bash scripts/install-deps.sh host
# Optimised as fuzzing wants it: -O1 keeps the sanitizers' reports exact.
cmake --preset host-fuzz -DCMAKE_CXX_FLAGS_DEBUG="-g -O1" -DCMAKE_C_FLAGS_DEBUG="-g -O1" >/dev/null
cmake --build --preset host-fuzz -j "${SKYVANE_JOBS:-2}" --target "${target}_fuzzer"
mkdir -p "build/host-fuzz/corpus-$target"
export SKYVANE_NAMESPACE="${target}fuzz-$$" SKYVANE_REGISTRY="$PWD/build/host-fuzz/registry-$$"
trap 'rm -rf /dev/shm/"$SKYVANE_NAMESPACE" /dev/shm/"$SKYVANE_NAMESPACE".* "$SKYVANE_REGISTRY"' EXIT
"build/host-fuzz/tests/fuzz/${target}_fuzzer" -max_total_time="$seconds" -print_final_stats=1 \
  "$@" "build/host-fuzz/corpus-$target" "$seeds"
