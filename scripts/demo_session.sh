#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# The demo's session, run inside its own network namespace by scripts/demo.sh. What it leaves:
# the session's capture (every frame both ways), the accelerometer stream as a plot and as CSV,
# and everything kestrelctl printed, in KESTREL_DEMO_OUT (default: demo/ in the build directory).
# KESTREL_DEMO_CTL_OPTIONS goes before every kestrelctl command (--kernel-device in the VM test,
# where the daemon talks to the real kernel with the protocol and port id of the environment).
set -uo pipefail
build=$1
here=$(cd "$(dirname "$0")/.." && pwd)
work=$(mktemp -d /tmp/kestrel-demo-XXXXXX)
scale=${KESTREL_DEMO_TIME_SCALE:-0.25}
out=${KESTREL_DEMO_OUT:-$build/demo}
mkdir -p "$out"
capture=$out/session.pcap
transcript=$out/session.txt
rm -f "$capture" "$transcript" "$out/accel.png" "$out/accel.csv"

bold=$(printf '\033[1m'); dim=$(printf '\033[2m'); off=$(printf '\033[0m')
[ -t 1 ] || { bold=; dim=; off=; }
say() { printf '\n%s== %s%s\n' "$bold" "$*" "$off"; }

# The phone's shell tools, recorded instead of run: the demo must not change this machine.
mkdir -p "$work/bin" "$work/root/data/misc/radio"
for tool in chown chmod diag_mdlog; do
  printf '#!/bin/sh\necho "%s $*" >> "%s/tools.log"\n' "$tool" "$work" > "$work/bin/$tool"
  chmod +x "$work/bin/$tool"
done
printf 'AP' > "$work/root/data/misc/radio/uart.txt"
printf 'persist.sys.usb.q_config=mtp,adb\nro.debug_level=0x494d\n' > "$work/props"

export KESTREL_SENSOR1_SOCKET=$work/sensor1.sock
export KESTREL_PROPERTIES=$work/props
export KESTREL_SENSOR_REG=$here/tools/sim/sample_registry.txt
export KESTREL_SYSROOT=$work/root
export KESTREL_KERNEL_PORT=${KESTREL_KERNEL_PORT:-100}
export KESTREL_TIME_SCALE=$scale
export PATH=$work/bin:$PATH

sim=$build/tools/sim/kestrel-sim
read -r -a ctl_options <<< "${KESTREL_DEMO_CTL_OPTIONS:-}"
ctl=("$build/tools/ctl/kestrelctl" "${ctl_options[@]}" --pcap "$capture")
pids=()
cleanup() { for p in "${pids[@]}"; do kill "$p" 2>/dev/null; done; wait 2>/dev/null; rm -rf "$work"; }
trap cleanup EXIT

say "kestrel-sim plays the sensor processor, kestreld starts (delays scaled by $scale)"
"$sim" --socket "$KESTREL_SENSOR1_SOCKET" > "$work/sim.log" 2>&1 &
pids+=($!)
"$build/kestreld" 2> "$work/kestreld.log" &
pids+=($!)

wait_log() {  # text, seconds
  local deadline=$((SECONDS + $2))
  until grep -qF -- "$1" "$work/kestreld.log"; do
    [ $SECONDS -ge $deadline ] && { echo "timed out waiting for: $1"; return 1; }
    sleep 0.1
  done
}
show_log() {  # pattern
  grep -E -- "$1" "$work/kestreld.log" | sed -E 's/^KESTRELD ([VDIWEF]) [0-9-]+ [0-9:]+ +[0-9]+ +[0-9]+ /  \1 /'
}

wait_log "main: do while start = 0" 30
show_log "Factory Daemon Start|open_and_bind_socket|main: do while start = 0"

say "3 s after boot the DIAG start thread opens the sensor service and starts logging"
wait_log "sns_set_diag_tx_mode: diag_mdlog Enter" 30 && show_log "diag_logging_start_thread|sensor1_open|check_|diag_mdlog Enter"
[ -f "$work/tools.log" ] && sed 's/^/  ran: /' "$work/tools.log"

