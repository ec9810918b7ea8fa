#!/usr/bin/env bash
# Runs every test: installs what is missing, builds the tool and the tests twice (plain, and
# with AddressSanitizer + UndefinedBehaviorSanitizer), fuzzes the parsers and the dump stream
# filter for a bounded time (scripts/fuzz.sh), runs the main paths under valgrind
# (scripts/valgrind.sh), tests the aarch64 build under emulation (scripts/test-aarch64.sh),
# checks the Android policy and build file (scripts/check-android.sh), and runs CTest on both
# builds. The full-size crash cycle (4 GiB written and read back) runs in the plain build
# only, alongside the fuzzers: it mostly waits for the disk, and they run for a fixed time.
# Run as root: the device tests use loop devices, mount namespaces and chroot (without root
# they are skipped).
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/setup.sh build
bash scripts/setup.sh build-asan -DRB_SANITIZE=ON

summaries=()
run_ctest() {
  local dir=$1
  shift
  local log
  log=$(mktemp)
  set +e
  (cd "$dir" && ctest --output-on-failure "$@") 2>&1 | tee "$log"
  local rc=${PIPESTATUS[0]}
  set -e
  summaries+=("$(grep -E 'tests passed|tests failed' "$log" | tail -n 1)")
  rm -f "$log"
  return "$rc"
}

status=0
full_size=$(mktemp)
(cd build && ctest --output-on-failure -R FullSize) >"$full_size" 2>&1 &
full_size_pid=$!
# Each fuzz target for a minute in its own clang build, and the main paths under valgrind.
bash scripts/fuzz.sh || status=1
wait "$full_size_pid" || status=1
cat "$full_size"
full_size_summary=$(grep -E 'tests passed|tests failed' "$full_size" | tail -n 1)
rm -f "$full_size"
bash scripts/valgrind.sh build || status=1
# The aarch64 build under qemu-user, and its bytes against the x86-64 build's.
bash scripts/test-aarch64.sh || status=1
# The SELinux policy compiled for user and userdebug builds, and Android.bp through bpfmt.
bash scripts/check-android.sh || status=1
run_ctest build-asan -j"$(nproc)" -E FullSize || status=1
run_ctest build -j"$(nproc)" -E FullSize || status=1

# CTest's summary lines, the plain build's last.
echo
echo "full-size crash cycle: $full_size_summary"
echo "sanitizer build: ${summaries[0]}"
echo "${summaries[1]}"
exit "$status"
