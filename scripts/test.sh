#!/usr/bin/env bash
# Runs every test: installs what is missing, builds the tool and the tests twice (plain, and
# with AddressSanitizer + UndefinedBehaviorSanitizer), fuzzes the parsers and the dump stream
# filter for a bounded time (scripts/fuzz.sh), runs the main paths under valgrind
# (scripts/valgrind.sh), tests the aarch64 build under emulation (scripts/test-aarch64.sh),
# checks the Android policy and build file (scripts/check-android.sh), and runs CTest on both
# builds. The full-size crash cycle (4 GiB written and read back) runs in the plain build
# only; it and valgrind run alongside the fuzzers: the cycle mostly waits for the disk, and the
# fuzzers run for a fixed time.
# Run as root: the device tests use loop devices, mount namespaces and chroot (without root
# they are skipped).
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/setup.sh build -DRB_DEMO_AND_BENCHMARK=ON
bash scripts/setup.sh build-asan -DRB_SANITIZE=ON -DRB_DEMO_AND_BENCHMARK=OFF

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
  summaries+=("$(grep -E 'tests passed|tests failed' "$log" | tail -n 1 || true)")
  rm -f "$log"
  return "$rc"
}

status=0
full_size=$(mktemp)
valgrind_log=$(mktemp)
(cd build && ctest --output-on-failure --no-tests=error -R FullSize) >"$full_size" 2>&1 &
full_size_pid=$!
# The main paths under valgrind, and each fuzz target for a minute in its own clang build.
bash scripts/valgrind.sh build >"$valgrind_log" 2>&1 &
valgrind_pid=$!
bash scripts/fuzz.sh || status=1
wait "$full_size_pid" || status=1
wait "$valgrind_pid" || status=1
cat "$full_size" "$valgrind_log"
full_size_summary=$(grep -E 'tests passed|tests failed' "$full_size" | tail -n 1 || true)
rm -f "$full_size" "$valgrind_log"
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
