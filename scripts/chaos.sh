#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# make chaos: kestreld under a seeded random schedule of link faults and commands
# (scripts/chaos.sh [build-dir]). Runs kestrel-chaos in a network namespace of its own, first on
# the daemon of the build, then on the daemon built with ThreadSanitizer in build-tsan. Prints the
# figures, and for a failing run its seed and the command that replays it.
#   CHAOS_MINUTES        length of the run (default 5; 0 skips it)
#   CHAOS_SEED           seed of the schedule (default: drawn from the clock)
#   CHAOS_TSAN_MINUTES   length of the ThreadSanitizer run (default 1; 0 skips it)
set -euo pipefail
here=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "${1:-build}" && pwd)
chaos=$build/tools/soak/kestrel-chaos
if [ ! -x "$chaos" ]; then
  echo "chaos: $chaos is not built (make chaos builds it)" >&2
  exit 2
fi
if [ "$(id -u)" -eq 0 ]; then
  netns=(unshare --net)
else
  netns=(unshare --user --map-root-user --net)
fi
seed=${CHAOS_SEED:-$(( $(date +%s%N) % 4294967291 ))}
minutes=${CHAOS_MINUTES:-5}
tsan_minutes=${CHAOS_TSAN_MINUTES:-1}
registry=$here/tools/sim/sample_registry.txt
cpu=$(grep -m1 'model name' /proc/cpuinfo | cut -d: -f2 | sed 's/^ *//')
echo "chaos: $(date -u '+%Y-%m-%d %H:%M UTC'), $(uname -sr) $(uname -m), $(nproc) cores, ${cpu:-unknown cpu}"

status=0
if [ "$minutes" != 0 ]; then
  echo "== chaos, seed $seed, $minutes minutes"
  "${netns[@]}" "$chaos" --registry "$registry" --seed "$seed" --minutes "$minutes" \
    --replay "make chaos CHAOS_SEED=$seed CHAOS_MINUTES=$minutes CHAOS_TSAN_MINUTES=0" || status=1
fi

if [ "$tsan_minutes" != 0 ]; then
  echo "== chaos under ThreadSanitizer, seed $seed, $tsan_minutes minutes"
  tsan=$here/build-tsan
  cmake -S "$here" -B "$tsan" -G Ninja -DKESTREL_BUILD_BENCH=OFF -DKESTREL_SANITIZE=thread \
    >/dev/null
  if ! cmake --build "$tsan" --target kestreld > "$tsan/chaos-build.log" 2>&1; then
    tail -n 40 "$tsan/chaos-build.log"
    exit 1
  fi
  # A race report ends the daemon with status 66, which the run reports with the report itself
  # among the daemon's last lines. Everything is slower under the sanitizer: a wider margin; and
  # the sanitizer has a thread of its own in the daemon, and memory of its own that grows with
  # every address the daemon touches, so memory is not compared. The daemon joins no thread, by
  # design, so its threads are not reported as leaks when it exits under faults.
  TSAN_OPTIONS="halt_on_error=1 exitcode=66 report_thread_leaks=0" \
    "${netns[@]}" "$chaos" --registry "$registry" \
    --daemon "$tsan/kestreld" --margin-ms 3000 --idle-threads 3 \
    --memory-slack-kb -1 --seed "$seed" --minutes "$tsan_minutes" \
    --replay "make chaos CHAOS_SEED=$seed CHAOS_MINUTES=0 CHAOS_TSAN_MINUTES=$tsan_minutes" ||
    status=1
fi

if [ $status -eq 0 ]; then echo "chaos: passed"; else echo "chaos: FAILED"; fi
exit $status
