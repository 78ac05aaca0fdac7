#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# Makes sure the Debian packages a target needs are installed: installs them with apt-get when
# run as root, and otherwise says exactly what to install.
#   scripts/deps.sh base|fuzz|soak|arm64|vm
set -euo pipefail

# libpcap writes and reads kestrelctl's captures, gnuplot draws its plots; tshark (with
# text2pcap, editcap and mergecap) and jq read the captures in the tests.
packages=(cmake ninja-build g++ libgtest-dev libgmock-dev libbenchmark-dev android-liblog-dev
          iproute2 util-linux libpcap-dev gnuplot-nox tshark jq)
case "${1:-base}" in
  base) ;;
  fuzz) packages+=(clang libclang-rt-dev) ;;
  soak) packages+=(valgrind) ;;
  arm64)
    # The cross compiler, qemu-user to run what it builds, bpfmt for Android.bp, and liblog and
    # GoogleTest for arm64 from Debian's multiarch, which needs arm64 as a foreign architecture
    # (added here as root; the install below then updates the package lists).
    packages+=(g++-aarch64-linux-gnu qemu-user blueprint-tools android-liblog-dev:arm64
               libgtest-dev:arm64 libgmock-dev:arm64 libpcap-dev:arm64)
    if command -v dpkg >/dev/null 2>&1 &&
        ! dpkg --print-foreign-architectures | grep -qx arm64; then
      if [ "$(id -u)" -eq 0 ]; then
        echo "Adding arm64 as a foreign architecture"
        dpkg --add-architecture arm64
      else
        echo "Enable arm64 packages first:" \
             "sudo dpkg --add-architecture arm64 && sudo apt-get update" >&2
      fi
    fi
    ;;
  vm)
    # A kernel to boot with the headers to build the module against (the same version: the
    # metapackages), the emulator, busybox for the VM's userland, sparse for the module's check
    # and cpio for the initramfs. ARCH picks the kernel and emulator (scripts/vm/arch.sh).
    case "${ARCH:-x86_64}" in
      x86_64) packages+=(linux-image-amd64 linux-headers-amd64 qemu-system-x86) ;;
      arm64)
        # The arm64 cross build's packages (arm64 as a foreign architecture first), the emulator,
        # and the build machine's kernel headers: their common part and kbuild helpers build the
        # module against Debian's arm64 headers of the same version, which scripts/vm/arm64.sh
        # fetches with the arm64 kernel, busybox and bash (bash:arm64 loads libtinfo6:arm64).
        "$0" arm64
        packages+=(qemu-system-arm "linux-headers-$(dpkg --print-architecture)" libtinfo6:arm64) ;;
    esac
    packages+=(busybox-static sparse cpio make)
    ;;
  *) echo "usage: $0 base|fuzz|soak|arm64|vm" >&2; exit 2 ;;
esac

if ! command -v dpkg-query >/dev/null 2>&1; then
  echo "kestreld builds on Debian: it needs the packages ${packages[*]}" >&2
  exit 1
fi

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done
[ ${#missing[@]} -eq 0 ] && exit 0

if [ "$(id -u)" -eq 0 ]; then
  echo "Installing ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq "${missing[@]}" >/dev/null
else
  echo "Missing Debian packages: ${missing[*]}" >&2
  echo "Install them with:  sudo apt-get install ${missing[*]}" >&2
  exit 1
fi
