#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# Builds the libFuzzer targets with clang in a build directory of their own and runs each for a
# bounded time, one process at a time. Fails when any target finds a crash, a leak, a sanitizer
# report or a hang, or cannot run at all.
#
#   fuzz/run_fuzzers.sh [build-dir]          (make fuzz runs it with build-fuzz)
#
# Environment:
#   FUZZ_SECONDS  seconds per target (default 60)
#   FUZZ_TARGETS  targets to run (default: process_message rcv_test_msg properties sensor_reg)
#   FUZZ_ARGS     further libFuzzer flags for every target, e.g. "-runs=2000000"
#
# Each target starts from its seeds in fuzz/corpus/<target> and keeps what it finds in
# <build-dir>/fuzz/corpus/<target>, so the repository's seeds are never written. Findings go to
# <build-dir>/fuzz/artifacts/<target>/ and the whole output to <build-dir>/fuzz/<target>.log.
# Replay one with: <build-dir>/fuzz/fuzz_<target> <file> (KESTREL_FUZZ_LOG=1 prints the log).
set -euo pipefail
cd "$(dirname "$0")/.."

dir=${1:-build-fuzz}
seconds=${FUZZ_SECONDS:-60}
targets=${FUZZ_TARGETS:-process_message rcv_test_msg properties sensor_reg}
extra=${FUZZ_ARGS:-}

cmake -S . -B "$dir" -G Ninja -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ \
  -DKESTREL_BUILD_FUZZ=ON -DKESTREL_BUILD_TESTS=OFF -DKESTREL_BUILD_BENCH=OFF \
  -DKESTREL_SANITIZE=address,undefined >/dev/null
if ! cmake --build "$dir" --target fuzz_targets -- -j2 > "$dir/fuzz-build.log" 2>&1; then
  tail -n 60 "$dir/fuzz-build.log"
  exit 1
fi

max_len() {
  case $1 in
    process_message) echo 1024 ;;  # one receive
    *) echo 4096 ;;
  esac
}

passed=0
failed=0
for target in $targets; do
  binary="$dir/fuzz/fuzz_$target"
  work="$dir/fuzz/corpus/$target"
  artifacts="$dir/fuzz/artifacts/$target"
  log="$dir/fuzz/$target.log"
  if [ ! -x "$binary" ] || [ ! -d "fuzz/corpus/$target" ]; then
    echo "fuzz $target: no such target" >&2
    failed=$((failed + 1))
    continue
  fi
  mkdir -p "$work" "$artifacts"
  rc=0
  # One process, one worker: the machine is shared. A hang of 10 s is a finding: with the time
  # scale 0 no input waits at all. Every input frees what it allocates within a few kilobytes, so
  # a 32 MB quarantine still spans thousands of inputs, and keeps the process small and fast.
  ASAN_OPTIONS=detect_leaks=1:quarantine_size_mb=32 \
  UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
    "$binary" -max_total_time="$seconds" -max_len="$(max_len "$target")" -timeout=10 \
    -rss_limit_mb=2048 -print_final_stats=1 -artifact_prefix="$artifacts/" $extra \
    "$work" "fuzz/corpus/$target" > "$log" 2>&1 || rc=$?
  execs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -n 1)
  cov=$(grep -oE 'cov: [0-9]+' "$log" | tail -n 1 || true)
  corpus=$(ls "$work" | wc -l)
  if [ "$rc" -ne 0 ] || [ -n "$(ls -A "$artifacts")" ] ||
     grep -qE 'ERROR: (AddressSanitizer|LeakSanitizer|libFuzzer)|runtime error:' "$log"; then
    echo "fuzz $target: FAILED (exit $rc), ${execs:-0} executions; findings in $artifacts"
    grep -E 'ERROR:|runtime error:|kestrel fuzz check failed' "$log" | head -n 5 || true
    failed=$((failed + 1))
  else
    echo "fuzz $target: ok, ${execs:-0} executions, ${cov:-cov: ?}, corpus $corpus"
    passed=$((passed + 1))
  fi
done
echo "fuzz: $passed passed, $failed failed"
[ "$failed" -eq 0 ]
