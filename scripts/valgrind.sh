#!/usr/bin/env bash
# Runs the tool's main paths under valgrind's memcheck in the fake device root
# (tests/fault/valgrind_paths.cpp): no invalid access, no leak but those listed in
# tests/fault/valgrind.supp. Installs valgrind when missing and first builds the plain build
# directory given (default: build). Run as root.
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/install_missing.sh
build_dir=${1:-build}
if [ "$(id -u)" -ne 0 ]; then
  echo "valgrind: skipped, the fake device root needs root"
  exit 0
fi
install_missing valgrind
start=$SECONDS
cmake --build "$build_dir" -j"$(nproc)" --target valgrind_paths >/dev/null
"$build_dir/valgrind_paths"
echo "valgrind: $((SECONDS - start)) s"
