# Drives the CMake build. `make demo` and `make test` install what they
# need on a fresh Debian 12 machine, configure, build and run.

BUILD      ?= build
BUILD_TYPE ?= RelWithDebInfo
JOBS       ?= $(shell nproc 2>/dev/null || echo 2)
CMAKE_ARGS ?=
CTEST_ARGS ?=

DEPS_PACKAGES = cmake make g++ pkg-config libsqlite3-dev libgtest-dev libgmock-dev libbenchmark-dev

.PHONY: all deps configure build demo test bench bench-run install clean

all: build

deps:
	@sh cmake/install-deps.sh $(DEPS_PACKAGES)

configure: deps
	cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=$(BUILD_TYPE) $(CMAKE_ARGS)

build: configure
	cmake --build $(BUILD) -j $(JOBS)

demo: build
	$(BUILD)/examples/kovpager_demo

test: build
	cd $(BUILD) && ctest --output-on-failure -j $(JOBS) $(CTEST_ARGS)

# Benchmarks build in Release in their own directory. A quick run:
#   make bench KOV_BENCH_N=20000
bench: BUILD := build-release
bench: BUILD_TYPE := Release
bench: build
	$(MAKE) -C . bench-run BUILD=$(BUILD)

bench-run:
	@for b in $(BUILD)/bench/*_benchmark; do \
	    [ -x "$$b" ] || continue; \
	    echo "== $$b"; "$$b" --benchmark_counters_tabular=true $(BENCH_ARGS) || exit 1; \
	done

install: build
	cmake --install $(BUILD)

clean:
	rm -rf $(BUILD)

# The Windows build (cross-compiled, tested under Wine) lives in its own file.
-include cmake/windows.mk
