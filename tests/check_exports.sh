#!/bin/sh
# Fails when the shared library exports any dynamic symbol that is not a
# member of KovPager, KovBtree or KovBtreeCursor (SQLite's included).
#   tests/check_exports.sh <path to libkovpager.so>
set -eu
lib=$1
symbols=$(nm -D --defined-only "$lib" | awk '{ $1 = ""; $2 = ""; sub(/^  /, ""); print }' | c++filt)
[ -n "$symbols" ] || { echo "no dynamic symbols found in $lib" >&2; exit 1; }
stray=$(printf '%s\n' "$symbols" | grep -v -E '^(KovPager|KovBtree|KovBtreeCursor)::' || true)
classes=$(printf '%s\n' "$symbols" | grep -c -E '^(KovPager|KovBtree|KovBtreeCursor)::' || true)
if [ -n "$stray" ]; then
    echo "symbols exported outside the three classes:" >&2
    printf '%s\n' "$stray" >&2
    exit 1
fi
for class in KovPager KovBtree KovBtreeCursor; do
    printf '%s\n' "$symbols" | grep -q -E "^$class::" || { echo "$class exports nothing" >&2; exit 1; }
done
echo "$classes symbols exported, all members of the three classes"
