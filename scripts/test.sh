#!/usr/bin/env bash
# Builds and runs every test suite: the host build, the host build under
# AddressSanitizer + UndefinedBehaviorSanitizer and under ThreadSanitizer, and
# the Windows build under Wine. Exits non-zero when any suite fails.
set -uo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh all || exit 1

presets=(${SKYVANE_PRESETS:-host-debug host-asan host-tsan windows})
jobs=${SKYVANE_JOBS:-2}
failed=()
for preset in "${presets[@]}"; do
  echo "==== ${preset}: configure and build"
  if ! cmake --preset "$preset" >/dev/null || ! cmake --build --preset "$preset" -j "$jobs"; then
    failed+=("$preset (build)")
    continue
  fi
  echo "==== ${preset}: test"
  ctest_jobs=$jobs
  [ "$preset" = windows ] && ctest_jobs=1
  if ! ctest --preset "$preset" -j "$ctest_jobs"; then
    failed+=("$preset")
  fi
done

# No Wine process may outlive the run.
if command -v wineserver >/dev/null && [ -d build/windows/wineprefix ]; then
  WINEPREFIX="$PWD/build/windows/wineprefix" wineserver -k 2>/dev/null || true
fi

if [ ${#failed[@]} -gt 0 ]; then
  echo "FAILED: ${failed[*]}"
  exit 1
fi
echo "All suites passed: ${presets[*]}"
