#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# Captures end to end, on the demo's factory session: tshark with the dissector finds every frame
# kestrelctl printed, with its length, and shows the fields `kestrelctl decode --json` prints;
# decode skips other protocols' packets and stops at a cut packet or a cut file, naming it, and
# reads the session alike from the link types of tcpdump on any; live, it reads an interface until
# --seconds or Ctrl-C and keeps what it saw; the stream's CSV holds the samples the daemon sent.
#   captures_test.sh <build directory> <source directory>
set -euo pipefail
build=$1
src=$2
out=$(mktemp -d /tmp/kestrel-captures-XXXXXX)
live=
trap '[ -z "$live" ] || kill -KILL $(pgrep -P $live) $live 2>/dev/null; rm -rf "$out"' EXIT
ctl=$build/tools/ctl/kestrelctl
cap=$out/session.pcap
failures=0
check() {  # description, then a command that must succeed
  local what=$1; shift
  if "$@"; then echo "ok: $what"; else echo "FAILED: $what"; failures=$((failures + 1)); fi
}
tshark() { command tshark -X lua_script:"$src/tools/wireshark/kestrel.lua" "$@" 2>/dev/null; }
failed_with() {  # exit status, first line of stderr, file of stderr
  [ "$1" = 4 ] && [ "$(head -n 1 "$3")" = "$2" ]
}

KESTREL_DEMO_OUT=$out KESTREL_DEMO_TIME_SCALE=0.05 "$src/scripts/demo_session.sh" "$build" \
  > "$out/demo.txt" || { cat "$out/demo.txt"; exit 1; }

# Every frame kestrelctl sent or received, in order, as "command|type number len"; tshark also
# gives each packet's size: the 16-byte header and the frame with its alignment bytes.
sed -nE 's/^(sent )?(command|type) ([0-9]+) \([^)]*\)  len ([0-9]+).*/\2 \3 \4/p' \
  "$out/session.txt" > "$out/printed.txt"
tshark -r "$cap" -T fields -e kestrel.command -e kestrel.type -e kestrel.len -e frame.len |
  awk -F'\t' '{ kind = $1 != "" ? "command " $1 : "type " $2
                print kind, $3 (($4 == 16 + int(($3 + 3) / 4) * 4) ? "" : " but packet " $4) }' \
  > "$out/tshark.txt"
check "tshark finds the $(wc -l < "$out/printed.txt") frames printed, with their lengths" \
  diff "$out/printed.txt" "$out/tshark.txt"
check "no malformed packet, no expert note" \
  test "$(tshark -r "$cap" -V | grep -cE 'Malformed|Lua Error|Expert Info')" = 0

# The dissector's fields against decode --json: values as text, one-item lists as the item,
# bytes without separators, empty fields left out.
norm='def norm: if type == "array" then (map(tostring) | if length == 1 then .[0] else . end)
                else tostring end;
      def clean: with_entries(select(.value != "" and .value != [] and .value != null)
                              | .value |= norm);'
"$ctl" decode --json "$cap" 2>/dev/null > "$out/decode.json"
jq -cS "$norm"' del(.time) | . + .fields | del(.fields) | clean' "$out/decode.json" \
  > "$out/decode_fields.txt"
tshark -r "$cap" -T ek | jq -cS "$norm"' select(.layers) | [.layers.kestrel[1] | .. | objects
    | to_entries[] | select(.key | startswith("kestrel_kestrel_"))
    | {key: .key[16:], value: (.value | if type == "array" then map(gsub(":"; ""))
                                        else gsub(":"; "") end)}] | from_entries | clean' \
  > "$out/tshark_fields.txt"
check "the dissector shows the fields decode --json prints" \
  diff "$out/decode_fields.txt" "$out/tshark_fields.txt"

