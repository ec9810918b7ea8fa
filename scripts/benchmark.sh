#!/usr/bin/env bash
# Times the tool's heavy operations and the dump inspector's commands at full size against
# baselines of the same I/O, with the device bytes and CPU time of every step, and writes
# bench/results.md. Not part of CI: five runs write and read about 150 GiB and take half an hour
# or more. Run as root.
#   bash scripts/benchmark.sh [--build DIR] [--runs N] [--out FILE]
set -euo pipefail
cd "$(dirname "$0")/.."
if [ "$(id -u)" -ne 0 ]; then
  echo "benchmark.sh: run as root (loop devices, mounts, chroot)" >&2
  exit 1
fi
build=build
if [ "${1:-}" = "--build" ]; then
  build=$2
  shift 2
fi
# A fresh clone gets its packages and a full build; later runs rebuild only what is timed.
[ -f "$build/CMakeCache.txt" ] || bash scripts/setup.sh "$build" >/dev/null
cmake --build "$build" -j"$(nproc)" --target benchmark >/dev/null
mkdir -p bench
exec "$build/benchmark" --out bench/results.md "$@"
