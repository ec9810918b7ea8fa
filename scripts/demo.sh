#!/usr/bin/env bash
# The main job: installs what is missing, builds, and takes a simulated phone through a whole
# crash cycle with the real binary (enable, first boot, crash, second boot, third boot), then
# opens the collected dump with ramdump_inspect and recovers a message the boot run missed.
# Exits 0 only when every file the inspector extracts equals what the firmware stored.
# Run as root: it mounts a 16 GiB sparse ext4 image on a loop device in a private mount
# namespace and removes everything again when it ends.
set -euo pipefail
cd "$(dirname "$0")/.."
if [ "$(id -u)" -ne 0 ]; then
  echo "demo.sh: run as root (loop devices, mounts, chroot)" >&2
  exit 1
fi
bash scripts/setup.sh build >/dev/null
exec build/crash_cycle_demo
