# shellcheck shell=bash
# The arm64 cross build's configuration, shared by scripts/arm64_test.sh and the arm64 VM test so
# that both use one build directory: arm64_configure DIR [CMAKE OPTION...].
arm64_configure() {
  local dir=$1
  shift
  cmake --no-warn-unused-cli -S . -B "$dir" -G Ninja \
        -DCMAKE_TOOLCHAIN_FILE=cmake/aarch64-linux-gnu.cmake "$@" >/dev/null
}
