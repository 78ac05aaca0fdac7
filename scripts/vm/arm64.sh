# shellcheck shell=bash disable=SC2034  # the vm_* variables are read by the script sourcing this
# The arm64 target of the VM test, sourced by it: Debian's arm64 kernel booted by
# qemu-system-aarch64 (-M virt, cortex-a57, software emulation) into an initramfs with Debian's
# arm64 busybox, the factory-driver module cross-built against Debian's arm64 headers of the same
# version, and kestreld, kestrel-sim and kestrelctl from the arm64 cross build (build-arm64, the
# build scripts/arm64_test.sh makes) with their libraries from Debian's arm64 multiarch packages.
#
# The kernel is the one whose headers the build machine's kbuild was built for: Debian's kbuild
# package (linux-kbuild-X.Y: fixdep, modpost, genksyms...) is Multi-Arch: foreign, so the build
# machine's own build of those helpers, from the same kernel source and version, serves the arm64
# headers (docs/device.md). The packages are fetched with apt-get download and unpacked into the
# VM build directory: nothing of the arm64 kernel is installed on the build machine.
#
# Defines what every target defines:
#   vm_arch, vm_qemu (array), vm_console, vm_disk_args FILE, vm_module_make (array),
#   vm_prepare DIR   fetches and unpacks into DIR; sets vm_release, vm_kernel, vm_headers,
#                    vm_busybox and vm_modules (the kernel's modules the VM loads, in order)
#   vm_build_programs   builds kestreld, kestrel-sim and kestrelctl; sets vm_programs
#   vm_libs FILE...  prints the loader and every shared library the files need, as paths that
#                    are copied to the same paths in the initramfs

vm_arch=arm64
vm_qemu=(qemu-system-aarch64 -M virt -cpu cortex-a57 -accel tcg)
# The virt machine's PL011 UART, built into Debian's arm64 kernel.
vm_console=ttyAMA0
vm_module_make=(ARCH=arm64 CROSS_COMPILE=aarch64-linux-gnu-)

# virtio on the virt machine goes over MMIO: virtio_mmio and virtio_blk are modules of Debian's
# arm64 kernel (virtio itself is built in).
vm_disk_args() {
  printf '%s\n' -drive "file=$1,if=none,format=raw,id=out" -device virtio-blk-device,drive=out
}

# The version of the build machine's kbuild helpers, and the kernel ABI name of that version
# (6.1.0-56 for 6.1.192-2), from the headers' common part installed with them.
vm_arm64_version() {
  local kbuild
  kbuild=$(dpkg-query -W -f '${Package} ${Version} ${db:Status-Status}\n' 'linux-kbuild-*' \
             2>/dev/null | awk '$3 == "installed"' | sort -V | tail -1)
  [ -n "$kbuild" ] || { echo "no linux-kbuild package installed: run scripts/deps.sh vm-arm64" >&2
                        return 1; }
  vm_kbuild_dir=/usr/lib/${kbuild%% *}
  vm_kernel_version=$(awk '{print $2}' <<<"$kbuild")
  vm_abi=$(dpkg-query -W -f '${Package} ${Version} ${db:Status-Status}\n' \
             'linux-headers-*-common' 2>/dev/null |
           awk -v v="$vm_kernel_version" '$2 == v && $3 == "installed" {print $1}' |
           sed 's/^linux-headers-//; s/-common$//' | sort -V | tail -1)
  [ -n "$vm_abi" ] || { echo "no linux-headers-*-common of version $vm_kernel_version" \
                             "installed: run scripts/deps.sh vm-arm64" >&2; return 1; }
}

