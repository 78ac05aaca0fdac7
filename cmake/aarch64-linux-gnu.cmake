# SPDX-License-Identifier: Apache-2.0
# Cross build for 64-bit ARM, the phone's ABI, with Debian's g++-aarch64-linux-gnu against the
# arm64 packages of Debian's multiarch (android-liblog-dev:arm64, libgtest-dev:arm64,
# libgmock-dev:arm64). The programs run under qemu-user (see below):
#   cmake -S . -B build-arm64 -G Ninja -DCMAKE_TOOLCHAIN_FILE=cmake/aarch64-linux-gnu.cmake
set(CMAKE_SYSTEM_NAME Linux)
set(CMAKE_SYSTEM_PROCESSOR aarch64)
set(CMAKE_LIBRARY_ARCHITECTURE aarch64-linux-gnu)

# Debian's cross g++ by default; with -DKESTREL_CROSS_CLANG=ON, clang for the same target and
# against the same cross libraries (the phone's own compiler is clang).
if(KESTREL_CROSS_CLANG)
  set(CMAKE_C_COMPILER clang)
  set(CMAKE_CXX_COMPILER clang++)
  set(CMAKE_C_COMPILER_TARGET aarch64-linux-gnu)
  set(CMAKE_CXX_COMPILER_TARGET aarch64-linux-gnu)
else()
  set(CMAKE_C_COMPILER aarch64-linux-gnu-gcc)
  set(CMAKE_CXX_COMPILER aarch64-linux-gnu-g++)
endif()

# The cross toolchain's own C library and libstdc++ live in /usr/aarch64-linux-gnu; the multiarch
# libraries (liblog, GoogleTest) in /usr/lib/aarch64-linux-gnu, found through
# CMAKE_LIBRARY_ARCHITECTURE. Programs of the build machine (unshare, bpfmt) come from its PATH.
set(CMAKE_FIND_ROOT_PATH /usr/aarch64-linux-gnu)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY BOTH)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE BOTH)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE BOTH)

# qemu-user runs each test binary. The programs load at run time the arm64 dynamic loader, C
# library and libstdc++ of Debian's multiarch packages (the dependencies of liblog:arm64), whose
# loader and C library always come as a pair: -L / keeps qemu from mapping paths into a sysroot.
# (With -L /usr/aarch64-linux-gnu the cross toolchain's loader would find the multiarch C library
# through the system's ld.so.cache, and a loader and C library of two different builds hang the
# first pthread_create.)
find_program(KESTREL_QEMU_AARCH64 qemu-aarch64)
if(KESTREL_QEMU_AARCH64)
  set(CMAKE_CROSSCOMPILING_EMULATOR ${KESTREL_QEMU_AARCH64} -L /)
endif()
