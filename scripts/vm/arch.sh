# The architecture-specific part of `make vm-test`, sourced by scripts/vm_test.sh: which kernel
# boots, which emulator and machine, the console, the module's cross-build variables, the build
# directory of the target's programs and how their shared libraries are found. ARCH=x86_64 is the
# default; another architecture adds a case here and nothing else.
#
# Sets: kernel_suffix, qemu (array, without the accelerator), kvm_cpu, console, module_make (array), target_build, cmake_args
# (array), list_libs (a function printing the absolute paths of the libraries a program needs).

case "$ARCH" in
  x86_64)
    kernel_suffix=amd64
    qemu=(qemu-system-x86_64 -M q35 -m 512)
    kvm_cpu=host
    console=ttyS0
    module_make=()
    target_build=${BUILD:-build}
    cmake_args=()
    list_libs() { ldd "$1" 2>/dev/null | grep -o '/[^ ]*' | sort -u; }
    ;;
  *)
    echo "vm-test: no settings for ARCH=$ARCH (scripts/vm/arch.sh)" >&2
    exit 2
    ;;
esac
