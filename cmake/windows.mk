# The Windows build: cross-compiled with mingw-w64 into a DLL, its unit tests
# run by ctest under Wine. Included by the root Makefile.
#
#   make test-windows     packages, SQLite amalgamation, configure, build, ctest
#   make deps-windows     only the Debian packages it needs
#   make clean-windows
#
# WINDOWS_BUILD names the build directory; WINDOWS_CMAKE_ARGS is added to
# CMAKE_ARGS for its configure step. Benchmarks are not built for Windows.

WINDOWS_BUILD      ?= build-windows
WINDOWS_BUILD_TYPE ?= $(BUILD_TYPE)
WINDOWS_CMAKE_ARGS ?=

# mingw-w64 (POSIX threads) for the cross build; wine64 to run its programs;
# dpkg-dev (apt-get source) and tcl (tclsh) to make the SQLite amalgamation
# from Debian's sources, with the host compiler (shared with the Linux
# builds, in third_party/sqlite); googletest for the GoogleTest
# sources that are cross-built; util-linux for flock.
WINDOWS_PACKAGES = cmake make gcc g++-mingw-w64-x86-64-posix wine64 dpkg-dev tcl \
                   googletest util-linux

.PHONY: deps-windows sqlite-windows configure-windows compile-windows test-windows clean-windows

deps-windows:
	@sh cmake/install-deps.sh $(WINDOWS_PACKAGES)

# Made by the first configure as well, once per checkout and shared with the
# Linux builds; done here first so that the step that may need root and the
# network shows up on its own.
sqlite-windows: deps-windows
	sh cmake/fetch-sqlite-amalgamation.sh third_party/sqlite

configure-windows: deps-windows sqlite-windows
	cmake -S . -B $(WINDOWS_BUILD) \
	    -DCMAKE_TOOLCHAIN_FILE=$(CURDIR)/cmake/toolchain-mingw64.cmake \
	    -DCMAKE_BUILD_TYPE=$(WINDOWS_BUILD_TYPE) \
	    -DKOVPAGER_BUILD_BENCH=OFF \
	    $(CMAKE_ARGS) $(WINDOWS_CMAKE_ARGS)

compile-windows: configure-windows
	sh cmake/wine-run.sh --prefix=$(abspath $(WINDOWS_BUILD))/wineprefix --init
	cmake --build $(WINDOWS_BUILD) -j $(JOBS)

# A test that fails is run once more before it counts as failed: under Wine a test program now and
# then fails to start at all (no output, a hundredth of a second, seen once in some twenty runs of
# the suite); a test that really fails fails twice.
test-windows: compile-windows
	cd $(WINDOWS_BUILD) && ctest --output-on-failure --repeat until-pass:2 -j $(JOBS) $(CTEST_ARGS)

clean-windows:
	rm -rf $(WINDOWS_BUILD)
