# Drives the CMake build. `make demo` and `make test` install what they
# need on a fresh Debian 12 machine, configure, build and run.

BUILD      ?= build
BUILD_TYPE ?= RelWithDebInfo
JOBS       ?= $(shell nproc 2>/dev/null || echo 2)
CMAKE_ARGS ?=
CTEST_ARGS ?=

# dpkg-dev (apt-get source) and tcl (tclsh) make the library's SQLite from
# Debian's sqlite3 sources (cmake/fetch-sqlite-amalgamation.sh, run once per
# checkout by the first configure); libsqlite3-dev is the system SQLite that
# the benchmarks' baseline and a test host link.
DEPS_PACKAGES = cmake make gcc g++ pkg-config dpkg-dev tcl util-linux libsqlite3-dev \
                libgtest-dev libgmock-dev libbenchmark-dev

.PHONY: all deps configure build demo test bench bench-run bench-peers soak install clean

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

# Benchmarks build in Release in their own directory: the engine and store
# programs against raw SQLite, then the run against the peers that writes
# bench/RESULTS.md and bench/peers.png. A quick run of the first part:
#   make bench-run BUILD=build-release KOV_BENCH_N=20000
bench: BUILD := build-release
bench: BUILD_TYPE := Release
bench: build
	$(MAKE) -C . bench-run BUILD=$(BUILD)
	$(MAKE) -C . bench-peers BUILD=$(BUILD)

bench-run:
	@for b in $(BUILD)/bench/*_benchmark; do \
	    [ -x "$$b" ] || continue; \
	    case "$$b" in *peers_benchmark) continue ;; esac; \
	    echo "== $$b"; "$$b" --benchmark_counters_tabular=true $(BENCH_ARGS) || exit 1; \
	done

# The store against raw SQLite, std::map, LMDB and RocksDB, each backend in
# its own process; writes bench/RESULTS.md and bench/peers.png. For 10 M
# records as well: make bench-peers PEERS_ARGS="--fresh --big-n 10000000"
PEERS_BUILD ?= $(BUILD)
PEERS_ARGS  ?= --fresh
bench-peers: deps
	@sh cmake/install-deps.sh liblmdb-dev librocksdb-dev gnuplot-nox python3
	cmake -S . -B $(PEERS_BUILD) -DCMAKE_BUILD_TYPE=Release $(CMAKE_ARGS)
	cmake --build $(PEERS_BUILD) -j $(JOBS) --target peers_benchmark
	python3 bench/run_peers.py --build $(PEERS_BUILD) $(PEERS_ARGS)

# The store program under random I/O faults for a while (not part of
# `make test`): make soak SOAK_SECONDS=600
SOAK_SECONDS ?= 600
soak: build
	$(BUILD)/tests/soak/soak --seconds $(SOAK_SECONDS)

install: build
	cmake --install $(BUILD)

clean:
	rm -rf $(BUILD)

# The Windows build (cross-compiled, tested under Wine) lives in its own file.
-include cmake/windows.mk
