#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# make bench: builds the benchmarks in Release, runs them all (each in a private network namespace
# of its own) and writes docs/performance.md from what they measured.
#   BENCH_BUILD   build directory (default build-bench)
#   BENCH_DOC     the document to write (default docs/performance.md)
#   BENCH_QUICK   1: two repetitions each and 5 idle seconds, a look at whether everything runs;
#                 the document then goes to the results directory unless BENCH_DOC names one
set -euo pipefail
cd "$(dirname "$0")/.."

dir=${BENCH_BUILD:-build-bench}
out=$dir/bench-results
quick=${BENCH_QUICK:-0}
if [ "$quick" = 1 ]; then
  doc=${BENCH_DOC:-$out/performance.md}
  export KESTREL_BENCH_IDLE_SECONDS=5
else
  doc=${BENCH_DOC:-docs/performance.md}
fi

echo "== Building the benchmarks (Release) in $dir"
cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=Release -DKESTREL_BUILD_TESTS=OFF \
  -DKESTREL_BUILD_BENCH=ON >/dev/null
mkdir -p "$out"
if ! cmake --build "$dir" --target benchmarks kestreld kestrel-sim -- -j2 >"$out/build.log" 2>&1; then
  tail -n 60 "$out/build.log"
  exit 1
fi
if [ ! -x "$dir/bench/sample_path_bench" ]; then
  echo "the benchmarks were not built: is libbenchmark-dev installed?" >&2
  exit 1
fi

load() { cut -d' ' -f1-3 /proc/loadavg; }
load_start=$(load)
date_utc=$(date -u '+%Y-%m-%d %H:%M UTC')

status=0
run() {  # program, flags...
  local name=$1; shift
  echo
  echo "== $name"
  if ! KESTREL_BENCH_SUMMARY="$out/$name.md" "$dir/bench/$name" \
      --benchmark_out="$out/$name.json" --benchmark_out_format=json "$@" 2>&1 |
      tee "$out/$name.txt"; then
    status=1
  fi
  # A program that died before its summary leaves a note instead.
  [ -s "$out/$name.md" ] || echo "This program failed; see its output." >"$out/$name.md"
}

