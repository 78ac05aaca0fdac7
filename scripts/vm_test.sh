#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# `make vm-test`: kestreld against a real Linux kernel. Builds the factory driver module against
# the headers of the kernel it boots (with W=1 and sparse, no warning allowed), packs an initramfs
# with the daemon, kestrel-sim, kestrelctl, the module and what they load, boots it under qemu
# (TCG unless KVM answers a short probe) and runs tests/vm/checks.sh inside: the demo session,
# broken-pipe recovery, malformed frames, the module reloaded and the daemon restarted, all
# through /dev/kestrel_factory with netlink protocol 23 and the kernel at port id 0, the whole
# session captured on nlmon0. Outside the VM the nlmon capture is decoded by kestrelctl and by the
# Wireshark dissector and compared with the session's own capture.
#
# ARCH (default x86_64) picks the settings of scripts/vm/arch.sh; VM_OUT (default BUILD/vm) keeps
# what the run leaves: the console, the results of the VM, both captures decoded.
set -euo pipefail
cd "$(dirname "$0")/.."
ARCH=${ARCH:-x86_64}
source scripts/vm/arch.sh
out=${VM_OUT:-$target_build/vm}
start=$SECONDS
rm -rf "$out"
mkdir -p "$out/results"

passed=0 failed=0
result() {  # PASS|FAIL, name
  echo "$1 $2"
  if [ "$1" = PASS ]; then passed=$((passed + 1)); else failed=$((failed + 1)); fi
}
finish() {
  echo "total $((SECONDS - start)) s"
  echo "$passed passed, $failed failed"
  [ "$failed" -eq 0 ] && [ "$passed" -gt 0 ]
  exit
}

# The newest kernel whose image and headers are both installed.
kroot=${KERNEL_ROOT:-$kernel_root}
kver=$(for image in "$kroot"/boot/vmlinuz-*-"$kernel_suffix"; do
         v=${image##*/vmlinuz-}
         [ -d "$kroot/usr/src/linux-headers-$v" ] && echo "$v"
       done | sort -V | tail -n 1)
if [ -z "$kver" ]; then
  echo "vm-test: no $kernel_suffix kernel with its headers: run scripts/deps.sh vm" >&2
  exit 1
fi
kimage=$kroot/boot/vmlinuz-$kver
echo "kernel $kver ($ARCH)"

# The module, built outside the source tree.
rm -rf "$out/module"
cp -r kernel "$out/module"
if make -C "$out/module" KDIR="$kroot/usr/src/linux-headers-$kver" "${module_make[@]}" W=1 C=1 \
     > "$out/module-build.log" 2>&1 && ! grep -qiE 'warning|error' "$out/module-build.log"; then
  result PASS "module builds with W=1 and sparse, without a warning"
else
  cat "$out/module-build.log"
  result FAIL "module builds with W=1 and sparse, without a warning"
  finish
fi

cmake -S . -B "$target_build" -G Ninja -DKESTREL_BUILD_BENCH=OFF "${cmake_args[@]}" > /dev/null
cmake --build "$target_build" --target kestreld kestrelctl kestrel-sim > /dev/null
ctl=$target_build/tools/ctl/kestrelctl
host_ctl=${HOST_KESTRELCTL:-$ctl}
if [ -z "${HOST_KESTRELCTL:-}" ] && [ "$target_build" != "${BUILD:-build}" ]; then
  # The captures are decoded outside the VM, by this machine's kestrelctl.
  cmake -S . -B "${BUILD:-build}" -G Ninja -DKESTREL_BUILD_BENCH=OFF > /dev/null
  cmake --build "${BUILD:-build}" --target kestrelctl > /dev/null
  host_ctl=${BUILD:-build}/tools/ctl/kestrelctl
fi

# The initramfs: busybox, bash for the scripts, iproute2's ip where the target has it, the
# programs in the build tree's layout, the two modules, and every library they load.
root=$out/root
mkdir -p "$root"/{bin,proc,sys,dev,tmp,results,lib/modules}
cp "$busybox" "$root/bin/busybox"
add() {  # program, path in the VM
  install -D -m 755 "$1" "$root$2"
  local lib
  for lib in $(list_libs "$1"); do
    [ -e "$root$lib" ] || install -D -m 755 "$lib" "$root$lib"
  done
}
add "$bash" /bin/bash
[ -z "$ip" ] || add "$ip" /usr/sbin/ip
mkdir -p "$root/lib/modules/boot"
n=0
for module in ${boot_modules[@]+"${boot_modules[@]}"}; do
  n=$((n + 1))
  cp "$module" "$root/lib/modules/boot/$n-${module##*/}"
done
echo "$results_tty" > "$root/results-tty"
for program in kestreld tools/ctl/kestrelctl tools/sim/kestrel-sim; do
  add "$target_build/$program" "/build/$program"
done
cp "$out/module/kestrel_factory.ko" "$root/lib/modules/"
nlmon=$(find "$kroot/lib/modules/$kver" -name 'nlmon.ko*' | head -n 1)
case "$nlmon" in
  *.xz) xz -dc "$nlmon" > "$root/lib/modules/nlmon.ko" ;;
  *.zst) zstd -qdc "$nlmon" > "$root/lib/modules/nlmon.ko" ;;
  *) cp "$nlmon" "$root/lib/modules/nlmon.ko" ;;
