#!/bin/sh
# Sets up, builds, installs and runs the whole system, and plays music.
#   scripts/run.sh [OPTIONS] [MUSIC_DIR...]
# Installs missing Debian packages (as root), builds into build/, installs
# into a private root under /tmp (or, with --system, into the machine),
# scans MUSIC_DIR... into the media library (the demo songs when none is
# given), starts tarnaudiod and the song server tarnweb, prints the web
# remote's URL and the tarnctl line to use, starts playing and shows the
# live status until Ctrl-C, then stops everything cleanly.
# Options:
#   --demo      play the demo songs through once and stop (CI, a quick check)
#   --keep      leave everything running and print how to reach and stop it
#   --netns     run inside a private network namespace (scripts/netns-run):
#               the daemon sends SSDP searches when it starts; works with
#               every mode, --keep included
#   --system    install into the machine (prefix /usr, /etc/tarninfo.conf)
#               and run with its real paths instead of a private root
#   --no-build  use the existing build (TARN_BUILD_DIR, default build/)
# The private root is a fresh folder under /tmp unless TARN_ROOT is set.
cd "$(dirname "$0")/.." || exit 1
SRC=$(pwd)
NETNS=0
KEEP=0
DEMO=0
SYSTEM=0
INSIDE=0
BUILD=1
MUSIC_DIRS=""
ARGS=""
[ -n "$TARN_BUILD_DIR" ] || TARN_BUILD_DIR=build
export TARN_BUILD_DIR
for a in "$@"; do
    case "$a" in
        --netns) NETNS=1 ;;
        --keep) KEEP=1; ARGS="$ARGS $a" ;;
        --demo) DEMO=1; ARGS="$ARGS $a" ;;
        --system) SYSTEM=1; ARGS="$ARGS $a" ;;
        --inside-netns) INSIDE=1 ;;
        --no-build) BUILD=0 ;;
        -h|--help) sed -n '2,20p' "$0" | sed 's/^# \{0,1\}//'; exit 0 ;;
        -*) echo "run: unknown option $a (see --help)" >&2; exit 2 ;;
        *)
            [ -d "$a" ] || { echo "run: $a is not a folder" >&2; exit 2; }
            d=$(cd "$a" && pwd)
            MUSIC_DIRS="$MUSIC_DIRS${MUSIC_DIRS:+:}$d"
            ;;
    esac
done
if [ "$DEMO" = "1" ] && [ "$KEEP" = "1" ]; then
    echo "run: --demo and --keep exclude each other" >&2
    exit 2
fi
case "$TARN_BUILD_DIR" in
    /*) B=$TARN_BUILD_DIR ;;
    *) B=$SRC/$TARN_BUILD_DIR ;;
esac

if [ "$INSIDE" = "0" ]; then
    if [ "$BUILD" = "1" ]; then
        if [ "$(id -u)" = "0" ]; then
            echo "run: checking packages"
            scripts/setup.sh || { echo "run: package setup failed"; exit 1; }
        else
            echo "run: not root, skipping package setup (scripts/setup.sh)"
        fi
        echo "run: building into $TARN_BUILD_DIR/ (this takes a few minutes the first time)"
        cmake -S . -B "$B" -DCMAKE_BUILD_TYPE=RelWithDebInfo > "$B.cmake.log" 2>&1 ||
            { cat "$B.cmake.log"; echo "run: cmake failed"; exit 1; }
        cmake --build "$B" -j"${TARN_JOBS:-2}" || { echo "run: build failed"; exit 1; }
    fi
    if [ "$NETNS" = "1" ]; then
        # The music folders travel as they are; the inside run needs no build.
        set -- --inside-netns --no-build $ARGS
        [ -n "$MUSIC_DIRS" ] && export TARN_RUN_MUSIC_DIRS="$MUSIC_DIRS"
        exec scripts/netns-run "$0" "$@"
    fi
fi
[ -n "$TARN_RUN_MUSIC_DIRS" ] && [ -z "$MUSIC_DIRS" ] && MUSIC_DIRS=$TARN_RUN_MUSIC_DIRS

# --- install -------------------------------------------------------------
MADE_ROOT=0
if [ "$SYSTEM" = "1" ]; then
    [ "$(id -u)" = "0" ] || { echo "run: --system needs root" >&2; exit 1; }
    unset TARN_ROOT
    echo "run: installing into the machine (cmake --install $TARN_BUILD_DIR)"
    cmake --install "$B" > "$B.install.log" 2>&1 || { cat "$B.install.log"; echo "run: install failed"; exit 1; }
    P=""
    STATE=/var/lib/tarnaudiod-run
    mkdir -p "$STATE"
else
    if [ -z "$TARN_ROOT" ]; then
        TARN_ROOT=$(mktemp -d /tmp/tarn-run.XXXXXX) || exit 1
        MADE_ROOT=1
    fi
    export TARN_ROOT
    echo "run: installing into the private root $TARN_ROOT"
    scripts/make-root.sh --build "$B" "$TARN_ROOT" || { echo "run: install failed"; exit 1; }
    P=$TARN_ROOT
    STATE=$TARN_ROOT
    export TARN_LOG_FILE=${TARN_LOG_FILE:-$TARN_ROOT/log.txt}
fi
BIN=$P/usr/bin
SBIN=$P/usr/sbin
CONF=$P/etc/tarninfo.conf
PIDFILE=$P/var/run/tarnaudiod.pid
# Inside the private namespace (our machines have no speakers) the music is
# written to a WAV file that can be played afterwards.
[ "$INSIDE" = "1" ] && export TARN_AUDIO_OUT=${TARN_AUDIO_OUT:-wav:/tmp/tarn-demo.wav}

set_key() {  # key value: replaces the key's line in the configuration
    grep -v "^$1=" "$CONF" > "$CONF.new" 2>/dev/null
    echo "$1=\"$2\"" >> "$CONF.new"
    mv "$CONF.new" "$CONF"
}

# --- music -----------------------------------------------------------------
if [ -z "$MUSIC_DIRS" ]; then
    MUSIC_DIRS=$STATE/demo-music
    echo "run: no music folder given: making demo songs in $MUSIC_DIRS"
    scripts/make-demo-songs.sh "$MUSIC_DIRS" "${TARN_DEMO_SECONDS:-6}" > /dev/null ||
        echo "run: could not make demo songs (needs sox, lame, flac, vorbis-tools: scripts/setup.sh)"
fi
set_key music_dir "$MUSIC_DIRS"
grep -q '^admin_port=' "$CONF" || set_key admin_port "${TARN_WEB_PORT:-8580}"
PORT=$(sed -n 's/^admin_port="\{0,1\}\([0-9]*\).*/\1/p' "$CONF" | tail -1)
echo "run: tarnlib scan   (music_dir=$MUSIC_DIRS)"
"$BIN/tarnlib" scan || echo "run: the scan reported problems (see above)"

