#!/usr/bin/env bash
# The 64-bit ARM build, tested under emulation. Installs what is missing (the host build's
# packages, Debian's aarch64 cross compiler, qemu-user and the arm64 packages of the
# dependencies next to the amd64 ones), builds the tool and its tests for aarch64 into
# build-aarch64/, and then:
#   1. checks that android/Android.bp lists every source file of the tool and of ramdump_inspect;
#   2. runs CTest there: the unit tests and the device tests, every aarch64 program under
#      qemu-aarch64-static (the full-size crash cycle is left to the x86-64 run of
#      scripts/test.sh, the fault cases see below);
#   3. takes the x86-64 and the aarch64 reserveblocks through the same sequence on copies of
#      one /data image (enable, arming, integrity test, a crash stored by the x86-64
#      firmware simulator, a boot that reads it out and re-arms, integrity test, status) and
#      requires the same bytes from both: the chain blocks on the raw device, the misc
#      partition, the output and message files, the properties, the log, and every exit
#      status and output line.
# Run as root on Debian 12: loop devices, mount namespaces and chroot.
#   bash scripts/test-aarch64.sh
set -euo pipefail
self=$(realpath "$0")
cd "$(dirname "$self")/.."

QEMU=/usr/bin/qemu-aarch64-static
RESERVED=/data/vendor/ramdump/RAMDUMP_RESERVED
CRC=1234abcd

# --- The comparison, run by the part below in a private mount namespace. -------------------

# One little-endian 32-bit word as raw bytes (octal escapes, which only a format expands).
le32() {
  local v=$(($1))
  # shellcheck disable=SC2059
  printf "$(printf '\\%03o\\%03o\\%03o\\%03o' $((v & 255)) $((v >> 8 & 255)) \
    $((v >> 16 & 255)) $((v >> 24 & 255)))"
}

# Builds a device root at $1 around the /data image $2 (mounted on a loop device) with the
# programs reserveblocks from build directory $3 and firmware_sim from the x86-64 build.
make_root() {
  local root=$1 image=$2 tool_dir=$3
  mkdir -p "$root"
  mount -t tmpfs rbroot "$root"
  mkdir -p "$root"/{usr,proc,data,tmp,system/bin,vendor/etc,dev/__properties__} \
    "$root"/dev/block/bootdevice/by-name
  mount --rbind /usr "$root/usr"
  mount -o remount,bind,ro "$root/usr"
  for link in bin lib lib64; do [ -e /usr/$link ] && ln -s usr/$link "$root/$link"; done
  mount -t proc proc "$root/proc"
  echo "console=ttyS0 androidboot.hardware=rbtest" >"$root/tmp/cmdline"
  mount --bind "$root/tmp/cmdline" "$root/proc/cmdline"
  mknod "$root/dev/null" c 1 3
  : >"$root/dev/__log__" # the programs append to it only where it exists
  head -c 1048576 /dev/zero >"$root/dev/block/bootdevice/by-name/misc"
  echo "/dev/block/bootdevice/by-name/userdata /data ext4 noatime,nosuid,nodev,barrier=1" \
    "wait,check,encryptable=footer" >"$root/vendor/etc/fstab.rbtest"
  mount -o loop "$image" "$root/data"
  local loop
  loop=$(findmnt -n -o SOURCE "$root/data")
  mknod "$root/dev/block/bootdevice/by-name/userdata" b \
    $((0x$(stat -c %t "$loop"))) $((0x$(stat -c %T "$loop")))
  cp "$tool_dir/reserveblocks" build/firmware_sim "$root/system/bin/"
}

# Runs a program of the root (under qemu when $wrapper is set), adding its exit status and
# output to the transcript $transcript.
run_in_root() {
  local program=$1
  shift
  local command=("/system/bin/$program" "$@")
  if [ "$program" = reserveblocks ] && [ -n "$wrapper" ]; then
    command=("$wrapper" -0 "/system/bin/$program" "${command[@]}")
  fi
  local status=0
  chroot "$root" "${command[@]}" >"$root/tmp/out" 2>"$root/tmp/err" || status=$?
  {
    echo "=== $program $* ==="
    echo "exit status $status"
    echo "--- standard output"
    cat "$root/tmp/out"
    echo "--- standard error"
    cat "$root/tmp/err"
  } >>"$transcript"
}