passed=0; failed=0
run() {  # title, kestrelctl arguments...
  local title=$1; shift
  say "$title:  kestrelctl $*"
  local status=0
  "${ctl[@]}" "$@" > "$work/out.txt" || status=$?
  cat "$work/out.txt"; cat "$work/out.txt" >> "$transcript"
  if [ $status -eq 0 ]; then passed=$((passed + 1)); else failed=$((failed + 1)); echo "  ${bold}FAILED${off}"; fi
}

run "Sensor status" status accel
run "Accelerometer self test" selftest accel
run "Gyroscope self test" selftest gyro
run "Magnetometer self test" selftest mag
run "Pressure sensor self test" selftest pressure
run "Gyroscope temperature" gyro-temp
run "Magnetometer fuse ROM" mag fuserom
run "Magnetometer registers" mag registers
# A stream prints every sample; the demo shows its start, its end and how many came.
say "Accelerometer stream, two seconds at 100 Hz:  kestrelctl stream accel --seconds 2 --plot accel.png --csv accel.csv"
plot=(--plot "$out/accel.png")
command -v gnuplot >/dev/null 2>&1 || plot=()
if "${ctl[@]}" stream accel --seconds 2 "${plot[@]}" --csv "$out/accel.csv" > "$work/stream.txt"; then
  passed=$((passed + 1))
  samples=$(grep -c "^type 2 " "$work/stream.txt")
  grep -v "^type 2 " "$work/stream.txt" | head -n 1
  grep "^type 2 " "$work/stream.txt" | head -n 3
  echo "  ${dim}... $samples samples in all ...${off}"
  grep "^type 2 " "$work/stream.txt" | tail -n 2
  grep -v "^type 2 " "$work/stream.txt" | tail -n +2
else
  failed=$((failed + 1)); echo "  ${bold}FAILED${off}"
fi
cat "$work/stream.txt" >> "$transcript"
run "Accelerometer low-pass filter" lpf on
run "Light sensor thresholds (bulk data)" bigdata 28 00
run "Light sensor hd thresholds (bulk data)" bigdata 31 00
run "Register dump of the accelerometer" dump 0
run "Calibration from the registry" calib read accel
run "Calibration store" calib store accel --flag 0

: > "$work/tools.log"
run "Coefficient file permissions" hh-perms
wait_log "chown : end" 10 && sed 's/^/  ran: /' "$work/tools.log"

say "A DIAG dump (command 27, argument 0) restarts logging"
: > "$work/tools.log"
# The dump stops the tool, waits 2 s, starts it again and waits 5 s more.
"${ctl[@]}" diag dump >> "$transcript" && sleep "$(awk "BEGIN { print $scale * 9 }")"
show_log "diag : |diag_logging_thread|STATE:" | tail -n 12
sed 's/^/  ran: /' "$work/tools.log" 2>/dev/null

say "The session's capture, as tshark shows it with the dissector:  tshark -X lua_script:tools/wireshark/kestrel.lua -r session.pcap"
if command -v tshark >/dev/null 2>&1; then
  tshark -X lua_script:"$here/tools/wireshark/kestrel.lua" -r "$capture" 2>/dev/null |
    awk -v dim="$dim" -v off="$off" '
      / type 2 \(sample\)/ { if (samples++ >= 2) { if (samples == 3) print dim "  ..." off; next } }
      { print "  " $0 }
      END { print dim "  (" samples - 2 " more samples left out here)" off }'

else
  echo "  (tshark is not installed)"
fi

say "Summary"
echo "  $passed passed, $failed failed"
echo "  ${dim}full daemon log: $(grep -c '^KESTRELD' "$work/kestreld.log") records${off}"
echo "  capture:   $capture"
echo "             $build/tools/ctl/kestrelctl decode $capture"
echo "             wireshark -X lua_script:$here/tools/wireshark/kestrel.lua $capture"
echo "  plot:      $out/accel.png  (CSV: $out/accel.csv)"
echo "  printed:   $transcript"
[ "$failed" -eq 0 ]