# A phone's capture: packets of the route (0) and generic (16) protocols amid ours, one of them
# of type 2 as our samples are. decode prints the same frames and counts the others.
printf '%s\n' "0000 00 04 03 38 00 00 00 00 00 00 00 00 00 00 00 00" \
  "0010 10 00 00 00 10 00 00 00 00 00 00 00 00 00 00 00" \
  "0000 00 04 03 38 00 00 00 00 00 00 00 00 00 00 00 10" \
  "0010 20 00 00 00 02 00 00 00 00 00 00 00 00 00 00 00" \
  "0020 00 00 00 00 01 00 00 00 02 00 00 00 03 00 00 00" > "$out/foreign.txt"
text2pcap -q -F pcap -l 253 "$out/foreign.txt" "$out/foreign.pcap" 2>/dev/null
editcap -F pcap -r "$cap" "$out/head.pcap" 1-20 && editcap -F pcap "$cap" "$out/tail.pcap" 1-20
mergecap -F pcap -a -w "$out/phone.pcap" "$out/head.pcap" "$out/foreign.pcap" "$out/tail.pcap" \
  >/dev/null
"$ctl" decode "$cap" > "$out/session_text.txt" 2>/dev/null
"$ctl" decode "$out/phone.pcap" > "$out/phone.txt" 2> "$out/phone.err"
check "foreign packets skipped" diff "$out/session_text.txt" "$out/phone.txt"
check "and counted" grep -qx "kestrelctl: $(wc -l < "$out/printed.txt") frames of netlink protocol \
23; 2 packets of other protocols skipped" "$out/phone.err"

# The session as tcpdump on any writes it, LINUX_SLL (the same header) and LINUX_SLL2 (20 bytes:
# protocol, reserved, interface index, ARPHRD type, packet type, address length, address), with a
# loopback packet first: decode prints the same frames at the same times and counts that one.
relink() {  # link type, output file
  command tshark -r "$cap" -T json -x 2>/dev/null |
    jq -r '.[]._source.layers | [.frame["frame.time_epoch"], .frame_raw[0]] | @tsv' |
    awk -F'\t' -v sll2=$(($1 == 276)) 'function emit(time, h,  i, j, line) {
        if (sll2) h = substr(h, 29, 4) "000000000001" substr(h, 5, 4) substr(h, 3, 2) \
          substr(h, 11, 2) substr(h, 13, 16) substr(h, 33)
        print time
        for (i = 1; i <= length(h); i += 32) { line = sprintf("%06x", (i - 1) / 2)
          for (j = i; j < i + 32 && j <= length(h); j += 2) line = line " " substr(h, j, 2)
          print line } }
      NR == 1 { emit($1, "0000030400060000000000000000080045000014") }
      { emit($1, $2) }' > "$out/relink.txt"
  text2pcap -q -F pcap -t "%s.%f" -l "$1" "$out/relink.txt" "$2" 2>/dev/null
}
for link in 113:LINUX_SLL 276:LINUX_SLL2; do
  relink "${link%%:*}" "$out/any.pcap"
  "$ctl" decode --json "$out/any.pcap" > "$out/any.json" 2> "$out/any.err"
  check "${link#*:}: the same frames" diff "$out/decode.json" "$out/any.json"
  check "${link#*:}: and the loopback packet counted" grep -qx "kestrelctl: $(wc -l < \
"$out/printed.txt") frames of netlink protocol 23; 1 packets of other protocols skipped" \
    "$out/any.err"
done

