#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# Runs every test through CTest: the whole suite on the normal build and, with SANITIZE=1 (as in
# CI), once more under AddressSanitizer with UndefinedBehaviorSanitizer and the concurrency tests
# under ThreadSanitizer. CTest's summary line closes the output.
set -euo pipefail
cd "$(dirname "$0")/.."
jobs=$(nproc)

configure() {  # dir, extra cmake arguments...
  local dir=$1; shift
  cmake -S . -B "$dir" -G Ninja -DKESTREL_BUILD_BENCH=OFF "$@" >/dev/null
}
build() {  # dir, targets...
  local dir=$1; shift
  if ! cmake --build "$dir" -- -j"$jobs" "$@" > "$dir/build.log" 2>&1; then
    tail -n 60 "$dir/build.log"
    return 1
  fi
}

status=0
if [ "${SANITIZE:-0}" = 1 ]; then
  echo "== AddressSanitizer + UndefinedBehaviorSanitizer: every test"
  configure build-asan -DKESTREL_SANITIZE=address,undefined
  build build-asan
  ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1 \
    ctest --test-dir build-asan -j"$jobs" --output-on-failure || status=1
  echo "== ThreadSanitizer: the concurrency tests"
  configure build-tsan -DKESTREL_SANITIZE=thread
  # Only the concurrency tests and the programs they run.
  race_tests=$(ninja -C build-tsan -t targets all | grep -oE '^[a-z0-9_]+_race_test' | sort -u)
  build build-tsan kestreld kestrel-sim kestrelctl $race_tests
  TSAN_OPTIONS=halt_on_error=1 \
    ctest --test-dir build-tsan -L concurrency -j"$jobs" --output-on-failure || status=1
fi

echo "== Every test"
configure build
build build
ctest --test-dir build -j"$jobs" --output-on-failure || status=1
exit $status
