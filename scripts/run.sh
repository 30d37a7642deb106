#!/bin/sh
# Sets up, builds and runs tarnaudiod in a private root, shows its status and
# stops it cleanly.
#   scripts/run.sh            in the machine's own network (finds real renderers)
#   scripts/run.sh --netns    inside a private network namespace (scripts/netns-run)
#   scripts/run.sh --keep     leave the daemon running (prints how to reach it)
#   scripts/run.sh --no-build use the existing build (TARN_BUILD_DIR, default build/)
# The root is a fresh directory under /tmp unless TARN_ROOT is set; every
# fixed path of the daemon (sockets, pid files, configuration) lies under it.
cd "$(dirname "$0")/.." || exit 1
SRC=$(pwd)
NETNS=0
KEEP=0
INSIDE=0
BUILD=0
[ -n "$TARN_BUILD_DIR" ] || TARN_BUILD_DIR=build
export TARN_BUILD_DIR
for a in "$@"; do
    case "$a" in
        --netns) NETNS=1 ;;
        --keep) KEEP=1 ;;
        --inside-netns) INSIDE=1 ;;
        --no-build) BUILD=1 ;;
        -h|--help) sed -n '2,10p' "$0"; exit 0 ;;
        *) echo "run: unknown option $a (see --help)"; exit 2 ;;
    esac
done

if [ "$INSIDE" = "0" ] && [ "$BUILD" = "0" ]; then
    if [ "$(id -u)" = "0" ]; then
        echo "run: checking packages"
        scripts/setup.sh || { echo "run: package setup failed"; exit 1; }
    else
        echo "run: not root, skipping package setup (scripts/setup.sh)"
    fi
    echo "run: building into build/ (this takes a few minutes the first time)"
    cmake -S . -B "$TARN_BUILD_DIR" -DCMAKE_BUILD_TYPE=RelWithDebInfo > "$TARN_BUILD_DIR.cmake.log" 2>&1 ||
        { cat "$TARN_BUILD_DIR.cmake.log"; echo "run: cmake failed"; exit 1; }
    cmake --build "$TARN_BUILD_DIR" -j"${TARN_JOBS:-2}" || { echo "run: build failed"; exit 1; }
fi
if [ "$INSIDE" = "0" ]; then
    if [ "$NETNS" = "1" ]; then
        if [ "$KEEP" = "1" ]; then
            echo "run: --keep is ignored with --netns (the namespace ends with this script)"
        fi
        exec scripts/netns-run "$0" --inside-netns
    fi
fi

