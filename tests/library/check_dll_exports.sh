#!/bin/sh
# Fails when the DLL exports any name that is not a member of KovPager,
# KovBtree or KovBtreeCursor, or any name of the engine (sqlite3_*, the
# library's renamed kovpager_sqlite3_*, kovsq_*).
#   tests/library/check_dll_exports.sh <path to libkovpager.dll> [objdump]
# objdump defaults to x86_64-w64-mingw32-objdump; the demangler is the
# c++filt beside it (x86_64-w64-mingw32-c++filt), else the host's c++filt.
set -eu
. "$(dirname "$0")/exports_lib.sh"
dll=$1
objdump=${2:-x86_64-w64-mingw32-objdump}
cxxfilt=$(printf '%s' "$objdump" | sed 's/objdump$/c++filt/')
if [ "$cxxfilt" = "$objdump" ] || ! command -v "$cxxfilt" >/dev/null 2>&1; then
    cxxfilt=c++filt
fi
command -v "$objdump" >/dev/null 2>&1 || { echo "$objdump not found" >&2; exit 1; }

# The export table's names: the lines "[ n] name" after "[Ordinal/Name Pointer] Table".
raw=$("$objdump" -p "$dll" | awk '
    /^\[Ordinal\/Name Pointer\] Table/ { inside = 1; next }
    inside && /^[ \t]*\[ *[0-9]+\]/ { sub(/^[ \t]*\[ *[0-9]+\][ \t]*/, ""); print; next }
    inside { exit }')
[ -n "$raw" ] || { echo "no exported names found in $dll" >&2; exit 1; }

engine=$(printf '%s\n' "$raw" | grep -E '^_?(kovpager_)?sqlite3|^_?kovsq_' || true)
if [ -n "$engine" ]; then
    echo "engine names exported:" >&2
    printf '%s\n' "$engine" >&2
    exit 1
fi

symbols=$(printf '%s\n' "$raw" | "$cxxfilt")
only_class_members "$symbols" names