interleaved=(--benchmark_enable_random_interleaving=true)
reps() {  # repetitions, minimum time of a repetition
  if [ "$quick" = 1 ]; then
    echo --benchmark_repetitions=2 --benchmark_min_time=0.05
  else
    echo --benchmark_repetitions="$1" --benchmark_min_time="$2"
  fi
}
rm -f "$out"/*.md
run sample_path_bench "${interleaved[@]}" $(reps 20 0.1)
run frame_walk_bench "${interleaved[@]}" $(reps 10 0.1)
run round_trip_bench "${interleaved[@]}" $(reps 10 0.5)
run stream_bench "${interleaved[@]}" $([ "$quick" = 1 ] && echo --benchmark_repetitions=1)
run footprint_bench
load_end=$(load)

# ---- docs/performance.md ----
cpu=$(grep -m1 'model name' /proc/cpuinfo | cut -d: -f2- | sed 's/^ *//')
grep -qw hypervisor /proc/cpuinfo && cpu="$cpu (virtual machine)"
mem=$(awk '/MemTotal/ {printf "%.1f GiB", $2 / 1048576}' /proc/meminfo)
cxx=$(sed -n 's/^CMAKE_CXX_COMPILER:[A-Z]*=//p' "$dir/CMakeCache.txt")
cxx_flags=$(sed -n 's/^CMAKE_CXX_FLAGS_RELEASE:[A-Z]*=//p' "$dir/CMakeCache.txt")
compiler="$("$cxx" --version | head -n 1), Release ($cxx_flags)"
targets=$(grep -hE '\| (meets|misses) \|$' "$out"/*.md || true)

section() {  # program
  cat "$out/$1.md"
}

mkdir -p "$(dirname "$doc")"
{
cat <<EOF
# Performance

This page is written by \`make bench\`: it builds the benchmarks of \`bench/\` in Release, runs
them all on the machine below and puts here what they measured. Every figure comes from that run;
to update the page, run \`make bench\` again rather than edit it.

Each figure of kestreld stands next to the limit it is measured against, taken in the same run:
the same work done bare, without the daemon (one \`sendmsg\`, a relay that only forwards, a walk
that only logs). The ratio is the daemon's figure divided by the limit's.

## Machine

| | |
|---|---|
| date | $date_utc |
| CPU | $cpu |
| cores | $(nproc) |
| memory | $mem |
| kernel | $(uname -srm) |
| compiler | $compiler |
| load average (1, 5, 15 min) at the start | $load_start |
| load average (1, 5, 15 min) at the end | $load_end |

The cores are shared with whatever else runs on the machine; the load averages above, and those
under each table, tell how busy it was. On a busy machine the absolute figures vary from run to
run. Each program interleaves the daemon's runs with the limit's (random interleaving of the
repetitions) and reports medians, so both sides of a ratio were measured under the same load.

## Targets

| Figure | kestreld | Limit | Ratio | Target | |
|---|---|---|---|---|---|
$targets

EOF
if grep -q '| misses |$' <<<"$targets"; then
  echo "A figure that misses its target is explained under \"What sets the floor\" below."
  echo
fi
cat <<'EOF'
## Sample path

One sample indication through the service callback: `rcv_test_msg` with a sample body from the
sensor1 library's allocator, exactly as the library's thread delivers it, then the conversion and
`send_to_kernel` onto a real netlink socket. The limit is a bare `sendmsg` of the same 32-byte
frame on the same socket to the same port. The kernel side is a netlink socket bound to the
kernel's port id in the same network namespace; frames go out in timed batches of 64 and the
kernel side takes each batch between batches, untimed, so the socket buffer never fills and no
thread sleeps on the kernel side while a batch is timed: on the phone the kernel takes the frame
inside the send. The figure is the median batch, per frame; the mean, which also carries the
batches that lost their core to another process, follows it. `convert_sample` and the four heap
blocks of `send_to_kernel` are also timed alone.

EOF
section sample_path_bench
cat <<'EOF'

## Command round trip

An accelerometer self test (command 8, sensor_type 0) sent from the kernel side to a running
`kestreld` process, which asks an in-process `kestrel_sim::Simulator` playing the healthy phone
and sends the type-9 reply back. The limit is a bare ping-pong over the same hops without the
daemon: a netlink datagram to a relay process, one record on a Unix stream socket to a Simulator
and one back, and a netlink datagram back to the kernel side.

Further relays add the duties of the daemon's design to the bare ping-pong, one at a time and
all three together, to measure what each costs: the daemon's log lines of a self test, at the
same points, through liblog; the hand-over of the answer from a reader thread to the main thread
waiting on a condition variable, as the sensor1 library's thread hands it to the command waiting
on `command_waiter`; and a response record before the indication, as the sensor service answers
a self test. Every log goes to `/dev/null`. The figures are the median command (the mean, which
also carries the commands that waited for a busy core, follows the first row). The CPU time adds
up the run time of all the threads of a process over the timed commands; "blocked" counts their
voluntary context switches, each a sleep and a wake-up. Before the runs, a daemon of its own
writes its log to a file: the log records of a self test are counted there, and the relays with
the log duty replay the daemon's own records of one self test, its main thread's where the main
thread writes them and its library thread's when the indication is read.

EOF
section round_trip_bench
cat <<'EOF'

## Frame walk

A full 1024-byte datagram of 64 frames with command numbers above 36, through `process_message`:
each frame costs the walk and its one "process_message: <command>" line. Per frame, with the log
going to a no-op logger (`__android_log_set_logger`) and to liblog's stderr logger with stderr on
`/dev/null`. The limit is the walk of netlink(7) written bare with the same one line per frame
through the same logger; the walk without any line is shown for scale.

EOF
section frame_walk_bench
cat <<'EOF'

## Sustained stream

The highest rate of sample indications that a running `kestreld` forwards to the kernel side as
type-2 frames with no loss. The simulator's side offers indications at rising rates, half a
second each, paced against the clock; the kernel side counts the frames. The sockets on the way
block rather than drop, so a rate the daemon cannot keep up with shows as a backlog: a rate passes
when every indication has arrived as a frame and the last one came within 20 ms of its due time.
The limit is a bare relay process that reads the simulator's records as the sensor1 library does
and sends one frame per indication, with no conversion, lock or allocation.

EOF
section stream_bench
cat <<'EOF'

## Idle footprint

`kestreld` started with `kestrel-sim` connected, measured once the refresh thread's frame had
come and the DIAG start thread and the refresh thread had ended (only the main thread and the
sensor1 library's thread left): resident memory and threads from `/proc/<pid>/status`, then the
CPU time over 60 idle seconds from `/proc/<pid>/stat` (utime + stime), the threads' run time from
their `schedstat` and their context switches. The daemon ran at `KESTREL_TIME_SCALE=0.05`, which
shortens its start-up delays and changes nothing once it is idle.

EOF
section footprint_bench
cat <<'EOF'

## What sets the floor

- **Sample path.** A sample costs one netlink `sendmsg`; everything else the daemon does for it
  is user-space work measured in nanoseconds: the body the sensor1 library allocated and the
  callback frees, `indication_lock`, the conversion (its share is in the table), and the four
  heap blocks that `send_to_kernel` allocates and frees by design for every frame (message
  header, netlink address, I/O vector, frame buffer). The send sets the floor.
- **Command round trip.** Both sides cross the same four socket hops, and each hop wakes a
  sleeping thread in another process. The daemon's floor is higher by design, and the relays
  with its duties measure by how much. Every line of the log goes through liblog, whose host
  stderr logger makes three system calls a line (`getpid`, `gettid`, `write`); the frame walk's
  stderr row is the price of one line, and the round-trip table counts the records of one self
  test (one more when the indication comes before the main thread waits: "cb has arrived without
  waiting"). The answer arrives on the sensor1 library's thread, which hands it to the main thread
  waiting on `command_waiter`: one more sleep and wake-up, and since `command_waiter` is raised
  while its mutex is held (lock, store, flag, signal, unlock), the woken main thread often finds
  the mutex still taken and sleeps once more. The sensor service answers a self test with a
  response and then an indication: two records to read. kestreld set against the relay with all
  three duties is what its own code adds; the CPU-time and blocked rows show the same without the
  wake-up latencies of a shared machine.
- **Frame walk.** Every frame writes its line, and liblog formats it (`vsnprintf`) even when the
  logger drops it; with the stderr logger the three system calls of the line are nearly all of
  the cost. The ratio is what `process_message` adds to the line it has to write.
- **Sustained stream.** Per sample both the daemon and the relay make one netlink `sendmsg` and
  share the reading of the simulator's socket; the daemon's library thread also goes through
  `poll` before each read, copies each record, allocates and frees its body, and runs the
  callback (the sample path above). The rate is set by system calls and by the three busy threads
  (simulator, forwarder, kernel side) sharing the machine's cores.
- **Idle.** Nothing polls: the main thread blocks in `recvfrom` on the netlink socket and the
  sensor1 library's thread in `poll` without a timeout; the start-up threads have ended and no
  timer is armed. Most of the resident memory is file-backed: the pages of the shared libraries
  in use (libc, libstdc++, libm, the dynamic loader, libgcc_s, liblog) and of the program itself;
  the daemon's anonymous memory (heap, stacks, data) is the smaller part.

## Reproducing

    make bench

builds in `build-bench/` (Release), runs the five programs and rewrites this page. Each program
prints Google Benchmark's table and its summary; the raw runs are kept in
`build-bench/bench-results/` as JSON. A program can be run alone, with Google Benchmark's flags,
for example `build-bench/bench/round_trip_bench --benchmark_repetitions=5`; it enters a network
namespace of its own by itself. `KESTREL_BENCH_IDLE_SECONDS` shortens the idle period of
`footprint_bench`; `make bench BENCH_QUICK=1` runs every program briefly and leaves this page
alone (its figures go to `build-bench/bench-results/performance.md`).
EOF
} >"$doc"

echo
echo "== Wrote $doc"
exit $status
