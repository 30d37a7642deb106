#!/bin/sh
# The install rules: `cmake --install --prefix` lays out the whole system,
# DESTDIR roots are runnable (the installed daemon starts the installed
# mplayer-daemon and plays), a changed configuration survives a reinstall,
# every configuration key the code reads is documented, man pages render,
# units verify and the bash completion answers.
#   tests/scripts/install_layout.sh BUILD_DIR SOURCE_DIR   (inside scripts/netns-run)
B=$1
S=$2
T=$(mktemp -d /tmp/tarninst.XXXXXX)
FAILS=0
DAEMON=
fail() { echo "FAIL: $*"; FAILS=$((FAILS + 1)); }
ok() { echo "ok: $*"; }
cleanup() {
    [ -n "$DAEMON" ] && kill "$DAEMON" 2>/dev/null
    rm -rf "$T"
}
trap cleanup EXIT

# --- cmake --install --prefix: every file where it belongs ------------------
P=$T/prefix
cmake --install "$B" --prefix "$P" > "$T/install.log" 2>&1 || { cat "$T/install.log"; fail "cmake --install"; }
for f in sbin/tarnaudiod sbin/tarnweb bin/tarnctl bin/tarnlib tarn/bin/mplayer-daemon \
         tarn/etc.defaults/audio/equalizer.system tarn/etc/audio/default_radio_station.asx \
         tarn/etc/audio/manual_radio_station.asx share/tarnaudiod/tarninfo.conf etc/tarninfo.conf \
         lib/systemd/system/tarnaudiod.service lib/systemd/system/tarnaudiod-scan.service \
         lib/systemd/system/tarnweb.service \
         share/man/man1/tarnctl.1 share/man/man1/tarnlib.1 share/man/man5/tarninfo.conf.5 \
         share/man/man8/tarnaudiod.8 share/man/man8/tarnweb.8 share/man/man8/mplayer-daemon.8 \
         share/bash-completion/completions/tarnctl share/bash-completion/completions/tarnlib; do
    [ -f "$P/$f" ] || fail "missing after install: $f"
done
for d in tarn/etc/audio/radio tarn/var; do
    [ -d "$P/$d" ] || fail "missing folder after install: $d"
done
for x in sbin/tarnaudiod sbin/tarnweb bin/tarnctl bin/tarnlib tarn/bin/mplayer-daemon; do
    [ -x "$P/$x" ] || fail "not executable: $x"
done
grep -q "^ExecStart=$P/sbin/tarnaudiod --foreground\$" "$P/lib/systemd/system/tarnaudiod.service" ||
    fail "tarnaudiod.service does not start $P/sbin/tarnaudiod --foreground"
ok "prefix install layout"

