#!/usr/bin/env bash
# Benchmark: the platform's floor and the service's figures, measured in the
# same run on the same platform, for the host build (optimised) and for the
# Windows build under Wine. Prints one table per platform and writes the same
# figures as JSON to build/bench-host.json and build/bench-wine.json.
#
#   scripts/bench.sh [--quick] [--host-only]
#
# --quick proves that everything runs (few iterations, 3 s idle); the full
# run takes about three minutes. No figure is checked against a threshold.
set -uo pipefail
cd "$(dirname "$0")/.."
quick=()
platforms=(host wine)
for arg in "$@"; do
  case $arg in
    --quick) quick=(--quick) ;;
    --host-only) platforms=(host) ;;
    *) echo "usage: scripts/bench.sh [--quick] [--host-only]" >&2; exit 2 ;;
  esac
done
mode=all
[ "${platforms[*]}" = host ] && mode=host
bash scripts/install-deps.sh "$mode" || exit 1

status=0
for platform in "${platforms[@]}"; do
  if [ "$platform" = host ]; then
    cmake --preset host-release >/dev/null &&
      cmake --build --preset host-release -j2 --target skyvane_bench SkyvaneSvc >/dev/null || exit 1
    work=$(mktemp -d)
    echo "== host (Linux, the emulation; optimised build)"
    SKYVANE_NAMESPACE="bench-$$" SKYVANE_REGISTRY="$work/registry" \
      build/host-release/bench/skyvane_bench "${quick[@]}" --json build/bench-host.json \
      --service build/host-release/SkyvaneSvc || status=1
    rm -rf "$work"
  else
    cmake --preset windows >/dev/null &&
      cmake --build --preset windows -j2 --target skyvane_bench SkyvaneSvc >/dev/null || exit 1
    echo "== Windows build under Wine"
    export WINEPREFIX="$PWD/build/windows/wineprefix" WINEDLLOVERRIDES="mscoree,mshtml=" WINEDEBUG=-all
    mkdir -p "$WINEPREFIX"
    wineboot --init >/dev/null 2>&1
    timeout -k 10 600 wine build/windows/bench/skyvane_bench.exe "${quick[@]}" \
      --json build/bench-wine.json --service build/windows/SkyvaneSvc.exe | tr -d '\r' || status=1
    wineserver -k 2>/dev/null || true
  fi
done
exit $status
