#!/usr/bin/env bash
# Builds the libFuzzer targets (tests/fuzz) with clang, ASan and UBSan into build-fuzz and runs
# each for RB_FUZZ_SECONDS (default 60), all at once, from the committed seed corpus. A crash,
# leak, timeout or out-of-memory fails the run, and its input is copied to
# tests/fuzz/regressions/<target>/, which the ordinary builds replay (commit it with the fix).
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/install_missing.sh
seconds=${RB_FUZZ_SECONDS:-60}
targets=(fstab_text_fuzz option_list_fuzz cmdline_fuzz dump_stream_fuzz readout_stream_fuzz)

install_missing clang-14 libclang-rt-14-dev
start=$SECONDS
CC=clang-14 CXX=clang++-14 cmake -S . -B build-fuzz -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DRB_FUZZ=ON >/dev/null
cmake --build build-fuzz -j"$(nproc)" --target "${targets[@]}" >/dev/null
echo "fuzz build: $((SECONDS - start)) s"

# Fuzzes one target in a directory of this run (kept when something failed) and reports.
runs=$(mktemp -d build-fuzz/run.XXXXXX)
fuzz_one() {
  local work=$runs/$1
  mkdir -p "$work/corpus" "$work/crashes"
  if "build-fuzz/$1" -max_total_time="$seconds" -max_len=16384 -timeout=10 -rss_limit_mb=2048 \
    -print_final_stats=1 -close_fd_mask=3 -artifact_prefix="$work/crashes/" \
    "$work/corpus" "tests/fuzz/corpus/$1" >"$work/log" 2>&1 && [ -z "$(ls "$work/crashes")" ]; then
    echo "fuzz $1: ok, $(grep -o 'executed_units: *[0-9]*' "$work/log" | grep -o '[0-9]*$') runs"
    return 0
  fi
  echo "fuzz $1: FAILED"
  tail -n 60 "$work/log"
  mkdir -p "tests/fuzz/regressions/$1"
  cp -v "$work"/crashes/* "tests/fuzz/regressions/$1/" || true
  return 1
}

pids=()
for target in "${targets[@]}"; do
  fuzz_one "$target" >"$runs/$target.report" &
  pids+=($!)
done
status=0
for pid in "${pids[@]}"; do wait "$pid" || status=1; done
cat "$runs"/*.report
[ "$status" -ne 0 ] || rm -rf "$runs"
echo "fuzz: $((SECONDS - start)) s in all"
exit "$status"