# --- man pages render without warnings ----------------------------------------
for m in "$P"/share/man/man*/*; do
    out=$(MANWIDTH=80 man --warnings -l "$m" 2>&1 > "$T/man.txt")
    [ -z "$out" ] || fail "man -l $m warns: $out"
    name=$(basename "$m" | sed 's/\.[0-9]$//' | tr a-z A-Z)
    grep -q "^$name(" "$T/man.txt" || fail "man -l $m: no $name( header"
    grep -q "^NAME" "$T/man.txt" || fail "man -l $m: no NAME section"
done
ok "man pages render"

# --- systemd units verify (with their man pages found) ------------------------
if command -v systemd-analyze > /dev/null; then
    MANPATH=$P/share/man systemd-analyze verify "$P"/lib/systemd/system/*.service > "$T/verify.txt" 2>&1 ||
        { cat "$T/verify.txt"; fail "systemd-analyze verify"; }
    [ -s "$T/verify.txt" ] && { cat "$T/verify.txt"; fail "systemd-analyze verify printed warnings"; }
    ok "systemd-analyze verify"
else
    echo "SKIP: systemd-analyze is not installed (scripts/setup.sh installs systemd)"
fi

# --- every key the code reads is in the shipped configuration and its page ---
KEYS=$( (grep -rhoE '(TLIBCFileGetKeyValue|TLIBCFileSetKeyValue)\([^,]+, *"[a-z0-9_]+"' "$S"/daemon "$S"/player \
            "$S"/source "$S"/audio "$S"/platform "$S"/upnp "$S"/tools | grep -oE '"[a-z0-9_]+"$'
         grep -rhoE 'ConfNumber\("[a-z0-9_]+"' "$S"/source "$S"/platform "$S"/upnp "$S"/player "$S"/daemon | grep -oE '"[a-z0-9_]+"'
         grep -rhoE 'ConfValue\([^,]+, *"[a-z0-9_]+"' "$S"/tools | grep -oE '"[a-z0-9_]+"$'
         grep -rhoE 'kKey[A-Za-z]*\[\] = "[a-z0-9_]+"' "$S"/audio | grep -oE '"[a-z0-9_]+"'
         grep -rhoE 'ConfKey[A-Za-z]*\("[a-z0-9_]+"' "$S"/platform "$S"/tools "$S"/daemon | grep -oE '"[a-z0-9_]+"'
       ) | tr -d '"' | sort -u)
n=0
for k in $KEYS; do
    n=$((n + 1))
    grep -qE "^#?$k=" "$P/etc/tarninfo.conf" || fail "key $k is not in the shipped tarninfo.conf"
    grep -q "^\.B $k\$" "$S/packaging/man/tarninfo.conf.5" || fail "key $k is not in tarninfo.conf(5)"
done
[ "$n" -ge 12 ] || fail "found only $n configuration keys in the code (the search is broken)"
ok "$n configuration keys documented"

# --- a changed configuration survives a reinstall -------------------------------
echo "audio_volume=\"17\"" >> "$P/etc/tarninfo.conf"
cmake --install "$B" --prefix "$P" > "$T/install2.log" 2>&1 || fail "second cmake --install"
grep -q '^audio_volume="17"$' "$P/etc/tarninfo.conf" || fail "reinstall overwrote a changed tarninfo.conf"
ok "reinstall keeps tarninfo.conf"

# --- bash completion and tarnctl(1) follow the program ------------------------
BC=/usr/share/bash-completion/bash_completion
if [ -f "$BC" ] && command -v bash > /dev/null; then
    got=$(bash -c ". $BC; . $P/share/bash-completion/completions/tarnctl
        COMP_WORDS=(tarnctl rep); COMP_CWORD=1; COMP_LINE='tarnctl rep'; COMP_POINT=11
        _tarnctl; echo \"\${COMPREPLY[*]}\"
        COMP_WORDS=(tarnctl repeat ''); COMP_CWORD=2; COMP_LINE='tarnctl repeat '; COMP_POINT=15
        _tarnctl; echo \"\${COMPREPLY[*]}\"
        . $P/share/bash-completion/completions/tarnlib
        COMP_WORDS=(tarnlib --db x s); COMP_CWORD=3; COMP_LINE='tarnlib --db x s'; COMP_POINT=16
        _tarnlib; echo \"\${COMPREPLY[*]}\"" 2>&1)
    [ "$(echo "$got" | sed -n 1p)" = "repeat" ] || fail "tarnctl completion of 'rep': $got"
    [ "$(echo "$got" | sed -n 2p)" = "off one all" ] || fail "tarnctl completion after repeat: $got"
    [ "$(echo "$got" | sed -n 3p)" = "scan songs smart" ] || fail "tarnlib completion of 's': $got"

    # Every command of "tarnctl --help" is completed and has its entry in
    # tarnctl(1); commands whose arguments are only fixed words (repeat
    # [off|one|all], discover servers|renderers, select local|N|NAME ...)
    # complete exactly those words; sub-commands and files are offered.
    # ls completes the library's folders: a library with two of them.
    MANWIDTH=200 man -l "$P/share/man/man1/tarnctl.1" 2> /dev/null | sed -n '/^COMMANDS/,/^FORMAT/p' > "$T/tarnctl.man"
    mkdir -p "$T/files/Some Folder" && : > "$T/files/song one.flac"
    L=$T/libroot
    mkdir -p "$L/usr/tarn/var" "$T/music/Jazz/Blue Train" "$T/music/Rock"
    "$S/scripts/make-demo-songs.sh" "$T/music/Jazz/Blue Train" 1 > /dev/null 2>&1
    "$S/scripts/make-demo-songs.sh" "$T/music/Rock" 1 > /dev/null 2>&1
    TARN_ROOT=$L "$P/bin/tarnlib" scan "$T/music" > /dev/null || fail "tarnlib scan of $T/music"
    TARN_ROOT=$L PATH=$P/bin:$PATH bash -c '
        . "$1"; . "$2"
        ask() {  # ask WORD... CURRENT: the completions offered for CURRENT
            COMP_WORDS=(tarnctl "$@"); COMP_CWORD=$#
            COMP_LINE="${COMP_WORDS[*]}"; COMP_POINT=${#COMP_LINE}
            COMPREPLY=(); _tarnctl; echo "${COMPREPLY[*]}"
        }
        n=0
        all=" $(ask "") "
        while read -r name args; do
            n=$((n + 1))
            [[ $all == *" $name "* ]] || echo "FAIL: tarnctl completion does not offer the command $name"
            grep -Eq "^       ([a-z]+ \| )?$name( |\$)" "$3" || echo "FAIL: tarnctl(1) has no entry for $name"
            w=${args#[}; w=${w%]}
            if [[ -n $w && $w =~ ^[a-zA-Z]+(\|[a-zA-Z]+)+$ ]]; then
                want=$(tr "|" "\n" <<< "$w" | grep -v "^[A-Z]*$" | tr "\n" " ")
                [[ "$(ask "$name" "") " == "$want" ]] ||
                    echo "FAIL: tarnctl completion after $name: [$(ask "$name" "")], usage says [$want]"
            fi
        done < <(tarnctl --help | sed -n "s/^  \([a-z][a-z]*\)\( \(.*\)\)\{0,1\}\$/\1 \3/p" |
                 sed "s/  .*//")
        [ "$n" -ge 30 ] || echo "FAIL: found only $n commands in tarnctl --help"
        [ "$(ask slot "")" = "save load list" ] || echo "FAIL: slot: $(ask slot "")"
        [ "$(ask slot load "")" = "1 2 3 4 5 6 7 8 9" ] || echo "FAIL: slot load: $(ask slot load "")"
        [ "$(ask source custom "")" = "1 2 3 4 5 6 7 8 9" ] || echo "FAIL: source custom: $(ask source custom "")"
        [ "$(ask source "")" = "random radio ipod playlist next prev custom" ] || echo "FAIL: source: $(ask source "")"
        [ "$(ask search "")" = "any artist album title" ] || echo "FAIL: search: $(ask search "")"
        [ "$(ask random "")" = "on off toggle" ] || echo "FAIL: alias random: $(ask random "")"
        [ "$(ask --json --timeout 500 sh)" = "shuffle" ] || echo "FAIL: after options: $(ask --json --timeout 500 sh)"
        [ "$(ask -)" = "--json --timeout --help --version" ] || echo "FAIL: options: $(ask -)"
        [ "$(ask watch --)" = "--json --help --count --interval" ] || echo "FAIL: watch options: $(ask watch --)"
        [ "$(ask add "$4/so")" = "$4/song one.flac" ] || echo "FAIL: add FILE: $(ask add "$4/so")"
        [ "$(ask queue insert 2 "$4/So")" = "$4/Some Folder" ] || echo "FAIL: queue insert: $(ask queue insert 2 "$4/So")"
        [ -z "$(ask insert "$4/so")" ] || echo "FAIL: insert completes a file where POS belongs"
        [ "$(ask ls "$4/S")" = "$4/Some Folder" ] || echo "FAIL: ls /PATH: $(ask ls "$4/S")"
        [ "$(ask ls "")" = "Jazz/ Rock/" ] || echo "FAIL: ls: $(ask ls "")"
        [ "$(ask ls --add Jazz/B)" = "Jazz/Blue Train/" ] || echo "FAIL: ls Jazz/B: $(ask ls --add Jazz/B)"
    ' sh "$BC" "$P/share/bash-completion/completions/tarnctl" "$T/tarnctl.man" "$T/files" > "$T/comp.txt" 2>&1
    while read -r line; do fail "${line#FAIL: }"; done < "$T/comp.txt"
    ok "bash completion"
