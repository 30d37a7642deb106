#!/bin/sh
# scripts/run.sh as a person uses it: with a music folder until Ctrl-C,
# --demo (plays through and stops), --netns --keep (left running in its own
# namespace, reachable with the printed line), and its usage errors.
#   tests/scripts/run_modes.sh BUILD_DIR SOURCE_DIR   (inside scripts/netns-run)
B=$1
S=$2
T=$(mktemp -d /tmp/tarnrun.XXXXXX)
FAILS=0
fail() { echo "FAIL: $*"; FAILS=$((FAILS + 1)); }
ok() { echo "ok: $*"; }
# Alive and not a zombie (orphans are not reaped here).
alive() { st=$(sed 's/.*) //' "/proc/$1/stat" 2>/dev/null | cut -c1); [ -n "$st" ] && [ "$st" != Z ]; }
trap 'rm -rf "$T"' EXIT
export TARN_BUILD_DIR=$B TARN_AUDIO_OUT=null TARN_DEMO_SECONDS=2 TARN_DEMO_WATCH=14
unset TARN_ROOT TARN_LOG_FILE TARN_SHM_KEY
RUN=$S/scripts/run.sh

"$RUN" --no-such-option > "$T/o" 2>&1; [ $? = 2 ] || fail "unknown option: status not 2"
"$RUN" --no-build "$T/missing" > "$T/o" 2>&1; [ $? = 2 ] || fail "missing music folder: status not 2"
grep -q "is not a folder" "$T/o" || fail "missing music folder: $(cat "$T/o")"
"$RUN" --help | grep -q -- "--netns" || fail "--help does not list --netns"

# --- a music folder, playing until Ctrl-C -----------------------------------------
M="$T/my music"
"$S/scripts/make-demo-songs.sh" "$M" 2 > /dev/null 2>&1 || fail "make-demo-songs.sh"
setsid "$RUN" --no-build "$M" > "$T/live" 2>&1 &
LIVE=$!
i=0
until grep -q "Ctrl-C stops everything" "$T/live" || [ $i -gt 300 ]; do i=$((i + 1)); sleep 0.1; done
sleep 1.5
ROOT=$(sed -n 's/^run: installing into the private root //p' "$T/live")
DPID=$(cat "$ROOT/var/run/tarnaudiod.pid" 2>/dev/null)
[ -n "$DPID" ] && alive "$DPID" || fail "live mode: no daemon running: $(cat "$T/live")"
grep -q "^Scanned $M in .*3 audio files, 3 added" "$T/live" || fail "live mode: $M not scanned"
grep -q "^music_dir=\"$M\"" "$ROOT/etc/tarninfo.conf" || fail "live mode: music_dir not set"
grep -q "web remote: http://[0-9.]*:8580/" "$T/live" || fail "live mode: no web remote URL"
grep -q "TARN_ROOT=$ROOT $ROOT/usr/bin/tarnctl status" "$T/live" || fail "live mode: no tarnctl line"
TARN_ROOT=$ROOT "$ROOT/usr/bin/tarnctl" status | grep -q "^\[playing\]" || fail "live mode: not playing"
/bin/kill -INT -- "-$LIVE"   # Ctrl-C: to the whole foreground group
wait $LIVE
rc=$?
[ $rc = 0 ] || fail "live mode: status $rc after Ctrl-C"
grep -q "^run: stopped" "$T/live" || fail "live mode: not stopped cleanly: $(tail -5 "$T/live")"
alive "$DPID" && { fail "live mode: daemon still runs"; kill "$DPID"; }
[ -d "$ROOT" ] && fail "live mode: root $ROOT left behind"
ok "music folder until Ctrl-C"

# --- --demo ------------------------------------------------------------------------
"$RUN" --no-build --demo > "$T/demo" 2>&1
rc=$?
[ $rc = 0 ] || fail "--demo: status $rc: $(tail -20 "$T/demo")"
grep -q "Demo Tone A440" "$T/demo" || fail "--demo: the demo songs did not play"
grep -q "^run: stopped" "$T/demo" || fail "--demo: not stopped"
ok "--demo"

# --- --netns --keep: left running in its own namespace -----------------------------
"$RUN" --no-build --netns --keep "$M" > "$T/keep" 2>&1
rc=$?
[ $rc = 0 ] || fail "--netns --keep: status $rc: $(tail -20 "$T/keep")"
LINE=$(grep 'tarnctl status' "$T/keep" | head -1 | sed 's/^ *//; s/ *(tarnctl --help.*//')
PIDS=$(sed -n 's/^ *kill \([0-9 ]*\) *#.*/\1/p' "$T/keep")
[ -n "$LINE" ] && [ -n "$PIDS" ] || fail "--netns --keep: no usage lines: $(cat "$T/keep")"
case "$LINE" in nsenter*) ;; *) fail "--netns --keep: the line does not enter the namespace: $LINE" ;; esac
out=$(sh -c "$LINE" 2>&1)
case "$out" in *"[playing]"*) ok "--netns --keep reachable: $out" ;; *) fail "--netns --keep: $out" ;; esac
DPID=${PIDS%% *}
[ "$(readlink /proc/$DPID/ns/net)" != "$(readlink /proc/self/ns/net)" ] || fail "--netns: daemon in our namespace"
kill $PIDS
KROOT=$(sed -n 's/^run: installing into the private root //p' "$T/keep")
i=0
while [ -e "$KROOT/var/run/tarnaudiod.pid" ] && [ $i -lt 100 ]; do i=$((i + 1)); sleep 0.1; done
[ -e "$KROOT/var/run/tarnaudiod.pid" ] && fail "--keep: daemon did not stop on kill"
rm -rf "$KROOT"

[ "$FAILS" = 0 ] && echo "run_modes: all passed" && exit 0
echo "run_modes: $FAILS failures"
exit 1
