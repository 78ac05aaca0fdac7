# SPDX-License-Identifier: Apache-2.0
# shellcheck shell=bash disable=SC2034  # the settings are read by scripts/vm_test.sh
# ARCH=arm64 of `make vm-test`, sourced by scripts/vm/arch.sh: Debian's arm64 kernel booted by
# qemu-system-aarch64 (-M virt, cortex-a57, software emulation), the module cross-built against
# Debian's arm64 headers of the same version, Debian's arm64 busybox and bash, and kestreld,
# kestrel-sim and kestrelctl from the arm64 cross build (build-arm64, configured as
# scripts/arm64_test.sh configures it, so the two runs share it) with their libraries from
# Debian's arm64 multiarch packages, the loader and C library the qemu-user run uses too.
#
# The kernel is the one whose headers the build machine's kbuild was built for: Debian's kbuild
# package (linux-kbuild-X.Y: fixdep, modpost, genksyms...) is Multi-Arch: foreign, so the build
# machine's own build of those helpers, from the same kernel source and version, serves the arm64
# headers (docs/device.md). The packages are fetched with apt-get download and unpacked into
# build-vm-arm64: nothing of the arm64 kernel is installed on the build machine.

kernel_suffix=arm64
qemu=(qemu-system-aarch64 -M virt -m 512)
tcg_cpu=cortex-a57
kvm_cpu=  # the build machine is not arm64: software emulation only
console=ttyAMA0  # the virt machine's PL011, built into the kernel
module_make=(ARCH=arm64 CROSS_COMPILE=aarch64-linux-gnu-)
target_build=build-arm64
cmake_args=(-DCMAKE_TOOLCHAIN_FILE=cmake/aarch64-linux-gnu.cmake -DCMAKE_BUILD_TYPE=Release
            -DKESTREL_BUILD_FUZZ=OFF)

# The virt machine has one UART: the results come out on a virtio console (virtio goes over MMIO
# there; virtio_mmio and virtio_console are modules of Debian's arm64 kernel).
results_tty=hvc0
results_args() {
  printf '%s\n' -device virtio-serial-device -chardev "file,id=results,path=$1" \
    -device virtconsole,chardev=results
}

# The build machine's kbuild helpers, their version, and the kernel ABI name of that version (the
# 6.1.0-56 of 6.1.192-2), from the headers' common part installed with them.
arm64_kernel_version() {
  local kbuild
  kbuild=$(dpkg-query -W -f '${Package} ${Version} ${db:Status-Status}\n' 'linux-kbuild-*' \
             2> /dev/null | awk '$3 == "installed"' | sort -V | tail -n 1)
  [ -n "$kbuild" ] || { echo "vm-test: no linux-kbuild installed: run make vm-test-arm64" >&2
                        return 1; }
  kbuild_dir=/usr/lib/${kbuild%% *}
  kernel_version=$(awk '{print $2}' <<< "$kbuild")
  kernel_abi=$(dpkg-query -W -f '${Package} ${Version} ${db:Status-Status}\n' \
                 'linux-headers-*-common' 2> /dev/null |
               awk -v v="$kernel_version" '$2 == v && $3 == "installed" {print $1}' |
               sed 's/^linux-headers-//; s/-common$//' | sort -V | tail -n 1)
  [ -n "$kernel_abi" ] || { echo "vm-test: no linux-headers-*-common $kernel_version installed:" \
                                 "run make vm-test-arm64" >&2; return 1; }
}

# Fetches and unpacks the kernel image and the modules the VM loads (of the image package's 350 MB
# only those), the headers, busybox and bash into DIR/root, once a kernel version.
arm64_unpack() {
  local dir=$1 release=$kernel_abi-arm64 deb
  local debs=$dir/debs root=$dir/root
  local kmod=./lib/modules/$release/kernel/drivers
  local modules=("$kmod/virtio/virtio_mmio.ko" "$kmod/char/virtio_console.ko"
                 "$kmod/net/nlmon.ko")
  if [ ! -e "$root/.unpacked-$release" ]; then
    rm -rf "$debs" "$root"
    mkdir -p "$debs" "$root"
    (cd "$debs" && apt-get download -q "linux-image-$release:arm64=$kernel_version" \
       "linux-headers-$release:arm64=$kernel_version" busybox-static:arm64 bash:arm64 2>&1 |
       grep -v '^W: Download is') || true
    dpkg-deb --fsys-tarfile "$debs"/linux-image-*.deb |
      tar -x -C "$root" --wildcards "./boot/vmlinuz-$release" "${modules[@]}" || return 1
    for deb in "$debs"/linux-headers-*.deb "$debs"/busybox-static_*.deb; do
      dpkg-deb -x "$deb" "$root" || return 1
    done
    dpkg-deb --fsys-tarfile "$debs"/bash_*.deb | tar -x -C "$root" ./bin/bash || return 1
    # The headers name the kbuild helpers by a relative link: the build machine's, as said above.
    ln -sfn "$kbuild_dir/scripts" "$root/usr/src/linux-headers-$release/scripts"
    ln -sfn "$kbuild_dir/tools" "$root/usr/src/linux-headers-$release/tools"
    touch "$root/.unpacked-$release"
  fi
  boot_modules=("${modules[@]:0:2}")
  boot_modules=("${boot_modules[@]/#./$root}")
}

arm64_kernel_version || exit 1
arm64_unpack build-vm-arm64 || { echo "vm-test: could not fetch Debian's arm64 kernel" >&2; exit 1; }
kernel_root=$PWD/build-vm-arm64/root
busybox=$kernel_root/bin/busybox
bash=$kernel_root/bin/bash
ip=  # busybox's ip adds the nlmon link

# What an arm64 program loads: the loader, then every library it needs, breadth first, from the
# multiarch directories (liblog in the android one, which the programs' RUNPATH names).
list_libs() {
  local dirs=(/lib/aarch64-linux-gnu /usr/lib/aarch64-linux-gnu
              /usr/lib/aarch64-linux-gnu/android)
  local -A seen=()
  local queue=("$1") file lib dir found
  echo /lib/ld-linux-aarch64.so.1
  while [ ${#queue[@]} -gt 0 ]; do
    file=${queue[0]}
    queue=("${queue[@]:1}")
    for lib in $(aarch64-linux-gnu-readelf -d "$file" |
                 sed -n 's/.*(NEEDED).*\[\(.*\)\]/\1/p'); do
      [ -z "${seen[$lib]:-}" ] || continue
      seen[$lib]=1
      found=
      for dir in "${dirs[@]}"; do
        if [ -e "$dir/$lib" ]; then found=$dir/$lib; break; fi
      done
      [ -n "$found" ] || { echo "vm-test: $file needs $lib, not installed for arm64" >&2
                           return 1; }
      echo "$found"
      queue+=("$found")
    done
  done
}
