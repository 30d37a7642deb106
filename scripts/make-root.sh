#!/bin/sh
# Lays out a private root for TARN_ROOT with the project's install rules
# (DESTDIR=ROOT cmake --install BUILD --prefix /usr), plus the folders a root
# needs (tmp, var/run, etc and the /usr/tarn ones, also when empty). Tests, benchmarks and scripts all make their
# roots with this.
#   scripts/make-root.sh [--build DIR] [--component NAME]... ROOT
# Components (packaging/CMakeLists.txt): player, programs, data, conf,
# system; without --component all of them. An existing etc/tarninfo.conf is
# kept.
cd "$(dirname "$0")/.." || exit 1
BUILD=${TARN_BUILD_DIR:-build}
COMPONENTS=""
while [ $# -gt 1 ]; do
    case "$1" in
        --build) BUILD=$2; shift 2 ;;
        --component) COMPONENTS="$COMPONENTS $2"; shift 2 ;;
        *) break ;;
    esac
done
if [ $# -ne 1 ] || [ -z "$1" ]; then
    echo "usage: scripts/make-root.sh [--build DIR] [--component NAME]... ROOT" >&2
    exit 2
fi
case "$1" in
    /*) ROOT=$1 ;;
    *) ROOT=$(pwd)/$1 ;;
esac
for d in tmp var/run etc usr/tarn/bin usr/tarn/etc/audio usr/tarn/etc.defaults/audio usr/tarn/var; do
    mkdir -p "$ROOT/$d" || exit 1
done
chmod 1777 "$ROOT/tmp"
if [ -z "$COMPONENTS" ]; then
    DESTDIR=$ROOT cmake --install "$BUILD" --prefix /usr > "$ROOT/.install.log" 2>&1 ||
        { cat "$ROOT/.install.log" >&2; exit 1; }
else
    for c in $COMPONENTS; do
        DESTDIR=$ROOT cmake --install "$BUILD" --prefix /usr --component "$c" > "$ROOT/.install.log" 2>&1 ||
            { cat "$ROOT/.install.log" >&2; exit 1; }
    done
fi
rm -f "$ROOT/.install.log"
