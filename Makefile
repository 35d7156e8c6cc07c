# Thin wrapper around CMake. `make demo` and `make test` work on a fresh
# Debian machine: they install what is missing first (scripts/deps.sh).
BUILD ?= build
JOBS ?= $(shell nproc)

.PHONY: all deps configure build demo test asan-test bench fuzz install clean

all: build

deps:
	@scripts/deps.sh

configure: deps
	@cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null

build: configure
	@cmake --build $(BUILD) -j$(JOBS)

demo: build
	@scripts/demo.sh $(BUILD)

test: build
	@cd $(BUILD) && ctest --output-on-failure -j$(JOBS)

asan-test: deps
	@cmake -S . -B build-asan -DCMAKE_BUILD_TYPE=Debug -DQUVAIDX_SANITIZE=ON >/dev/null
	@cmake --build build-asan -j$(JOBS)
	@cd build-asan && ctest --output-on-failure -j$(JOBS)

bench: deps
	@cmake -S . -B build-bench -DCMAKE_BUILD_TYPE=Release -DQUVAIDX_BUILD_TESTS=OFF -DQUVAIDX_BUILD_BENCH=ON >/dev/null
	@cmake --build build-bench -j$(JOBS)
	@scripts/bench.sh build-bench

fuzz: deps
	@CC=clang CXX=clang++ cmake -S . -B build-fuzz -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUVAIDX_BUILD_TESTS=OFF -DQUVAIDX_BUILD_TOOLS=OFF -DQUVAIDX_BUILD_DAEMONS=OFF -DQUVAIDX_BUILD_FUZZ=ON >/dev/null
	@cmake --build build-fuzz -j$(JOBS)
	@scripts/fuzz.sh build-fuzz $(FUZZ_SECONDS)

install: build
	@cmake --install $(BUILD) --prefix $(or $(PREFIX),/usr/local)

clean:
	rm -rf build build-asan build-bench build-fuzz