# --- start ------------------------------------------------------------------
WEBPID=
stop_all() {
    trap - INT TERM
    status=0
    pid=$(cat "$PIDFILE" 2>/dev/null)
    if [ -n "$pid" ]; then
        echo "run: stopping tarnaudiod (pid $pid)"
        kill -TERM "$pid" 2>/dev/null
        i=0
        while kill -0 "$pid" 2>/dev/null && [ -e "$PIDFILE" ]; do
            i=$((i + 1))
            if [ $i -gt 150 ]; then echo "run: tarnaudiod did not stop"; status=1; break; fi
            sleep 0.1
        done
    fi
    if [ -n "$WEBPID" ]; then
        echo "run: stopping tarnweb (pid $WEBPID)"
        kill -TERM "$WEBPID" 2>/dev/null && wait "$WEBPID" 2>/dev/null
    fi
    case "$TARN_AUDIO_OUT" in
        wav:*) echo "run: the music that played is in ${TARN_AUDIO_OUT#wav:}" ;;
    esac
    if [ -n "$TARN_LOG_FILE" ] && [ -s "$TARN_LOG_FILE" ]; then
        echo "run: daemon log ($TARN_LOG_FILE):"
        sed 's/^/  /' "$TARN_LOG_FILE"
    fi
    [ "$status" = "0" ] && [ "$MADE_ROOT" = "1" ] && rm -rf "$TARN_ROOT"
    echo "run: stopped"
    exit $status
}

"$SBIN/tarnaudiod" || { echo "run: tarnaudiod did not start"; exit 1; }
trap stop_all INT TERM
i=0
until "$BIN/tarnctl" status > /dev/null 2>&1; do
    i=$((i + 1))
    if [ $i -gt 150 ]; then
        echo "run: tarnaudiod did not come up; its log:"
        cat "$TARN_LOG_FILE" 2>/dev/null
        stop_all
    fi
    sleep 0.1
done
echo "run: tarnaudiod running, pid $(cat "$PIDFILE")"
"$SBIN/tarnweb" > "$STATE/tarnweb.log" 2>&1 &
WEBPID=$!
i=0
until grep -q 'listening on' "$STATE/tarnweb.log" 2>/dev/null || [ $i -gt 50 ]; do i=$((i + 1)); sleep 0.1; done
grep -q 'listening on' "$STATE/tarnweb.log" || { echo "run: tarnweb did not start:"; cat "$STATE/tarnweb.log"; }
HOST=$(hostname -I 2>/dev/null | awk '{print $1}')
echo "run: web remote: http://${HOST:-localhost}:$PORT/   (tarnweb, pid $WEBPID)"

"$BIN/tarnctl" source random > /dev/null || echo "run: the library has no songs to play"
"$BIN/tarnctl" play 1 > /dev/null
"$BIN/tarnctl" queue
echo "run: audio output: ${TARN_AUDIO_OUT:-default}"
CTL="$BIN/tarnctl"
[ -n "$P" ] && CTL="TARN_ROOT=$TARN_ROOT $BIN/tarnctl"
[ "$INSIDE" = "1" ] && CTL="nsenter --net --ipc --target $(cat "$PIDFILE") env $CTL"

if [ "$KEEP" = "1" ]; then
    trap - INT TERM
    echo "run: left running. Use it with:"
    echo "  $CTL status        (tarnctl --help lists every command)"
    echo "  $CTL watch"
    echo "  kill $(cat "$PIDFILE") $WEBPID    # stops the daemon and tarnweb"
    [ "$INSIDE" = "1" ] && echo "  (the private network namespace lasts while the daemon runs)"
    exit 0
fi
if [ "$DEMO" = "1" ]; then
    echo "run: playing the songs through once (tarnctl watch)"
    "$BIN/tarnctl" watch --count "${TARN_DEMO_WATCH:-44}" --interval 500
    echo
    "$BIN/tarnctl" status
    stop_all
fi
echo "run: playing. Control it from another terminal with:"
echo "  $CTL status | next | pause | volume 40"
echo "run: live status below; Ctrl-C stops everything"
"$BIN/tarnctl" watch --interval 500
echo
stop_all
