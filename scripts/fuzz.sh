#!/usr/bin/env bash
# Builds the libFuzzer targets (tests/fuzz) with clang, ASan and UBSan into build-fuzz and runs
# each for a bounded time, two at a time, starting from the committed seed corpus. Any crash,
# leak, timeout or out-of-memory fails the run; its input is copied to
# tests/fuzz/regressions/<target>/, where the ordinary test builds replay it (commit it with
# the fix). RB_FUZZ_SECONDS sets the time per target (default 60).
set -euo pipefail
cd "$(dirname "$0")/.."

seconds=${RB_FUZZ_SECONDS:-60}
targets=(fstab_text_fuzz option_list_fuzz cmdline_fuzz dump_stream_fuzz)
declare -A max_len=([fstab_text_fuzz]=8192 [option_list_fuzz]=4096 [cmdline_fuzz]=4096
  [dump_stream_fuzz]=16384)

packages=(clang-14 libclang-rt-14-dev)
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

start=$SECONDS
CC=clang-14 CXX=clang++-14 cmake -S . -B build-fuzz -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DRB_FUZZ=ON >/dev/null
cmake --build build-fuzz -j"$(nproc)" --target "${targets[@]}" >/dev/null
echo "fuzz build: $((SECONDS - start)) s"

# Runs one target; its log, the corpus it grows and any crash input go to a directory of this
# run (kept when something failed), so that runs in one tree never share one.
runs_dir=$(mktemp -d build-fuzz/run.XXXXXX)
fuzz_one() {
  local target=$1
  local work=$runs_dir/$target
  mkdir -p "$work/corpus" "$work/artifacts"
  "build-fuzz/$target" -max_total_time="$seconds" -max_len="${max_len[$target]}" -timeout=10 \
    -rss_limit_mb=2048 -print_final_stats=1 -close_fd_mask=3 -artifact_prefix="$work/artifacts/" \
    "$work/corpus" "tests/fuzz/corpus/$target" >"$work/log" 2>&1
}

report() {
  local target=$1 rc=$2
  local work=$runs_dir/$target
  local runs speed
  runs=$(grep -o 'stat::number_of_executed_units: *[0-9]*' "$work/log" | grep -o '[0-9]*$' || true)
  speed=$(grep -o 'stat::average_exec_per_sec: *[0-9]*' "$work/log" | grep -o '[0-9]*$' || true)
  local found
  found=$(find "$work/artifacts" -type f | head -n 20)
  if [ "$rc" -eq 0 ] && [ -z "$found" ]; then
    echo "fuzz $target: ok, ${runs:-?} runs in ${seconds} s (${speed:-?} exec/s)"
    return 0
  fi
  echo "fuzz $target: FAILED (exit $rc) after ${runs:-?} runs"
  tail -n 60 "$work/log"
  mkdir -p "tests/fuzz/regressions/$target"
  for f in $found; do
    cp "$f" "tests/fuzz/regressions/$target/"
    echo "kept $f as tests/fuzz/regressions/$target/$(basename "$f")"
  done
  return 1
}

status=0
for ((i = 0; i < ${#targets[@]}; i += 2)); do
  pids=()
  batch=("${targets[@]:i:2}")
  for target in "${batch[@]}"; do
    fuzz_one "$target" &
    pids+=($!)
  done
  for k in "${!batch[@]}"; do
    rc=0
    wait "${pids[$k]}" || rc=$?
    report "${batch[$k]}" "$rc" || status=1
  done
done
[ "$status" -ne 0 ] || rm -rf "$runs_dir"
echo "fuzz: $((SECONDS - start)) s in all"
exit "$status"
