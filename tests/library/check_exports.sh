#!/bin/sh
# Fails when the shared library exports any dynamic symbol that is not a
# member of KovPager, KovBtree or KovBtreeCursor (SQLite's included).
#   tests/library/check_exports.sh <path to libkovpager.so>
set -eu
. "$(dirname "$0")/exports_lib.sh"
lib=$1
symbols=$(nm -D --defined-only "$lib" | awk '{ $1 = ""; $2 = ""; sub(/^  /, ""); print }' | c++filt)
[ -n "$symbols" ] || { echo "no dynamic symbols found in $lib" >&2; exit 1; }
only_class_members "$symbols" symbols