esac
install -D -m 755 scripts/vm/init "$root/init"
install -D -m 755 tests/vm/checks.sh "$root/checks.sh"
install -D -m 755 scripts/demo_session.sh "$root/scripts/demo_session.sh"
install -D -m 644 tools/sim/sample_registry.txt "$root/tools/sim/sample_registry.txt"
(cd "$root" && find . | cpio -o -H newc --quiet) | gzip -1 > "$out/initramfs.gz"

# KVM only when it boots the kernel to its panic (no root file system) within a few seconds.
accel=(-accel tcg -cpu "$tcg_cpu")
if [ "${VM_ACCEL:-}" != tcg ] && [ -n "$kvm_cpu" ] && [ -w /dev/kvm ] &&
    timeout 10 "${qemu[@]}" -accel kvm -cpu "$kvm_cpu" -display none -nodefaults -no-reboot \
      -kernel "$kimage" -append "panic=-1 loglevel=0" < /dev/null > /dev/null 2>&1; then
  accel=(-accel kvm -cpu "$kvm_cpu")
fi
echo "booting with ${accel[*]}"
mapfile -t results < <(results_args "$out/results.b64")
boot=$SECONDS
timeout "${VM_TIMEOUT:-170}" "${qemu[@]}" "${accel[@]}" -display none -nodefaults -no-reboot \
  -serial stdio "${results[@]}" -kernel "$kimage" -initrd "$out/initramfs.gz" \
  -append "console=$console panic=-1 loglevel=3 rdinit=/init" < /dev/null |
  tr -d '\r' | tee "$out/console.log" | grep -E '^(PASS|FAIL|boot|sent) ' || true
sed -i '/passed, .* failed (in the VM)/d' "$out/console.log"
echo "VM ran $((SECONDS - boot)) s"
passed=$((passed + $(grep -c '^PASS ' "$out/console.log" || true)))
failed=$((failed + $(grep -c '^FAIL ' "$out/console.log" || true)))

if sed -n '/kestrel-vm-results-begin/,/kestrel-vm-results-end/p' "$out/results.b64" |
    sed '1d;$d' | tr -d '\r' | base64 -d | tar -C "$out/results" -xf - 2> /dev/null &&
    [ -s "$out/results/nlmon.pcap" ]; then
  result PASS "results out of the VM"
else
  grep -vE '^(PASS|FAIL|boot|sent) ' "$out/console.log" | tail -n 30
  result FAIL "results out of the VM"
  finish
fi

# Both captures decoded to one line a frame, the time stamps left out. The nlmon capture holds
# every frame the session's capture holds, in the same order, and beside them only the frames
# that reached the module while no file had it open for reading (its dropped counter).
frames() { "$host_ctl" decode --json "$1" | sed -E 's/"time":[0-9.]+,//'; }
frames "$out/results/demo/session.pcap" > "$out/session.frames" || true
frames "$out/results/nlmon.pcap" > "$out/nlmon.frames" || true
dropped=$(cat "$out"/results/counters*.txt | grep -o 'dropped [0-9]*' |
          awk '{ n += $2 } END { print n + 0 }')
diff "$out/session.frames" "$out/nlmon.frames" > "$out/frames.diff" || true
only_session=$(grep -c '^<' "$out/frames.diff" || true)
only_nlmon=$(grep -c '^>' "$out/frames.diff" || true)
echo "frames: session $(wc -l < "$out/session.frames"), nlmon $(wc -l < "$out/nlmon.frames")," \
     "only on nlmon $only_nlmon, module dropped $dropped"
if [ -s "$out/session.frames" ] && [ "$only_session" -eq 0 ] && [ "$only_nlmon" = "$dropped" ]; then
  result PASS "nlmon capture decodes to the session's frames"
else
  head -n 20 "$out/frames.diff"
  result FAIL "nlmon capture decodes to the session's frames"
fi

dissect() { tshark -X lua_script:tools/wireshark/kestrel.lua -r "$out/results/nlmon.pcap" "$@"; }
kestrel=$(dissect -Y kestrel 2> /dev/null | wc -l)
malformed=$(dissect -Y '_ws.malformed && kestrel.direction != "to_daemon"' 2> /dev/null | wc -l)
echo "dissector: $kestrel kestrel frames, $malformed of the daemon malformed"
if [ "$kestrel" -eq "$(wc -l < "$out/nlmon.frames")" ] && [ "$malformed" -eq 0 ]; then
  result PASS "dissector reads the nlmon capture, no frame of the daemon malformed"
else
  result FAIL "dissector reads the nlmon capture, no frame of the daemon malformed"
fi
finish
