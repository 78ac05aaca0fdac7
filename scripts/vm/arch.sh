# SPDX-License-Identifier: Apache-2.0
# The architecture-specific part of `make vm-test`, sourced by scripts/vm_test.sh: which kernel
# boots, which emulator and machine, the console, the module's cross-build variables, the build
# directory of the target's programs and how their shared libraries are found. ARCH=x86_64 is the
# default; another architecture adds a case here and nothing else.
#
# Sets: kernel_suffix, qemu (array, without the accelerator), tcg_cpu, kvm_cpu (empty: never
# KVM), console, module_make (array), target_build, cmake_args (array), list_libs (a function
# printing the absolute paths of the libraries a program needs), kernel_root (where boot/ and
# usr/src/ of the kernel are; empty: this machine's), busybox, bash and ip (the target's programs;
# ip empty: busybox's), boot_modules (array: modules init loads first), results_tty and
# results_args FILE (the device the VM writes its results to, and qemu's options that put what is
# written there into FILE).

case "$ARCH" in
  x86_64)
    kernel_suffix=amd64
    qemu=(qemu-system-x86_64 -M q35 -m 512)
    tcg_cpu=max
    kvm_cpu=host
    console=ttyS0
    module_make=()
    target_build=${BUILD:-build}
    cmake_args=()
    list_libs() { ldd "$1" 2>/dev/null | grep -o '/[^ ]*' | sort -u; }
    kernel_root=
    busybox=$(command -v busybox)
    bash=$(command -v bash)
    ip=$(command -v ip)
    boot_modules=()
    results_tty=ttyS1
    results_args() { printf '%s\n' -serial "file:$1"; }
    ;;
  arm64)
    source scripts/vm/arm64.sh
    ;;
  *)
    echo "vm-test: no settings for ARCH=$ARCH (scripts/vm/arch.sh)" >&2
    exit 2
    ;;
esac
