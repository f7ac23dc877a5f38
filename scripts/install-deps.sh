#!/usr/bin/env bash
# Installs what the build and the tests need, from Debian's packages, when it
# is missing. `host` installs the host toolchain only; `all` (default) adds the
# mingw-w64 cross compiler and Wine for the Windows build.
set -euo pipefail

want=(cmake make g++ googletest libgtest-dev clang libclang-rt-14-dev libcli11-dev nlohmann-json3-dev tmux)
if [ "${1:-all}" = all ]; then
  want+=(g++-mingw-w64-x86-64-posix wine wine64)
fi

missing=()
for pkg in "${want[@]}"; do
  dpkg-query -W -f='${Status}' "$pkg" 2>/dev/null | grep -q "ok installed" || missing+=("$pkg")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "Installing: ${missing[*]}"
  sudo_cmd=""
  [ "$(id -u)" -eq 0 ] || sudo_cmd="sudo"
  export DEBIAN_FRONTEND=noninteractive
  $sudo_cmd apt-get update -qq
  $sudo_cmd apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
fi