case "$TARN_BUILD_DIR" in
    /*) BIN=$TARN_BUILD_DIR/bin ;;
    *) BIN=$SRC/$TARN_BUILD_DIR/bin ;;
esac
MADE_ROOT=0
if [ -z "$TARN_ROOT" ]; then
    TARN_ROOT=$(mktemp -d /tmp/tarn-run.XXXXXX) || exit 1
    MADE_ROOT=1
fi
export TARN_ROOT
export TARN_LOG_FILE=${TARN_LOG_FILE:-$TARN_ROOT/log.txt}
# Inside the private namespace (our machines have no speakers) the music is
# written to a WAV file that can be played afterwards.
[ "$INSIDE" = "1" ] && export TARN_AUDIO_OUT=${TARN_AUDIO_OUT:-wav:/tmp/tarn-demo.wav}
mkdir -p "$TARN_ROOT/tmp" "$TARN_ROOT/var/run" "$TARN_ROOT/etc" "$TARN_ROOT/usr/tarn/bin" \
    "$TARN_ROOT/usr/tarn/etc/audio" "$TARN_ROOT/usr/tarn/etc.defaults/audio"
if [ -x "$BIN/mplayer-daemon" ]; then
    cp "$BIN/mplayer-daemon" "$TARN_ROOT/usr/tarn/bin/mplayer-daemon"
fi
# The appliance's default data: equalizer profiles and the radio seed lists.
cp data/equalizer.system "$TARN_ROOT/usr/tarn/etc.defaults/audio/equalizer.system"
cp data/radio/*.asx "$TARN_ROOT/usr/tarn/etc/audio/" 2>/dev/null
CONF=$TARN_ROOT/etc/tarninfo.conf
grep -q '^admin_port=' "$CONF" 2>/dev/null || echo "admin_port=${TARN_WEB_PORT:-8580}" >> "$CONF"
echo "run: root $TARN_ROOT"

PIDFILE=$TARN_ROOT/var/run/tarnaudiod.pid
SOCK=$TARN_ROOT/tmp/tarnaudiod.sock
"$BIN/tarnaudiod"
i=0
until [ -S "$SOCK" ] && "$BIN/tarnctl" status > /dev/null 2>&1; do
    i=$((i + 1))
    if [ $i -gt 150 ]; then
        echo "run: tarnaudiod did not come up; its log:"
        cat "$TARN_LOG_FILE" 2>/dev/null
        exit 1
    fi
    sleep 0.1
done
echo "run: tarnaudiod running, pid $(cat "$PIDFILE")"
echo "run: tarnctl status"
"$BIN/tarnctl" status

# The song server that renderers fetch the queue's songs from.
"$BIN/tarnweb" > "$TARN_ROOT/tarnweb.log" 2>&1 &
WEBPID=$!
echo "run: song server tarnweb on port $(sed -n 's/^admin_port=//p' "$CONF"), pid $WEBPID"

# Demo music: a few short tagged songs, scanned into the media library, then
# a random selection of the library queued and played.
MUSIC=$TARN_ROOT/music
echo "run: making demo songs in $MUSIC"
scripts/make-demo-songs.sh "$MUSIC" "${TARN_DEMO_SECONDS:-6}" > /dev/null ||
    echo "run: could not make demo songs (needs sox, lame, flac, vorbis-tools: scripts/setup.sh)"
echo "run: tarnlib scan $MUSIC"
"$BIN/tarnlib" scan "$MUSIC"
echo "run: tarnctl source random"
"$BIN/tarnctl" source random
"$BIN/tarnctl" queue
echo "run: audio output: ${TARN_AUDIO_OUT:-default}"
echo "run: tarnctl watch (live status from the status segment)"
"$BIN/tarnctl" watch --count "${TARN_DEMO_WATCH:-44}" --interval 500
echo
"$BIN/tarnctl" status

stop_daemon() {
    pid=$(cat "$PIDFILE" 2>/dev/null)
    [ -n "$pid" ] || return 0
    echo "run: stopping tarnaudiod (pid $pid)"
    kill -TERM "$pid"
    i=0
    while kill -0 "$pid" 2>/dev/null; do
        i=$((i + 1))
        if [ $i -gt 150 ]; then echo "run: tarnaudiod did not stop"; return 1; fi
        sleep 0.1
    done
    echo "run: stopped"
}

if [ "$KEEP" = "1" ] && [ "$INSIDE" = "0" ]; then
    echo "run: left running. Use it with:"
    echo "  export TARN_ROOT=$TARN_ROOT"
    echo "  $TARN_BUILD_DIR/bin/tarnctl status"
    echo "  kill \$(cat $PIDFILE) $WEBPID    # to stop the daemon and the song server"
    exit 0
fi
stop_daemon
status=$?
kill "$WEBPID" 2>/dev/null && wait "$WEBPID" 2>/dev/null
case "$TARN_AUDIO_OUT" in
    wav:*) echo "run: the music that played is in ${TARN_AUDIO_OUT#wav:}" ;;
esac
echo "run: daemon log ($TARN_LOG_FILE):"
sed 's/^/  /' "$TARN_LOG_FILE" 2>/dev/null
[ "$status" = "0" ] && [ "$MADE_ROOT" = "1" ] && rm -rf "$TARN_ROOT"
exit $status
