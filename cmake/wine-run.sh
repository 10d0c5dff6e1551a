#!/bin/sh
# Runs a Windows program of the cross build under Wine, in a private Wine
# prefix, with Wine's own diagnostics silenced. The cross build uses it as
# its CMAKE_CROSSCOMPILING_EMULATOR, so ctest and GoogleTest's test
# discovery run the .exe files through it.
#
#   wine-run.sh [--prefix=DIR] [--path=DIR]... PROGRAM [ARGS...]
#   wine-run.sh [--prefix=DIR] --init
#
# --prefix  the Wine prefix (default: $WINEPREFIX, else a per-user directory
#           under /tmp); it is created on first use, once, under a lock, so
#           parallel test runs never race to build it.
# --path    a directory searched for DLLs (Wine's WINEPATH); may be repeated.
# --init    only make sure the prefix exists.
# Besides C: and Z: (the Unix root) the prefix has a drive D: on its own
# drive_d directory and the share \\localhost\C$ (see below).
# KOVPAGER_WINE names the Wine program (default /usr/lib/wine/wine64);
# KOVPAGER_WINESERVER_LINGER the seconds the Wine server stays up after the
# last program (default 10).
# The program's exit status is returned unchanged (any other than 0 or 1 is
# also reported on standard error).
set -eu

prefix="${WINEPREFIX:-${TMPDIR:-/tmp}/kovpager-wine-$(id -u)}"
winepath=""
init_only=0
while [ $# -gt 0 ]; do
    case "$1" in
        --prefix=*) prefix="${1#--prefix=}" ;;
        --path=*)
            # Wine maps the Unix root to drive Z:.
            dir=$(printf '%s' "${1#--path=}" | tr '/' '\\')
            winepath="${winepath:+$winepath;}Z:$dir"
            ;;
        --init) init_only=1 ;;
        *) break ;;
    esac
    shift
done

wine="${KOVPAGER_WINE:-/usr/lib/wine/wine64}"
if [ ! -x "$wine" ]; then
    echo "wine-run.sh: $wine not found (Debian package wine64: make deps-windows)" >&2
    exit 127
fi

export WINEPREFIX="$prefix"
export WINEARCH=win64
export WINEDEBUG=-all
# No Mono or Gecko: nothing here needs them, and asking for them would stall
# the creation of the prefix.
export WINEDLLOVERRIDES="mscoree=;mshtml="
# Never try to open a window.
unset DISPLAY WAYLAND_DISPLAY
if [ -n "$winepath" ]; then
    export WINEPATH="$winepath${WINEPATH:+;$WINEPATH}"
fi

wineserver=""
for candidate in "$(dirname "$wine")/wineserver64" "$(dirname "$wine")/wineserver" \
    /usr/lib/wine/wineserver64 /usr/lib/wine/wineserver; do
    if [ -x "$candidate" ]; then
        wineserver="$candidate"
        break
    fi
done

# Creates the prefix once. The ready mark is written only after wineboot and
# the server it started have finished, so a half-made prefix is redone.
if [ ! -e "$prefix/.kovpager-ready" ]; then
    mkdir -p "$(dirname "$prefix")"
    (
        flock 9
        if [ ! -e "$prefix/.kovpager-ready" ]; then
            rm -rf "$prefix"
            mkdir -p "$prefix"
            "$wine" wineboot --init </dev/null >/dev/null 2>&1 9>&- || true
            if [ -n "$wineserver" ]; then
                "$wineserver" -w </dev/null >/dev/null 2>&1 9>&- || true
            fi
            if [ ! -e "$prefix/system.reg" ]; then
                echo "wine-run.sh: could not create the Wine prefix $prefix" >&2
                exit 1
            fi
            : >"$prefix/.kovpager-ready"
        fi
    ) 9>"$prefix.lock"
fi
# Drives the tests rely on besides C: and Z:, added to any prefix, new or
# made by an older version of this script; each link is made atomically, so
# parallel runs at worst both try:
#  - D:, a second local drive on a directory of the prefix (drive_d, with a
#    tmp directory in it), for moves between drives;
#  - \\localhost\C$, the system drive's administrative share, which Wine
#    serves from the prefix's dosdevices/unc tree.
mkdir -p "$prefix/drive_d/tmp" "$prefix/dosdevices/unc/localhost"
[ -L "$prefix/dosdevices/d:" ] || ln -s ../drive_d "$prefix/dosdevices/d:" 2>/dev/null || true
[ -L "$prefix/dosdevices/unc/localhost/c\$" ] ||
    ln -s ../../../drive_c "$prefix/dosdevices/unc/localhost/c\$" 2>/dev/null || true
[ "$init_only" -eq 1 ] && exit 0

if [ $# -eq 0 ]; then
    echo "usage: wine-run.sh [--prefix=DIR] [--path=DIR]... PROGRAM [ARGS...]" >&2
    exit 2
fi

# The Wine server and the prefix's background programs (services, desktop)
# are started here, detached from our output, before the program runs:
#  - the background programs inherit the standard handles of the program
#    that brings them up; were that a test, they would hold ctest's output
#    pipe open for as long as they live, and ctest would wait for them;
#  - a server that Wine starts by itself quits as soon as its last program
#    ends, so with one short program per test the background programs would
#    be restarted for every test, and a program starting just as the server
#    quits loses its connection ("wine client error"). This server stays up
#    a while after the last program instead.
# Under a lock, so that no program starts while the server is coming up.
if [ -n "$wineserver" ]; then
    (
        flock 8
        # The lock's descriptor is closed for them: a server that kept it
        # would hold the lock for its whole life.
        if "$wineserver" -p"${KOVPAGER_WINESERVER_LINGER:-10}" </dev/null >/dev/null 2>&1 8>&-; then
            # A new server (an existing one makes this start fail at once).
            "$wine" cmd.exe /c exit </dev/null >/dev/null 2>&1 8>&- || true
        fi
    ) 8>"$prefix.server.lock"
fi
# Not exec: a program that dies before writing anything (a crash Wine would
# report only on its silenced debug channels) still leaves a line saying how.
status=0
"$wine" "$@" || status=$?
if [ "$status" -ne 0 ] && [ "$status" -ne 1 ]; then
    echo "wine-run.sh: $1 exited with status $status" >&2
fi
exit "$status"
