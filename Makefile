# SPDX-License-Identifier: Apache-2.0
# The two commands of a fresh Debian machine: `make demo` and `make test`. Both install what is
# missing through apt-get when run as root, and say what to install otherwise.
BUILD ?= build

.PHONY: all build deps test demo fuzz clean arm64-test vm-test vm-test-arm64 bench soak chaos

all: build

deps:
	@scripts/deps.sh base

build: deps
	@cmake -S . -B $(BUILD) -G Ninja >/dev/null
	@cmake --build $(BUILD)

test: deps
	@scripts/run_tests.sh

demo: build
	@scripts/demo.sh $(BUILD)

# The libFuzzer targets, built with clang in build-fuzz and run one after another for FUZZ_SECONDS
# each (default 60); fails on any crash, leak or sanitizer report.
fuzz:
	@scripts/deps.sh fuzz
	@FUZZ_SECONDS=$(or $(FUZZ_SECONDS),60) fuzz/run_fuzzers.sh build-fuzz

# The arm64 build with its tests under qemu-user, Android.bp through bpfmt, and the device side
# compiled for arm64 (scripts/arm64_test.sh; docs/device.md).
arm64-test:
	@scripts/deps.sh arm64
	@scripts/arm64_test.sh

# The daemon against a real Linux kernel: the factory driver module (kernel/) built against the
# headers of the kernel that boots under qemu, the daemon, kestrel-sim and kestrelctl in its
# initramfs, a session through /dev/kestrel_factory captured on nlmon0 (scripts/vm_test.sh;
# docs/device.md). ARCH=x86_64 by default; ARCH=arm64 (or vm-test-arm64) boots Debian's arm64
# kernel under qemu-system-aarch64 with the arm64 build of the daemon and its tools.
vm-test:
	@scripts/deps.sh vm
	@scripts/vm_test.sh

vm-test-arm64:
	@$(MAKE) --no-print-directory vm-test ARCH=arm64

# The benchmarks, built in Release in build-bench and run against their limits; rewrites
# docs/performance.md with the figures (scripts/bench.sh).
bench: deps
	@scripts/bench.sh

# The long run: one million sample indications and one hundred thousand commands against the
# healthy phone, then a shorter run under valgrind memcheck (scripts/soak.sh; figures in
# docs/reliability.md).
soak:
	@scripts/deps.sh soak
	@cmake -S . -B $(BUILD) -G Ninja >/dev/null
	@cmake --build $(BUILD) --target kestrel-soak
	@scripts/soak.sh $(BUILD)

# The chaos run: a seeded random schedule of link faults and commands for CHAOS_MINUTES (default
# 5; CHAOS_SEED, CHAOS_TSAN_MINUTES), then a shorter run of the daemon built with ThreadSanitizer
# (scripts/chaos.sh; figures in docs/reliability.md).
chaos: deps
	@cmake -S . -B $(BUILD) -G Ninja >/dev/null
	@cmake --build $(BUILD) --target kestrel-chaos
	@scripts/chaos.sh $(BUILD)

clean:
	rm -rf build build-*
