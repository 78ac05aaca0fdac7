#!/usr/bin/env bash
# SPDX-License-Identifier: Apache-2.0
# The phone's side, as far as a workstation can check it (docs/device.md):
#   1. the daemon, its host stand-ins and the tests cross-built for arm64 (build-arm64), and every
#      test that runs in-process run under qemu-user, each in its own network namespace. Left out:
#      tests that start kestreld, kestrel-sim or kestrelctl as processes (label "spawns") and
#      death tests, which run their own binary again: without binfmt_misc the kernel cannot exec
#      an arm64 program. Android.bp is checked with bpfmt among these tests.
#   2. the device side compiled for arm64 with the device platform file and the phone's header
#      layout (KESTREL_PLATFORM=device), with g++ and with clang (build-arm64-device,
#      build-arm64-device-clang), and the functions it takes from the phone's libraries.
# Run through `make arm64-test`, which installs what is missing first (scripts/deps.sh arm64).
set -euo pipefail

cd "$(dirname "$0")/.."
toolchain=cmake/aarch64-linux-gnu.cmake
jobs=2

step() { printf '\n== %s\n' "$*"; }
elapsed() { printf '   (%d s)\n' $((SECONDS - $1)); }

if ! command -v qemu-aarch64 >/dev/null 2>&1; then
  echo "qemu-aarch64 not found: run scripts/deps.sh arm64" >&2
  exit 1
fi
if [ -e /proc/sys/fs/binfmt_misc/qemu-aarch64 ]; then
  echo "note: binfmt_misc runs arm64 programs here, but the spawning tests stay out so that" \
       "every machine runs the same set"
fi

start=$SECONDS
step "arm64 build (build-arm64)"
t=$SECONDS
cmake --no-warn-unused-cli -S . -B build-arm64 -G Ninja -DCMAKE_TOOLCHAIN_FILE=$toolchain \
      -DCMAKE_BUILD_TYPE=Release -DKESTREL_BUILD_BENCH=OFF -DKESTREL_BUILD_FUZZ=OFF >/dev/null
# Only the test binaries that run here (each test is named after its target), and the programs.
targets=$(cd build-arm64 && ctest -N -LE 'spawns|device' | sed -n 's/^ *Test *#[0-9]*: //p')
cmake --build build-arm64 --target kestreld $targets -- -j$jobs
elapsed $t

step "tests under qemu-user"
t=$SECONDS
# qemu-user refuses NETLINK_USERSOCK and passes NETLINK_KOBJECT_UEVENT (15) through untouched: the
# tests' kernel channel and their kernel ports talk that protocol here.
export KESTREL_NETLINK_PROTOCOL=15
echo "left out (they run arm64 programs as processes):"
(cd build-arm64 && ctest -N -L spawns | sed -n 's/^ *Test *#[0-9]*: /   /p')
echo "and the death tests (*DeathTest.*): each runs its own arm64 binary again"
# gtest reads GTEST_FILTER from the environment, which ctest passes on to every test.
(cd build-arm64 && GTEST_FILTER='-*DeathTest.*' ctest -LE spawns -j$jobs --output-on-failure)
elapsed $t

# The functions the phone's libraries must export for the daemon: everything its objects need that
# neither they nor the C and C++ runtimes nor liblog define.
phone_library_symbols='Diag_LSM_DeInit Diag_LSM_Init __system_property_get
diag_configure_peripheral_buffering_tx_mode sensor1_alloc_msg_buf sensor1_close
sensor1_free_msg_buf sensor1_init sensor1_open sensor1_write sensor_reg_close sensor_reg_open
sensor_reg_read'

check_phone_library_symbols() {
  local nm=aarch64-linux-gnu-nm objs needed runtime
  objs=$(find "$1" -path '*/kestreld*.dir/*' -name '*.o')
  symbols() { grep -v -e ':$' -e '^$' | sed 's/@.*//' | sort -u; }
  runtime=$(
    for lib in libc.so.6 libm.so.6 libstdc++.so.6 libgcc_s.so.1 ld-linux-aarch64.so.1; do
      $nm -D --defined-only --format=just-symbols /usr/aarch64-linux-gnu/lib/$lib
    done
    $nm -D --defined-only --format=just-symbols /usr/lib/aarch64-linux-gnu/android/liblog.so
    $nm --defined-only --format=just-symbols "$(aarch64-linux-gnu-gcc -print-libgcc-file-name)" \
        2>/dev/null)
  needed=$(comm -23 <($nm -u --format=just-symbols $objs | symbols) \
                    <($nm --defined-only --format=just-symbols $objs | symbols))
  needed=$(comm -23 <(echo "$needed") <(echo "$runtime" | symbols))
  if [ "$needed" != "$(tr ' \n' '\n\n' <<<"$phone_library_symbols" | sort)" ]; then
    echo "the device build needs other functions of the phone's libraries than these:" >&2
    diff <(tr ' \n' '\n\n' <<<"$phone_library_symbols" | sort) <(echo "$needed") >&2 || true
    return 1
  fi
  echo "takes from the phone's libraries exactly:" $phone_library_symbols
}

for compiler in gcc clang; do
  dir=build-arm64-device
  options=()
  if [ $compiler = clang ]; then
    dir=build-arm64-device-clang
    options=(-DKESTREL_CROSS_CLANG=ON)
  fi
  step "device side compiled for arm64 with $compiler ($dir)"
  t=$SECONDS
  cmake --no-warn-unused-cli -S . -B $dir -G Ninja -DCMAKE_TOOLCHAIN_FILE=$toolchain \
        -DKESTREL_PLATFORM=device "${options[@]}" >/dev/null
  cmake --build $dir -- -j$jobs
  if [ $compiler = gcc ]; then check_phone_library_symbols $dir; fi
  elapsed $t
done

step "arm64 checks passed in $((SECONDS - start)) s"
