#!/bin/sh
# Makes SQLite's amalgamation (sqlite3.c, sqlite3.h, sqlite3ext.h) from
# Debian's sqlite3 source package: the library's private SQLite, compiled
# into it on every platform. The first configure of a checkout runs it for
# third_party/sqlite (cmake/SqliteAmalgamation.cmake).
#
#   fetch-sqlite-amalgamation.sh DIR
#
# Leaves DIR/sqlite3.c, DIR/sqlite3.h, DIR/sqlite3ext.h and DIR/VERSION (the
# Debian source version). Idempotent: once they are there it does nothing.
# Steps, each skipped when already done:
#   1. a deb-src entry for the Debian archive the machine uses (added as
#      /etc/apt/sources.list.d/kovpager-deb-src.* when there is none), and
#      `apt-get update` for it;
#   2. `apt-get source sqlite3` into DIR/src (needs dpkg-dev);
#   3. SQLite's own `./configure && make sqlite3.c` in DIR/build (needs tclsh
#      and a host C compiler).
# Steps 1 and 2 need root when the source entry or its index is missing.
set -eu

if [ $# -ne 1 ]; then
    echo "usage: fetch-sqlite-amalgamation.sh DIR" >&2
    exit 2
fi
mkdir -p "$1"
dest=$(cd "$1" && pwd)

done_mark="$dest/.complete"
[ -e "$done_mark" ] && exit 0

# One run at a time per directory.
exec 9>"$dest/.lock"
flock 9
[ -e "$done_mark" ] && exit 0

say() { echo "fetch-sqlite-amalgamation: $*" >&2; }
need_root() {
    if [ "$(id -u)" -ne 0 ]; then
        say "$1: run this as root (or run: sudo sh $0 $dest)"
        exit 1
    fi
}

# --- 1. a source entry ------------------------------------------------------
has_deb_src() {
    for f in /etc/apt/sources.list /etc/apt/sources.list.d/*.list; do
        [ -f "$f" ] && grep -Eq '^[[:space:]]*deb-src[[:space:]]' "$f" && return 0
    done
    for f in /etc/apt/sources.list.d/*.sources; do
        [ -f "$f" ] && grep -Eiq '^Types:.*deb-src' "$f" && return 0
    done
    return 1
}

added_entry=0
if ! has_deb_src; then
    need_root "no deb-src entry in the APT sources"
    # deb822 stanzas of the Debian archive (their URIs name a .../debian
    # repository) are copied with Types: deb-src.
    out=/etc/apt/sources.list.d/kovpager-deb-src.sources
    tmp="$out.tmp"
    : >"$tmp"
    for f in /etc/apt/sources.list.d/*.sources; do
        [ -f "$f" ] || continue
        awk '
            function flush() {
                if (stanza != "" && types && debian && enabled) printf "%s\n", stanza
                stanza = ""; types = 0; debian = 0; enabled = 1
            }
            BEGIN { enabled = 1 }
            /^[[:space:]]*$/ { flush(); next }
            /^#/ { next }
            tolower($1) == "types:" { types = ($0 ~ /[[:space:]]deb([[:space:]]|$)/); stanza = stanza "Types: deb-src\n"; next }
            tolower($1) == "uris:" { if ($0 ~ /\/debian(-security)?\/?([[:space:]]|$)/) debian = 1 }
            tolower($1) == "enabled:" { if (tolower($2) == "no") enabled = 0 }
            { stanza = stanza $0 "\n" }
            END { flush() }
        ' "$f" >>"$tmp"
    done
    if [ -s "$tmp" ]; then
        mv "$tmp" "$out"
    else
        # One-line style (/etc/apt/sources.list and *.list).
        rm -f "$tmp"
        out=/etc/apt/sources.list.d/kovpager-deb-src.list
        cat /etc/apt/sources.list /etc/apt/sources.list.d/*.list 2>/dev/null |
            sed -n 's/^[[:space:]]*deb[[:space:]]\(.*\/debian\(-security\)\{0,1\}\/\{0,1\}[[:space:]].*\)$/deb-src \1/p' |
            sort -u >"$out.tmp"
        if [ ! -s "$out.tmp" ]; then
            rm -f "$out.tmp"
            say "found no Debian archive in the APT sources to add a deb-src entry for"
            exit 1
        fi
        mv "$out.tmp" "$out"
    fi
    say "added $out"
    added_entry=1
fi

if [ "$added_entry" -eq 1 ] || ! apt-cache showsrc sqlite3 >/dev/null 2>&1 ||
    [ -z "$(apt-cache showsrc sqlite3 2>/dev/null)" ]; then
    need_root "the source index is missing"
    apt-get update
fi

# --- 2. the source package --------------------------------------------------
srcdir=""
for d in "$dest"/src/sqlite3-*/; do
    [ -f "$d/configure" ] && [ -f "$d/tool/mksqlite3c.tcl" ] && srcdir="${d%/}"
done
if [ -z "$srcdir" ]; then
    if ! command -v dpkg-source >/dev/null 2>&1; then
        say "dpkg-source not found (Debian package dpkg-dev)"
        exit 1
    fi
    rm -rf "$dest/src"
    mkdir -p "$dest/src"
    (cd "$dest/src" && apt-get source sqlite3) >&2
    for d in "$dest"/src/sqlite3-*/; do
        [ -f "$d/configure" ] && srcdir="${d%/}"
    done
    if [ -z "$srcdir" ]; then
        say "apt-get source sqlite3 left no source tree in $dest/src"
        exit 1
    fi
fi
version=$(cd "$dest/src" && ls sqlite3_*.dsc | sed -n 's/^sqlite3_\(.*\)\.dsc$/\1/p' | head -n 1)

# --- 3. the amalgamation ----------------------------------------------------
for tcl in tclsh tclsh8.6 tclsh8.7; do
    command -v "$tcl" >/dev/null 2>&1 && break
    tcl=""
done
if [ -z "$tcl" ]; then
    say "tclsh not found (Debian package tcl)"
    exit 1
fi

# SQLite's generators are host programs: whatever cross settings the caller
# has in its environment must not reach them.
# Nor does the job server of a calling make.
unset CC CXX CFLAGS CXXFLAGS CPPFLAGS LDFLAGS MAKEFLAGS MFLAGS MAKELEVEL
rm -rf "$dest/build"
mkdir -p "$dest/build"
(
    cd "$dest/build"
    "$srcdir/configure" --disable-tcl --disable-readline >configure.log 2>&1 ||
        { cat configure.log >&2; exit 1; }
    make sqlite3.c >make.log 2>&1 || { tail -n 50 make.log >&2; exit 1; }
)
# sqlite3ext.h is copied by a target of its own; it is the same file as in
# the generated source tree.
[ -f "$dest/build/sqlite3ext.h" ] || cp "$dest/build/tsrc/sqlite3ext.h" "$dest/build/" 2>/dev/null || true
for f in sqlite3.c sqlite3.h sqlite3ext.h; do
    if [ ! -f "$dest/build/$f" ]; then
        say "make sqlite3.c did not produce $f"
        exit 1
    fi
    cp "$dest/build/$f" "$dest/$f"
done
echo "$version" >"$dest/VERSION"
: >"$done_mark"
say "SQLite amalgamation $version in $dest"
