#!/bin/bash
# SPDX-License-Identifier: Apache-2.0
# The checks inside the VM of `make vm-test`: kestreld with the phone's netlink values (protocol
# 23, the kernel at port id 0) against the factory driver module, driven through its device.
# One PASS/FAIL line a check on stdout; the details, the captures, the daemon's logs and the
# module's counters go to $1, which the host takes out of the VM. Every wait is bounded.
set -u
res=$1
build=/build
mod=/lib/modules/kestrel_factory.ko
dev=/dev/kestrel_factory
inject=/sys/kernel/debug/kestrel_factory/inject
sys=/sys/class/misc/kestrel_factory
mkdir -p "$res/demo"
export KESTREL_NETLINK_PROTOCOL=23 KESTREL_KERNEL_PORT=0 KESTREL_TIME_SCALE=0.1
export KESTREL_SENSOR1_SOCKET=/tmp/sensor1.sock KESTREL_SENSOR_REG=/tools/sim/sample_registry.txt
session=$res/demo/session.pcap
log=$res/kestreld.log

passed=0 failed=0
check() {  # name, command...
  local name=$1; shift
  echo "== $name: $*" >> "$res/checks.log"
  if "$@" >> "$res/checks.log" 2>&1; then
    echo "PASS $name"; passed=$((passed + 1))
  else
    echo "FAIL $name"; failed=$((failed + 1))
  fi
}
ctl() { timeout 20 $build/tools/ctl/kestrelctl --kernel-device "$dev" --pcap "$session" "$@"; }
inject() { timeout 20 $build/tools/ctl/kestrelctl --kernel-device "$inject" --pcap "$session" raw "$@"; }
wait_log() {  # text, seconds
  timeout "$2" sh -c 'until grep -qF -- "$0" "$1"; do sleep 0.1; done' "$1" "$log"
}
start_daemon() {  # and waits for the one frame it sends unasked, so counters read later hold it
  local before; before=$(counter received)
  : > "$log"
  $build/kestreld 2> "$log" &
  daemon=$!
  wait_log "main: do while start = 0" 20 &&
    timeout 10 sh -c 'until [ "$(cat "$0")" -gt "$1" ]; do sleep 0.1; done' "$sys/received" "$before"
}
answers() {  # log text, command...: the command succeeds and the daemon logs the text
  local text=$1; shift
  "$@" && wait_log "$text" 5
}
no_daemon() { ! ctl status accel 2> "$res/err.txt" && grep -q 'is kestreld running' "$res/err.txt"; }
counter() { cat "$sys/$1"; }
counters() {
  for c in sent received malformed dropped rejected; do printf '%s %s  ' "$c" "$(counter "$c")"; done
}
refused() {  # a bad write: kestrelctl fails and the module counts it as rejected
  local before; before=$(counter rejected)
  ! ctl raw "$@" && [ "$(counter rejected)" -eq $((before + 1)) ]
}
capture() {  # interface, file
  exec $build/tools/ctl/kestrelctl decode --live "$1" --pcap "$2" > /dev/null
}
nlmon_up() {
  insmod /lib/modules/nlmon.ko && ip link add nlmon0 type nlmon && ip link set nlmon0 up || return 1
  set -m  # a job of its own, so that it takes SIGINT as from a terminal
  capture nlmon0 "$res/nlmon.pcap" 2> "$res/capture.log" &
  capturer=$!
  set +m
  sleep 1
}
stop() {  # signal, pid: the signal, then SIGKILL when the process has not ended within 5 s
  kill "-$1" "$2" 2> /dev/null
  timeout 5 sh -c 'while kill -0 "$0" 2> /dev/null; do sleep 0.1; done' "$2" || kill -KILL "$2"
  wait "$2" 2> /dev/null
}
kernel_lines=$(dmesg | wc -l)
kernel_log_clean() {
  ! dmesg | tail -n +$((kernel_lines + 1)) | grep -iE 'oops|warn|bug|leak|call trace|refcount'
}

echo "boot $(cut -d' ' -f1 /proc/uptime) s"
check "module loads" insmod "$mod"
check "device and counters" test -c "$dev" -a -r "$sys/sent" -a -w "$inject"
check "nlmon0 captures" nlmon_up
check "no daemon: ECONNREFUSED" no_daemon

KESTREL_DEMO_OUT=$res/demo KESTREL_DEMO_CTL_OPTIONS="--kernel-device $dev" \
  check "demo session" timeout 120 bash /scripts/demo_session.sh $build
cp "$res/checks.log" "$res/demo/transcript.txt" 2>/dev/null

$build/tools/sim/kestrel-sim --socket "$KESTREL_SENSOR1_SOCKET" --drop-after 2 > "$res/sim.log" 2>&1 &
sim=$!
check "daemon starts on protocol 23" start_daemon
check "broken pipe recovered" wait_log "BROKEN_PIPE success to open sensor1" 30
check "command after the broken pipe" ctl selftest accel
check "short frame refused" answers "refused: frame of 16 bytes, needs 20" \
  ctl raw 10000000 08000000 00000000 00000000
check "nlmsg_len past the datagram" answers "malformed netlink message" \
  inject 40000000 08000000 00000000 00000000
check "unknown command" answers "process_message: 99" ctl raw 10000000 63000000 00000000 00000000
check "write too short: EINVAL" refused 0102
check "nlmsg_len not the write: EINVAL" refused 20000000 0000 0000 00000000 00000000 00000000
check "write over 1024 bytes: EMSGSIZE" refused "$(printf '%04x' {0..520})"
check "daemon serves after bad frames" ctl status accel
check "daemon's frames well formed" test "$(counter malformed)" -eq 0
counters | tee "$res/counters-before-reload.txt"; echo
check "module unloaded and loaded again" sh -c "rmmod kestrel_factory && insmod $mod"
check "command after the reload" ctl selftest gyro
stop TERM "$daemon"
check "daemon restarted" start_daemon
check "command after the restart" ctl mag fuserom
check "daemon's frames well formed after the reload" test "$(counter malformed)" -eq 0
counters | tee "$res/counters.txt"; echo

stop TERM "$daemon"; stop INT "$capturer"; stop TERM "$sim"
check "kernel log clean" kernel_log_clean
dmesg > "$res/dmesg.txt"
echo "$passed passed, $failed failed (in the VM)"
