#!/bin/sh
# Leak check of tarnaudiod: builds the daemon with AddressSanitizer (whose
# LeakSanitizer reports at exit) and UndefinedBehaviorSanitizer, runs one
# whole scenario in a private root inside a private network namespace and
# reads what the sanitizers wrote:
#   start; a media library and songs; queue, local playback and its
#   controls; a real renderer (gmediarender on the namespace's second
#   interface) found, selected, given songs and left again; every source
#   change; custom slots; stop with SIGTERM.
# Fails when the daemon reports a leak with a frame in this source tree, or
# any AddressSanitizer error or undefined behaviour. Leaks whose every frame
# lies in system libraries are listed but do not fail the check.
#
#   scripts/leakcheck.sh [BUILD_DIR]     (default build-leak)
# The reports stay in BUILD_DIR/leakcheck/ (asan.<pid> files, daemon log).
cd "$(dirname "$0")/.." || exit 1
SRC=$(pwd)
B=${1:-build-leak}
case "$B" in /*) ;; *) B="$SRC/$B" ;; esac

if [ "$1" != "--inside" ]; then
    echo "leakcheck: building the sanitized daemon and its tools into $B (a few minutes the first time)"
    mkdir -p "$B"
    cmake -S . -B "$B" -DTARN_SANITIZE=ON -DTARN_TESTS=OFF -DCMAKE_BUILD_TYPE=RelWithDebInfo \
        > "$B/leakcheck-cmake.log" 2>&1 || { cat "$B/leakcheck-cmake.log"; echo "leakcheck: cmake failed"; exit 1; }
    cmake --build "$B" --target tarnaudiod tarnctl tarnlib mplayer-daemon -j"${TARN_JOBS:-2}" \
        > "$B/leakcheck-build.log" 2>&1 || { tail -30 "$B/leakcheck-build.log"; echo "leakcheck: build failed"; exit 1; }
    exec "$SRC/scripts/netns-run" "$SRC/scripts/leakcheck.sh" --inside "$B"
fi
B=$2

OUT="$B/leakcheck"
rm -rf "$OUT"
mkdir -p "$OUT"
ROOT=$(mktemp -d /tmp/tarnleak.XXXXXX)
export TARN_ROOT="$ROOT"
export TARN_SHM_KEY=$((0x31000000 + ($$ % 30000) * 2))
export TARN_LOG_FILE="$ROOT/log.txt"
export TARN_AUDIO_OUT=null
# Full stacks (system libraries have no frame pointers), one file per
# process. mplayer-daemon inherits the options; its reports are kept too.
# atexit=1: every process writes its statistics at exit, so a missing report
# means the sanitizer never saw the exit (and the check would prove nothing).
export ASAN_OPTIONS="log_path=$OUT/asan:detect_leaks=1:atexit=1:fast_unwind_on_malloc=0:malloc_context_size=30"
export UBSAN_OPTIONS="print_stacktrace=1:log_path=$OUT/ubsan"
CTL="env ASAN_OPTIONS=detect_leaks=0 $B/bin/tarnctl --timeout 5000"
RENDERER=
cleanup() {
    [ -n "$RENDERER" ] && kill "$RENDERER" 2>/dev/null
    rm -rf "$ROOT"
}
trap cleanup EXIT

# The root comes from the install rules (the sanitized mplayer-daemon, the
# equalizer profiles and radio seeds); the configuration is the check's own.
"$SRC/scripts/make-root.sh" --build "$B" --component player --component data "$ROOT" ||
    { echo "leakcheck: cannot lay out the root"; exit 1; }
mkdir -p "$ROOT/share/Music" "$ROOT/dev"
printf 'audio_volume="50"\nadmin_port=8080\n' > "$ROOT/etc/tarninfo.conf"
step() { echo "leakcheck: $*"; }

step "songs and media library"
sh "$SRC/scripts/make-demo-songs.sh" "$ROOT/share/Music" 3 > /dev/null 2>&1 ||
    { echo "leakcheck: cannot make demo songs (scripts/setup.sh installs sox, lame, flac, vorbis-tools)"; exit 1; }
printf '%s\n' "$ROOT/share/Music/tone-440.mp3" "$ROOT/share/Music/tone-880.ogg" > "$ROOT/share/Music/mix.m3u"
ASAN_OPTIONS=detect_leaks=0 "$B/bin/tarnlib" scan "$ROOT/share/Music" > "$OUT/tarnlib.txt" 2>&1 ||
    { cat "$OUT/tarnlib.txt"; echo "leakcheck: library scan failed"; exit 1; }
cat > "$ROOT/usr/tarn/etc/audio/radio/favorite.json" <<'EOF'
{"stations":[{"name":"Closed port","url":"http://127.0.0.1:9/a.mp3","desc":""}],"total":1}
EOF

step "start"
"$B/bin/tarnaudiod" > "$OUT/start.txt" 2>&1
i=0
until $CTL status > /dev/null 2>&1; do
    i=$((i + 1))
    [ $i -gt 150 ] && { cat "$OUT/start.txt"; echo "leakcheck: the daemon does not answer"; exit 1; }
    sleep 0.1
done
PID=$(cat "$ROOT/var/run/tarnaudiod.pid")
step "daemon pid $PID"

q() { $CTL "$@" > /dev/null 2>>"$OUT/tarnctl.err" || echo "leakcheck:   (tarnctl $* failed)"; }

step "queue and local playback"
q queue add "$ROOT/share/Music/tone-440.mp3" "$ROOT/share/Music/tone-660.flac" "$ROOT/share/Music/tone-880.ogg"
q queue insert 1 "$ROOT/share/Music/tone-660.flac"
q play 1
sleep 2
q status
q volume 30
q volume +3
q seek 1
q mute toggle
q mute toggle
q eq 1 2 3 0 0 0 0 0 -2 -4
q next
sleep 1
q pause
q play
q repeat all
q shuffle toggle
q repeat off
q queue list
q queue remove 1
q queue current 1
q prev
sleep 4
q stop

if [ -x /usr/bin/gmediarender ]; then
    step "renderer"
    # The renderer goes on the interface facing the daemon's UPnP address.
    IFACE=tveth1
    ss -ltnH 2>/dev/null | grep -q '10\.77\.0\.2:49152' && IFACE=tveth0
    /usr/bin/gmediarender -I "$IFACE" -p 49496 -f "Leak Renderer" -u 4c65616b-0000-4000-8000-000000000001 \
        --gstout-audiopipe "fakesink sync=true" > "$OUT/gmediarender.txt" 2>&1 &
    RENDERER=$!
    sleep 1
    i=0
    until $CTL --json renderers 2>/dev/null | grep -q '"total" : [1-9]'; do
        [ $((i % 10)) = 0 ] && q discover renderers
        i=$((i + 1))
        [ $i -gt 60 ] && { echo "leakcheck:   renderer not found; going on without it"; break; }
        sleep 0.5
    done
    q servers
    q select 1
    q play 1
    sleep 3
    q status
    q volume 20
    q pause
    q play
    q next
    sleep 2
    q stop
    q select 1
    q select local
    kill "$RENDERER" 2>/dev/null
    wait "$RENDERER" 2>/dev/null
    RENDERER=
    # The renderer says goodbye or times out; the daemon drops it.
    sleep 2
    q renderers
else
    step "renderer skipped (gmediarender not installed)"
fi

step "sources and custom slots"
q source random
sleep 1
q source next
q source prev
q source radio
sleep 1
q slot save 1
q source playlist
q slot save 2
q source custom 1
q source custom 2
q source custom 9
q source ipod
q stop
q queue clear
q changed set
q changed clear

step "stop"
kill -TERM "$PID"
i=0
while kill -0 "$PID" 2>/dev/null; do
    i=$((i + 1))
    [ $i -gt 300 ] && { echo "leakcheck: the daemon did not end within 30 s"; kill -KILL "$PID"; exit 1; }
    sleep 0.1
done
# LeakSanitizer writes while the process ends; give it a moment.
sleep 1
cp "$ROOT/log.txt" "$OUT/daemon.log" 2>/dev/null

status=0
REPORT="$OUT/asan.$PID"
# Leak blocks ("Direct leak ..." up to the blank line) with a frame in this
# source tree (not the build folder, whose binaries every frame names).
our_leaks() {
    awk -v src="$SRC/" '
        /^(Direct|Indirect) leak/ { block = $0 "\n"; inleak = 1; mine = 0; next }
        inleak && /^$/ { if (mine) printf "%s\n", block; inleak = 0; next }
        inleak { block = block $0 "\n"; if (index($0, src) > 0 && index($0, src "build") == 0) mine = 1 }
    ' "$1"
}
if [ ! -f "$REPORT" ]; then
    echo "leakcheck: FAIL: no sanitizer report from the daemon (pid $PID): was it built with TARN_SANITIZE?"
    status=1
fi
for f in "$OUT"/asan.*; do
    [ -f "$f" ] || continue
    who="mplayer-daemon or tool (pid ${f##*.})"
    [ "$f" = "$REPORT" ] && who="tarnaudiod (pid $PID)"
    if grep -q "ERROR: AddressSanitizer" "$f"; then
        echo "leakcheck: AddressSanitizer error in $who:"
        sed -n '1,40p' "$f"
        status=1
    fi
    blocks=$(grep -cE '^(Direct|Indirect) leak' "$f")
    ours=$(our_leaks "$f")
    if [ -n "$ours" ]; then
        echo "leakcheck: $who: leaks with frames in this source tree:"
        printf '%s\n' "$ours" | head -80
        status=1
    else
        echo "leakcheck: $who: $blocks leak block(s), none with a frame in this source tree${blocks:+ ($f)}"
    fi
done
for f in "$OUT"/ubsan.*; do
    [ -f "$f" ] || continue
    echo "leakcheck: undefined behaviour reported ($f):"
    head -20 "$f"
    status=1
done
echo "leakcheck: tarnctl error lines: $(cat "$OUT/tarnctl.err" 2>/dev/null | wc -l) (see $OUT/tarnctl.err)"
[ $status = 0 ] && echo "leakcheck: PASS" || echo "leakcheck: FAIL"
exit $status
