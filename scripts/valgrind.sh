#!/usr/bin/env bash
# Runs the device tests of the tool's main paths with every program they start in the fake
# device root under valgrind's memcheck (RB_TEST_WRAPPER): creation and arming, read-out and
# integrity test, the fault table's rows without a fault (the boot entry and its request file,
# the read-out of a stored dump with its message and the re-arming, the boot that disables the
# feature), and a mount table merged from the device tree and a file. An invalid access, or a
# leak other than the memory the tool keeps on purpose (tests/fault/valgrind.supp), makes the
# program exit with status 99, which fails its test. Installs valgrind when missing and first
# builds the plain build directory given (default: build). Run as root.
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
cmake --build "$build_dir" -j"$(nproc)" \
  --target block_io_test fault_injection_test fstab_default_test >/dev/null
# Inside the root, memcheck reads the suppressions from descriptor 4 and reports to descriptor
# 3, both inherited from here.
export RB_TEST_WRAPPER=/usr/bin/valgrind
export VALGRIND_OPTS="-q --error-exitcode=99 --leak-check=full
  --show-leak-kinds=definite,indirect,possible --errors-for-leak-kinds=definite,indirect,possible
  --suppressions=/proc/self/fd/4 --log-fd=3"
# A filter that selects nothing fails, so that a renamed test cannot drop out unnoticed.
run() {
  if ! "$build_dir/$1" --gtest_list_tests --gtest_filter="$2" | grep -q '^ '; then
    echo "valgrind: $1 has no test $2" >&2
    return 1
  fi
  "$build_dir/$1" --gtest_brief=1 --gtest_filter="$2"
}
status=0
{
  run block_io_test 'Arming.*' &&
    run fault_injection_test 'FaultInjection.EveryCase' &&
    run fstab_default_test 'DefaultFstab.TableChoiceAndDeviceTree'
} 3>&2 4<tests/fault/valgrind.supp || status=1
echo "valgrind: $((SECONDS - start)) s, $([ $status -eq 0 ] && echo "no errors" || echo FAILED)"
exit "$status"
