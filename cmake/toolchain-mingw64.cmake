# Cross build for 64-bit Windows with mingw-w64, POSIX thread model (Debian
# g++-mingw-w64-x86-64-posix). The programs it makes run here under Wine
# (Debian wine64) through cmake/wine-run.sh, in a Wine prefix of the build
# directory, so ctest runs the suite as it runs the native one:
#
#   cmake -S . -B build-windows -DCMAKE_TOOLCHAIN_FILE=cmake/toolchain-mingw64.cmake
#   cmake --build build-windows && (cd build-windows && ctest)
#
# `make test-windows` (cmake/windows.mk) does all of it, packages included.
#
# GoogleTest has no Windows package: on the first configure this file builds
# Debian's GoogleTest sources (/usr/src/googletest) with the same toolchain
# and installs them into <build>/cross-deps, where find_package(GTest) finds
# them; later configures reuse that.

set(CMAKE_SYSTEM_NAME Windows)
set(CMAKE_SYSTEM_PROCESSOR x86_64)

set(KOVPAGER_MINGW_TRIPLE x86_64-w64-mingw32)
set(CMAKE_C_COMPILER ${KOVPAGER_MINGW_TRIPLE}-gcc-posix)
set(CMAKE_CXX_COMPILER ${KOVPAGER_MINGW_TRIPLE}-g++-posix)
set(CMAKE_RC_COMPILER ${KOVPAGER_MINGW_TRIPLE}-windres)

# Libraries, headers and packages come from the mingw-w64 tree and from the
# cross-built dependencies only; build tools from the host.
set(KOVPAGER_CROSS_DEPS "${CMAKE_BINARY_DIR}/cross-deps" CACHE PATH
    "Install prefix of the dependencies cross-built for Windows (GoogleTest)")
set(CMAKE_FIND_ROOT_PATH /usr/${KOVPAGER_MINGW_TRIPLE} "${KOVPAGER_CROSS_DEPS}")
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)

# The C and C++ runtimes and winpthread are linked in statically, so the
# DLL and the test programs need no runtime DLL beside them. (-static only
# picks the static archives; Windows' own DLLs are still imported.)
set(CMAKE_EXE_LINKER_FLAGS_INIT "-static")
set(CMAKE_SHARED_LINKER_FLAGS_INIT "-static")
set(CMAKE_MODULE_LINKER_FLAGS_INIT "-static")

# Programs run under Wine. The DLLs of the build (the library itself sits at
# the top of the build directory) are found through WINEPATH.
set(KOVPAGER_WINEPREFIX "${CMAKE_BINARY_DIR}/wineprefix" CACHE PATH
    "Wine prefix used to run the cross-built programs")
set(CMAKE_CROSSCOMPILING_EMULATOR
    /bin/sh "${CMAKE_CURRENT_LIST_DIR}/wine-run.sh"
    "--prefix=${KOVPAGER_WINEPREFIX}" "--path=${CMAKE_BINARY_DIR}")

# GoogleTest's test lists are read when ctest starts rather than after each
# link: the build itself never starts Wine, and the list runs come right
# before the tests, while the Wine server is up anyway.
set(CMAKE_GTEST_DISCOVER_TESTS_DISCOVERY_MODE PRE_TEST)

# --- GoogleTest, cross-built once per build directory ----------------------
# Skipped inside CMake's own try_compile projects, inside the GoogleTest
# build that this block starts (which reads this file too) and when the
# tests are turned off.
get_property(_kov_in_try_compile GLOBAL PROPERTY IN_TRY_COMPILE)
set(KOVPAGER_GOOGLETEST_SOURCE /usr/src/googletest CACHE PATH
    "GoogleTest sources to cross-build for the Windows tests (Debian package googletest)")
if(NOT _kov_in_try_compile AND NOT KOVPAGER_CROSS_DEPS_BUILD
   AND (NOT DEFINED KOVPAGER_BUILD_TESTS OR KOVPAGER_BUILD_TESTS)
   AND NOT EXISTS "${KOVPAGER_CROSS_DEPS}/lib/cmake/GTest/GTestConfig.cmake"
   AND EXISTS "${KOVPAGER_GOOGLETEST_SOURCE}/CMakeLists.txt")
  message(STATUS "Cross-building GoogleTest from ${KOVPAGER_GOOGLETEST_SOURCE}")
  set(_kov_gtest_build "${CMAKE_BINARY_DIR}/cross-deps-build/googletest")
  if(DEFINED ENV{CMAKE_BUILD_PARALLEL_LEVEL})
    set(_kov_jobs $ENV{CMAKE_BUILD_PARALLEL_LEVEL})
  else()
    set(_kov_jobs 2)
  endif()
  execute_process(
    COMMAND "${CMAKE_COMMAND}" -S "${KOVPAGER_GOOGLETEST_SOURCE}" -B "${_kov_gtest_build}"
            -G "${CMAKE_GENERATOR}"
            "-DCMAKE_TOOLCHAIN_FILE=${CMAKE_CURRENT_LIST_FILE}"
            -DKOVPAGER_CROSS_DEPS_BUILD=ON
            "-DKOVPAGER_CROSS_DEPS=${KOVPAGER_CROSS_DEPS}"
            -DCMAKE_BUILD_TYPE=Release
            "-DCMAKE_INSTALL_PREFIX=${KOVPAGER_CROSS_DEPS}"
            -DBUILD_GMOCK=ON -DINSTALL_GTEST=ON
    RESULT_VARIABLE _kov_rc OUTPUT_QUIET)
  if(_kov_rc EQUAL 0)
    execute_process(
      COMMAND "${CMAKE_COMMAND}" --build "${_kov_gtest_build}" -j ${_kov_jobs}
      RESULT_VARIABLE _kov_rc OUTPUT_QUIET)
  endif()
  if(_kov_rc EQUAL 0)
    execute_process(
      COMMAND "${CMAKE_COMMAND}" --install "${_kov_gtest_build}"
      RESULT_VARIABLE _kov_rc OUTPUT_QUIET)
  endif()
  if(NOT _kov_rc EQUAL 0)
    message(FATAL_ERROR "Cross-building GoogleTest failed (${_kov_rc}); see ${_kov_gtest_build}")
  endif()
endif()
if(EXISTS "${KOVPAGER_CROSS_DEPS}/lib/cmake/GTest/GTestConfig.cmake")
  set(GTest_DIR "${KOVPAGER_CROSS_DEPS}/lib/cmake/GTest" CACHE PATH "GoogleTest built for Windows")
endif()