else
    echo "SKIP: bash-completion is not installed (scripts/setup.sh installs it)"
fi

# --- a DESTDIR root runs: the installed daemon plays with the installed player -
R=$T/root
"$S/scripts/make-root.sh" --build "$B" "$R" || fail "make-root.sh"
[ -x "$R/usr/tarn/bin/mplayer-daemon" ] && [ -f "$R/etc/tarninfo.conf" ] &&
    [ -f "$R/usr/tarn/etc.defaults/audio/equalizer.system" ] || fail "make-root.sh root incomplete"
MUSIC=$T/music
"$S/scripts/make-demo-songs.sh" "$MUSIC" 3 > /dev/null 2>&1
SONG=$(ls "$MUSIC"/*.flac "$MUSIC"/*.mp3 2>/dev/null | head -1)
[ -n "$SONG" ] || fail "no demo song made (scripts/make-demo-songs.sh)"
export TARN_ROOT=$R TARN_SHM_KEY=$((0x32000000 + ($$ % 30000) * 2)) TARN_LOG_FILE=$R/log.txt TARN_AUDIO_OUT=null
"$R/usr/sbin/tarnaudiod" > "$T/daemon.out" 2>&1
i=0
until "$R/usr/bin/tarnctl" status > /dev/null 2>&1; do
    i=$((i + 1)); [ $i -gt 100 ] && break; sleep 0.1
done
DAEMON=$(cat "$R/var/run/tarnaudiod.pid" 2>/dev/null)
[ -n "$DAEMON" ] || fail "installed tarnaudiod did not start: $(cat "$T/daemon.out" "$R/log.txt" 2>/dev/null)"
"$R/usr/bin/tarnctl" add "$SONG" > /dev/null || fail "tarnctl add"
"$R/usr/bin/tarnctl" play 1 > /dev/null || fail "tarnctl play 1"
i=0
while :; do
    MP=$(cat "$R/var/run/mplayer.daemon.pid" 2>/dev/null)
    st=$("$R/usr/bin/tarnctl" --json status 2>/dev/null | tr -d ' \n')
    case "$st" in *'"PlayerState":2'*) [ -n "$MP" ] && break ;; esac
    i=$((i + 1)); [ $i -gt 100 ] && break; sleep 0.1
done
case "$st" in *'"PlayerState":2'*) ok "installed daemon plays" ;; *) fail "not playing: $st" ;; esac
exe=$(readlink "/proc/$MP/exe" 2>/dev/null)
[ "$exe" = "$R/usr/tarn/bin/mplayer-daemon" ] || fail "player process is [$exe], not the installed one"
kill -TERM "$DAEMON"
i=0
while kill -0 "$DAEMON" 2>/dev/null && [ $i -lt 100 ]; do i=$((i + 1)); sleep 0.1; done
[ -e "$R/var/run/tarnaudiod.pid" ] && fail "pid file left after SIGTERM"
DAEMON=
[ "$FAILS" = 0 ] && echo "install_layout: all passed" && exit 0
echo "install_layout: $FAILS failures"
exit 1