# The sequence, with one build's reserveblocks; the results land in $results/$name.
run_sequence() {
  local name=$1 tool_dir=$2
  wrapper=$3
  root=$work/root-$name
  local out=$results/$name
  mkdir -p "$out"
  transcript=$out/transcript
  cp --sparse=always "$work/data.img" "$work/data-$name.img"
  make_root "$root" "$work/data-$name.img" "$tool_dir"

  run_in_root reserveblocks -e
  run_in_root reserveblocks -i $CRC $RESERVED
  # The arming printed the device, then magic, block size, first block, count, CRC, state.
  local header
  mapfile -t header <"$root/tmp/out"
  run_in_root reserveblocks -t -i $CRC $RESERVED
  # Where the firmware looks for the chain: its initial block header, marked armed.
  if [ ${#header[@]} -ne 7 ]; then
    echo "$name: the arming printed no header" >&2
    return 1
  fi
  {
    le32 "${header[1]}"
    le32 "${header[3]}"
    le32 "${header[2]}"
    le32 "${header[4]}"
    le32 "${header[5]}"
    le32 1
  } | dd of="$root/dev/block/bootdevice/by-name/misc" bs=1 seek=3184 conv=notrunc status=none

  # The crash: the x86-64 firmware simulator stores three files as the dump.
  head -c 9000 /dev/zero | tr '\0' '\021' >"$root/tmp/kernel_log.bin"
  for i in $(seq 1 40); do echo "[$i] Kernel panic - not syncing: simulated"; done \
    >"$root/tmp/RAMDUMP_MSG.txt"
  seq 1 20000 >"$root/tmp/memory0.bin"
  run_in_root firmware_sim /dev/block/bootdevice/by-name/misc \
    /dev/block/bootdevice/by-name/userdata /tmp/kernel_log.bin /tmp/RAMDUMP_MSG.txt \
    /tmp/memory0.bin

  run_in_root reserveblocks -a -i 1
  run_in_root reserveblocks -t -i $CRC $RESERVED
  run_in_root reserveblocks -s

  cp "$root/dev/block/bootdevice/by-name/misc" "$out/misc.img"
  cp "$root/dev/__log__" "$out/log"
  for prop in debug.kvo.kvdump debug.kvo.ramdump_new_directory; do
    echo "$prop=$(cat "$root/dev/__properties__/$prop" 2>/dev/null)"
  done >"$out/properties"
  cp "$root/data/vendor/ramdump/apq/00/RAMDUMP_OUTPUT" "$out/RAMDUMP_OUTPUT"
  cp "$root/data/vendor/ramdump/apq/00/RAMDUMP_MSG.txt" "$out/RAMDUMP_MSG.txt"
  cp "$root/tmp/RAMDUMP_MSG.txt" "$work/message-$name"
  umount -R "$root"
  # The reserved file's blocks as the raw device holds them, in chain (logical) order, read
  # from the image after the unmount so that no cached page of the file system can hide
  # what the tool wrote to the raw device.
  debugfs -R "blocks /vendor/ramdump/RAMDUMP_RESERVED" "$work/data-$name.img" \
    >"$out/reserved.blocks" 2>/dev/null
  debugfs -R "dump /vendor/ramdump/RAMDUMP_RESERVED $out/reserved.raw" \
    "$work/data-$name.img" 2>/dev/null
  rm -f "$work/data-$name.img"
}

compare_in_namespace() {
  work=$1
  results=$work/results
  # One /data image for both: 8 GiB sparse ext4, so that a boot keeps a reserved file (6 GiB
  # free needed), with a 64-block reserved file allocated in steps alternately with another
  # file, so that its chain has many short runs.
  truncate -s 8G "$work/data.img"
  mkfs.ext4 -q -F -m 0 -b 4096 -E nodiscard "$work/data.img"
  mkdir "$work/mnt"
  mount -o loop "$work/data.img" "$work/mnt"
  mkdir -p "$work/mnt/vendor/ramdump"
  local file
  for step in $(seq 0 15); do
    for file in RAMDUMP_RESERVED filler; do
      fallocate -o $((step * 16384)) -l 16384 "$work/mnt/vendor/ramdump/$file"
    done
  done
  for file in RAMDUMP_RESERVED filler; do
    head -c 262144 /dev/zero | tr '\0' '\377' |
      dd of="$work/mnt/vendor/ramdump/$file" conv=notrunc,fsync status=none
  done
  umount "$work/mnt"

  run_sequence x86-64 build ""
  run_sequence aarch64 build-aarch64 "$QEMU"

  # The reference run must have done what the sequence is for, or matching bytes mean
  # nothing: every step exited 0, the boot collected the dump, the message came through.
  local ref=$results/x86-64 failed=0
  if grep '^exit status' "$ref/transcript" | grep -qv '^exit status 0$'; then
    echo "x86-64 reference: a step failed" >&2
    failed=1
  fi
  grep -qx 'debug.kvo.kvdump=done' "$ref/properties" || {
    echo "x86-64 reference: the boot did not collect the dump" >&2
    failed=1
  }
  cmp -s "$ref/RAMDUMP_MSG.txt" "$work/message-x86-64" || {
    echo "x86-64 reference: the message file is not the one stored" >&2
    failed=1
  }

  local what
  for what in transcript log properties misc.img reserved.blocks reserved.raw RAMDUMP_OUTPUT \
    RAMDUMP_MSG.txt; do
    if cmp -s "$results/x86-64/$what" "$results/aarch64/$what"; then
      echo "identical: $what ($(stat -c %s "$results/x86-64/$what") bytes)"
    else
      echo "DIFFERENT: $what" >&2
      { cmp -l "$results/x86-64/$what" "$results/aarch64/$what" 2>&1 || true; } | head -5 >&2
      failed=1
    fi
  done
  if [ $failed -ne 0 ]; then
    echo "the transcripts: $results/x86-64/transcript $results/aarch64/transcript" >&2
    return 1
  fi
  rm -rf "$work"
}

if [ "${1:-}" = --compare-in-namespace ]; then
  compare_in_namespace "$2"
  exit
fi

# --- Set-up, build, tests. ----------------------------------------------------------------

if [ "$(id -u)" -ne 0 ]; then
  echo "test-aarch64.sh: run as root (packages, loop devices, mounts, chroot)" >&2
  exit 1
fi

# The host build: its packages, and the x86-64 reserveblocks and firmware simulator that the
# comparison uses.
bash scripts/setup.sh build >/dev/null

# The arm64 -dev packages are Multi-Arch: same, so they install next to the amd64 ones
# without replacing them. Refuse anything that would remove a package all the same.
cross_packages=(g++-aarch64-linux-gnu qemu-user-static
  android-libbase-dev:arm64 android-liblog-dev:arm64 android-libcutils-dev:arm64
  zlib1g-dev:arm64 libgtest-dev:arm64)
missing=()
for p in "${cross_packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "installing: ${missing[*]}"
  dpkg --print-foreign-architectures | grep -qx arm64 || dpkg --add-architecture arm64
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  if apt-get install -s "${missing[@]}" | grep '^Remv'; then
    echo "test-aarch64.sh: installing ${missing[*]} would remove the packages above;" \
      "not installing" >&2
    exit 1
  fi
  apt-get install -y -qq "${missing[@]}" >/dev/null
fi

cmake -S . -B build-aarch64 --no-warn-unused-cli \
  -DCMAKE_TOOLCHAIN_FILE=cmake/aarch64-linux-gnu.cmake \
  -DCMAKE_BUILD_TYPE=RelWithDebInfo -DRB_DEMO_AND_BENCHMARK=OFF >/dev/null
cmake --build build-aarch64 -j"$(nproc)"

status=0
# The device build (android/Android.bp) compiles the same sources; a file missing there would
# only show as a link failure in a device tree. Module $1's srcs against the files $2...
check_bp_sources() {
  local module=$1 listed present
  shift
  listed=$(awk -v name="\"$module\"," '$1 == "name:" { in_module = $2 == name }
    in_module && $1 ~ /^"[a-z_\/]*\.cpp",$/ { gsub(/[",]/, "", $1); print $1 }' \
    android/Android.bp | sort)
  present=$(printf '%s\n' "$@" | sort)
  if [ "$listed" != "$present" ]; then
    echo "android/Android.bp does not list the sources of $module:" >&2
    diff <(echo "$listed") <(echo "$present") >&2 || true
    status=1
  fi
}
check_bp_sources reserveblocks ramdump/*.cpp misc/*.cpp fs_mgr/*.cpp platform/*.cpp
check_bp_sources ramdump_inspect tools/dump_reader/*.cpp tools/chain_walk.cpp \
  ramdump/chain_format.cpp misc/misc_store.cpp

# Left out: the full-size crash cycle (x86-64 only, see above), and the fault table: under a
# wrapper it runs only its rows without a fault, which valgrind runs on x86-64; the aarch64
# tool's boot cycle is the comparison's below.
echo "--- CTest, aarch64 programs under $QEMU"
(cd build-aarch64 &&
  RB_TEST_WRAPPER=$QEMU ctest --output-on-failure -E 'FullSize|FaultInjection') ||
  status=1

echo "--- the same sequence with the x86-64 and the aarch64 reserveblocks"
work=$(mktemp -d /tmp/rb-aarch64-compare.XXXXXX)
if unshare -m --propagation private bash "$self" --compare-in-namespace "$work"; then
  echo "aarch64 and x86-64: identical bytes"
else
  echo "aarch64 and x86-64: the comparison FAILED (kept in $work)" >&2
  status=1
fi
exit "$status"
