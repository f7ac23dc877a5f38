#!/usr/bin/env bash
# Checks formatting (clang-format) and runs clang-tidy over the service and
# platform sources, using the configurations in the repository and the
# compile commands of the host-debug build.
set -uo pipefail
cd "$(dirname "$0")/.."
[ -f build/host-debug/compile_commands.json ] || cmake --preset host-debug >/dev/null
files=$(git ls-files 'src/*.cpp' 'src/*.h' 'sim/*.cpp' 'sim/*.h' 'tools/*.cpp' 'tests/*.cpp' 'tests/*.h')
status=0
clang-format --dry-run --Werror $files || status=1
if [ "${1:-}" != --format-only ]; then
  git ls-files 'src/*.cpp' | grep -v '^src/platform/windows/' |
    xargs -P 2 -n 8 clang-tidy -p build/host-debug --quiet 2>/dev/null | grep -E "warning:|error:" && status=1
fi
exit $status
