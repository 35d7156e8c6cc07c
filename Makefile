# Thin wrapper around CMake. Every job installs the Debian packages it needs
# first (scripts/deps.sh), then configures, builds and runs, printing one
# line per step.
BUILD ?= build
JOBS ?= $(shell nproc)
# Steps, not directory chatter, from the makes that CMake runs.
MAKEFLAGS += --no-print-directory
step = @printf '==> %s\n' "$(1)"

.PHONY: all build demo test asan-test bench fuzz format-check install \
        uninstall clean

all: build

build:
	$(call step,Installing what the build needs)
	@scripts/deps.sh build
	$(call step,Configuring $(BUILD))
	@cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
	$(call step,Building)
	@cmake --build $(BUILD) -j$(JOBS)

# The demo needs the tool and the daemons only: no tests, no man pages.
demo:
	$(call step,Installing what the demo needs)
	@scripts/deps.sh demo
	$(call step,Configuring $(BUILD) for the demo)
	@cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DQUVAIDX_BUILD_TESTS=OFF -DQUVAIDX_BUILD_DOCS=OFF >/dev/null
	$(call step,Building the tool and the daemons)
	@cmake --build $(BUILD) -j$(JOBS)
	$(call step,Running the demo)
	@scripts/demo.sh $(BUILD)

test:
	$(call step,Installing what the tests need)
	@scripts/deps.sh test
	$(call step,Configuring $(BUILD) with the tests; warnings are errors)
	@cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DQUVAIDX_BUILD_TESTS=ON -DQUVAIDX_BUILD_DOCS=ON -DQUVAIDX_WERROR=ON \
	  >/dev/null
	$(call step,Building)
	@cmake --build $(BUILD) -j$(JOBS)
	$(call step,Running the tests)
	@cd $(BUILD) && ctest --output-on-failure -j$(JOBS)

asan-test:
	$(call step,Installing what the tests need)
	@scripts/deps.sh test
	$(call step,Configuring build-asan with AddressSanitizer and UBSan)
	@cmake -S . -B build-asan -DCMAKE_BUILD_TYPE=Debug -DQUVAIDX_SANITIZE=ON \
	  -DQUVAIDX_WERROR=ON >/dev/null
	$(call step,Building)
	@cmake --build build-asan -j$(JOBS)
	$(call step,Running the tests under the sanitizers)
	@cd build-asan && ctest --output-on-failure -j$(JOBS)

bench:
	$(call step,Installing what the benchmarks need)
	@scripts/deps.sh bench
	$(call step,Configuring build-bench)
	@cmake -S . -B build-bench -DCMAKE_BUILD_TYPE=Release \
	  -DQUVAIDX_BUILD_TESTS=OFF -DQUVAIDX_BUILD_DOCS=OFF \
	  -DQUVAIDX_BUILD_BENCH=ON >/dev/null
	$(call step,Building)
	@cmake --build build-bench -j$(JOBS)
	$(call step,Running the benchmarks)
	@scripts/bench.sh build-bench

fuzz:
	$(call step,Installing what fuzzing needs)
	@scripts/deps.sh fuzz
	$(call step,Configuring build-fuzz with clang)
	@CC=clang CXX=clang++ cmake -S . -B build-fuzz \
	  -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQUVAIDX_BUILD_TESTS=OFF \
	  -DQUVAIDX_BUILD_TOOLS=OFF -DQUVAIDX_BUILD_DAEMONS=OFF \
	  -DQUVAIDX_BUILD_FUZZ=ON >/dev/null
	$(call step,Building the fuzz targets)
	@cmake --build build-fuzz -j$(JOBS)
	$(call step,Fuzzing)
	@scripts/fuzz.sh build-fuzz $(FUZZ_SECONDS)

# Every C and C++ file as clang-format would write it (a dry run).
format-check:
	$(call step,Checking the formatting)
	@scripts/check_format.sh

install: build
	$(call step,Installing into $(or $(PREFIX),/usr/local))
	@cmake --install $(BUILD) --prefix $(or $(PREFIX),/usr/local)

uninstall:
	$(call step,Removing what the last install from $(BUILD) put in place)
	@cmake --build $(BUILD) --target uninstall

clean:
	rm -rf build build-asan build-bench build-fuzz