# Live on the namespace's loopback, as Ethernet (lo) and as LINUX_SLL (any), ended by Ctrl-C or by
# --seconds: every packet seen is counted as carrying no netlink (this host has no nlmon), and the
# capture kept reads back the same. Each run ends within 30 s whatever happens.
kept() { "$ctl" decode "$out/live.pcap" 2>&1 | sed -nE 's/.*; ([0-9]+) packets .*/\1/p'; }
ip link set lo up
for run in "lo EN10MB int" "any LINUX_SLL --seconds=3"; do
  set -- $run
  rm -f "$out/live.pcap" "$out/live.err"
  timeout -s KILL 30 "$ctl" decode --live "$1" --pcap "$out/live.pcap" ${3#int} \
    > "$out/live.txt" 2> "$out/live.err" &
  live=$!
  for _ in $(seq 100); do grep -q listening "$out/live.err" && break; sleep 0.1; done
  for port in 9 10 11; do echo probe > /dev/udp/127.0.0.1/$port; done
  if [ "$3" = int ]; then  # once the probes and their answers are in, Ctrl-C
    for _ in $(seq 100); do [ "$(kept)" -ge 6 ] 2>/dev/null && break; sleep 0.1; done
    kill -INT $(pgrep -P $live) 2>/dev/null || true
  fi
  status=0; wait $live || status=$?; live=
  check "live on $1 ($2): started" grep -qx "kestrelctl: listening on $1, link type $2.*" \
    "$out/live.err"
  seen=$(sed -nE 's/^kestrelctl: 0 frames of netlink protocol 23; ([0-9]+) packets .*/\1/p' \
    "$out/live.err")
  check "live on $1 ($3): exit 0, the 3 probes and their answers counted" \
    test "$status" = 0 -a "${seen:-0}" -ge 6 -a ! -s "$out/live.txt"
  check "live on $1: the capture kept holds them" test "$(kept)" = "$seen"
done

# A file that ends inside its last packet, and a capture whose packets were cut to 40 bytes: the
# frames before the packet, then an error that names it, exit status 4.
packets=$(wc -l < "$out/printed.txt")
head -c $(($(stat -c %s "$cap") - 10)) "$cap" > "$out/cut.pcap"
status=0
"$ctl" decode --json "$out/cut.pcap" > "$out/cut.json" 2> "$out/cut.err" || status=$?
check "a cut file: the frames before the last packet" \
  diff "$out/cut.json" <(head -n $((packets - 1)) "$out/decode.json")
check "then exit 4, naming packet $packets" failed_with $status "kestrelctl: packet $packets: \
truncated dump file; tried to read $(tail -n 1 "$out/tshark.txt" | awk '{ print $3 + 16 }') \
captured bytes, only got $(($(tail -n 1 "$out/tshark.txt" | awk '{ print $3 + 16 }') - 10))" \
  "$out/cut.err"
editcap -F pcap -s 40 "$cap" "$out/snapped.pcap"
first=$(tshark -r "$cap" -Y "frame.len > 40" -T fields -e frame.number | head -n 1)
status=0
"$ctl" decode --json "$out/snapped.pcap" > "$out/snapped.json" 2> "$out/snapped.err" || status=$?
check "a cut packet: the frames before packet $first" \
  diff "$out/snapped.json" <(head -n $((first - 1)) "$out/decode.json")
check "then exit 4, naming it" failed_with $status "kestrelctl: packet $first is cut short: \
24 of its 88 bytes were captured (capture with tcpdump -s 0)" "$out/snapped.err"

# The CSV: one row a sample frame of the stream, time from the first, values in g.
jq -r 'select(.type == 2) | "\(.time) \(.fields.values[0:3] | map(. / 4096) | join(" "))"' \
  "$out/decode.json" > "$out/samples.txt"
check "the CSV holds the $(wc -l < "$out/samples.txt") samples sent, in g" \
  awk -F'[ ,]' 'NR == FNR { t[NR] = $1; x[NR] = $2; y[NR] = $3; z[NR] = $4; n = NR; next }
    FNR == 1 { bad = $0 != "time_s,x_g,y_g,z_g"; next }
    { i = FNR - 1; d = ($1 - (t[i] - t[1]))^2 + ($2 - x[i])^2 + ($3 - y[i])^2 + ($4 - z[i])^2
      if (d > 1e-11) bad = 1 }
    END { exit bad || FNR - 1 != n }' "$out/samples.txt" "$out/accel.csv"
check "and the plot is a PNG" test "$(head -c 4 "$out/accel.png" | tail -c 3)" = PNG

exit $((failures > 0))
