#!/usr/bin/env bash
# Times creation, arming, read-out, the integrity test and a second boot at full size against
# baselines of the same I/O, and writes bench/results.md. Not part of CI: it writes and reads
# about 40 GiB per run and takes several minutes. Run as root.
#   bash scripts/benchmark.sh [--runs N]
set -euo pipefail
cd "$(dirname "$0")/.."
if [ "$(id -u)" -ne 0 ]; then
  echo "benchmark.sh: run as root (loop devices, mounts, chroot)" >&2
  exit 1
fi
source scripts/install_missing.sh
install_missing strace
bash scripts/setup.sh build >/dev/null
mkdir -p bench
exec build/benchmark --out bench/results.md "$@"
