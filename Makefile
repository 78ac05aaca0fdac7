# The two commands of a fresh Debian machine: `make demo` and `make test`. Both install what is
# missing through apt-get when run as root, and say what to install otherwise.
BUILD ?= build

.PHONY: all build deps test demo clean

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

clean:
	rm -rf build build-*
