#!/bin/sh
# Builds and runs this consumer against an installed kovpager, once through
# its CMake package and once through pkg-config.
#   examples/consumer/check.sh <install prefix> <scratch dir>
set -eu
prefix=$(cd "$1" && pwd)
work=$2
here=$(cd "$(dirname "$0")" && pwd)
rm -rf "$work" && mkdir -p "$work"

echo "-- consumer through find_package(kovpager)"
cmake -S "$here" -B "$work/cmake" -DCMAKE_PREFIX_PATH="$prefix" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$work/cmake" >/dev/null
LD_LIBRARY_PATH="$prefix/lib:$prefix/lib64${LD_LIBRARY_PATH:+:$LD_LIBRARY_PATH}" "$work/cmake/consumer"

echo "-- consumer through pkg-config kovpager"
pcdir=$(dirname "$(find "$prefix" -name kovpager.pc | head -n 1)")
flags=$(PKG_CONFIG_PATH="$pcdir" pkg-config --cflags --libs kovpager)
# shellcheck disable=SC2086
${CXX:-c++} -std=c++17 "$here/main.cpp" -o "$work/consumer-pc" $flags
LD_LIBRARY_PATH="$prefix/lib:$prefix/lib64${LD_LIBRARY_PATH:+:$LD_LIBRARY_PATH}" "$work/consumer-pc"
