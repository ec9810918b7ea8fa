#!/usr/bin/env bash
# Installs what a fresh Debian 12 machine lacks for building and testing reserveblocks, then
# configures and builds into the given directory (default: build) with any extra CMake
# arguments. Needs root for the package installation.
set -euo pipefail
cd "$(dirname "$0")/.."

build_dir=${1:-build}
shift || true

packages=(cmake g++ make pkg-config zlib1g-dev libgtest-dev googletest
  android-libbase-dev android-liblog-dev android-libcutils-dev
  e2fsprogs util-linux mount)
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "installing: ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq "${missing[@]}" >/dev/null
fi

cmake -S . -B "$build_dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo "$@" >/dev/null
cmake --build "$build_dir" -j"$(nproc)"
