#!/usr/bin/env bash
# Builds the host flavour of the service and runs it in the foreground on the
# simulated computer's embedded default machine (Ctrl+C stops it). Pass
# --machine FILE to run it on another machine description.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh host
cmake --preset host-debug >/dev/null
cmake --build --preset host-debug -j "${SKYVANE_JOBS:-2}" --target SkyvaneSvc skyvane

if [ "${1:-}" = --machine ]; then
  export SKYVANE_MACHINE="$(realpath "$2")"
  shift 2
fi
export SKYVANE_NAMESPACE="${SKYVANE_NAMESPACE:-skyvane-demo}"
echo "Service running; in another terminal: SKYVANE_NAMESPACE=$SKYVANE_NAMESPACE build/host-debug/tools/skyvane/skyvane status"
exec build/host-debug/SkyvaneSvc -debug "$@"
