#!/usr/bin/env bash
# Fuzzes the command channel's parsers (the command message through the
# dispatcher, and the registry request) with libFuzzer under ASan + UBSan for
# SECONDS (default 300), starting from the committed corpus. New inputs go to
# build/host-fuzz/corpus; a crash leaves its input in the current folder.
set -euo pipefail
cd "$(dirname "$0")/.."
bash scripts/install-deps.sh host
cmake --preset host-fuzz >/dev/null
cmake --build --preset host-fuzz -j "${SKYVANE_JOBS:-2}" --target pipe_fuzzer
mkdir -p build/host-fuzz/corpus
export SKYVANE_NAMESPACE="pipefuzz-$$" SKYVANE_REGISTRY="$PWD/build/host-fuzz/registry"
trap 'rm -f /dev/shm/"$SKYVANE_NAMESPACE" /dev/shm/"$SKYVANE_NAMESPACE".*' EXIT
build/host-fuzz/tests/fuzz/pipe_fuzzer -max_total_time="${1:-300}" -print_final_stats=1 \
  build/host-fuzz/corpus tests/fuzz/corpus
