#!/usr/bin/env bash
# Installs what a fresh Debian 12 machine lacks for building and testing reserveblocks, then
# configures and builds into the given directory (default: build) with any extra CMake
# arguments. Needs root for the package installation.
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/install_missing.sh

build_dir=${1:-build}
shift || true

packages=(cmake g++ make pkg-config zlib1g-dev libgtest-dev googletest
  android-libbase-dev android-liblog-dev android-libcutils-dev
  e2fsprogs util-linux mount dmsetup)
install_missing "${packages[@]}"

cmake -S . -B "$build_dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo "$@" >/dev/null
cmake --build "$build_dir" -j"$(nproc)"