vm_prepare() {
  local dir=$1 debs=$1/debs root=$1/root deb
  vm_arm64_version || return 1
  vm_release=$vm_abi-arm64
  mkdir -p "$debs" "$root"
  local packages=("linux-image-$vm_release:arm64=$vm_kernel_version"
                  "linux-headers-$vm_release:arm64=$vm_kernel_version" busybox-static:arm64)
  if [ ! -e "$debs/.complete-$vm_release" ]; then
    rm -f "$debs"/*.deb
    (cd "$debs" && apt-get download -q "${packages[@]}" 2>&1 | grep -v '^W: Download is') ||
      { echo "apt-get download ${packages[*]} failed" >&2; return 1; }
    touch "$debs/.complete-$vm_release"
  fi
  vm_kernel=$root/boot/vmlinuz-$vm_release
  vm_headers=$root/usr/src/linux-headers-$vm_release
  vm_busybox=$root/bin/busybox
  local kmod=$root/lib/modules/$vm_release/kernel
  vm_modules=("$kmod/drivers/virtio/virtio_mmio.ko" "$kmod/drivers/block/virtio_blk.ko"
              "$kmod/drivers/net/nlmon.ko")
  if [ ! -e "$root/.complete-$vm_release" ]; then
    rm -rf "$root" && mkdir -p "$root"
    # Only the image and the three modules out of the image package's 350 MB.
    dpkg-deb --fsys-tarfile "$debs"/linux-image-*.deb |
      tar -x -C "$root" --wildcards ./boot/vmlinuz-\* "${vm_modules[@]/#$root/.}" || return 1
    for deb in "$debs"/linux-headers-*.deb "$debs"/busybox-static_*.deb; do
      dpkg-deb -x "$deb" "$root" || return 1
    done
    # The headers point at the kbuild helpers and the common headers by path: the helpers are the
    # build machine's (see above), the common headers the installed package of the same version.
    ln -sfn "$vm_kbuild_dir/scripts" "$vm_headers/scripts"
    ln -sfn "$vm_kbuild_dir/tools" "$vm_headers/tools"
    touch "$root/.complete-$vm_release"
  fi
  local f
  for f in "$vm_kernel" "$vm_busybox" "${vm_modules[@]}" "$vm_headers/Makefile" \
           "/usr/src/linux-headers-$vm_abi-common/Makefile" "$vm_kbuild_dir/scripts/basic/fixdep"; do
    [ -e "$f" ] || { echo "missing after unpacking: $f" >&2; return 1; }
  done
}

vm_build_programs() {
  # shellcheck source=scripts/arm64_build.sh
  source "$(dirname "${BASH_SOURCE[0]}")/../arm64_build.sh"
  arm64_configure build-arm64 -DCMAKE_BUILD_TYPE=Release -DKESTREL_BUILD_BENCH=OFF \
                  -DKESTREL_BUILD_FUZZ=OFF || return 1
  cmake --build build-arm64 --target kestreld kestrel-sim kestrelctl -- -j2 >/dev/null || return 1
  vm_programs=(build-arm64/kestreld build-arm64/tools/sim/kestrel-sim
               build-arm64/tools/ctl/kestrelctl)
}

# The libraries of Debian's arm64 multiarch packages, the pair of loader and C library the
# qemu-user run uses too; liblog sits in the android directory that the programs' RUNPATH names.
vm_libs() {
  local dirs=(/lib/aarch64-linux-gnu /usr/lib/aarch64-linux-gnu
              /usr/lib/aarch64-linux-gnu/android)
  local -A seen=()
  local queue=("$@") file lib dir found
  echo /lib/ld-linux-aarch64.so.1
  while [ ${#queue[@]} -gt 0 ]; do
    file=${queue[0]}
    queue=("${queue[@]:1}")
    for lib in $(aarch64-linux-gnu-readelf -d "$file" |
                 sed -n 's/.*(NEEDED).*\[\(.*\)\]/\1/p'); do
      [ -n "${seen[$lib]:-}" ] && continue
      seen[$lib]=1
      found=
      for dir in "${dirs[@]}"; do
        if [ -e "$dir/$lib" ]; then found=$dir/$lib; break; fi
      done
      [ -n "$found" ] || { echo "$file needs $lib, not found for arm64" >&2; return 1; }
      echo "$found"
      queue+=("$found")
    done
  done
}
