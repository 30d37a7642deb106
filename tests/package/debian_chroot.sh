#!/bin/sh
# The Debian package on a fresh Debian 12: installed with apt-get into a
# debootstrap root (made once and cached), its services' ExecStart lines run
# in a private network namespace (no systemd in a chroot), a song scanned
# from music_dir and played with the installed programs; a changed
# configuration survives a reinstall, a member of the audio group uses
# tarnctl, purge removes the configuration.
#   tests/package/debian_chroot.sh SOURCE_DIR [DEB]
# The pristine root is cached in TARN_CHROOT_CACHE (default
# /var/cache/tarnaudiod/bookworm); apt's downloads in .../apt-archives.
# Exits 77 (skipped) when no root can be made (no debootstrap, no mirror).
S=$1
DEB=$2
CACHE=${TARN_CHROOT_CACHE:-/var/cache/tarnaudiod/bookworm}
MIRROR=${TARN_DEBIAN_MIRROR:-http://deb.debian.org/debian}
skip() { echo "SKIP: $*"; exit 77; }
[ "$(id -u)" = "0" ] || skip "needs root (chroot, mounts)"
if [ ! -x "$CACHE/bin/sh" ]; then
    command -v debootstrap > /dev/null || skip "debootstrap is not installed (scripts/setup.sh installs it)"
    echo "making the Debian 12 root in $CACHE (once; a few minutes)"
    mkdir -p "$(dirname "$CACHE")"
    rm -rf "$CACHE.tmp"
    debootstrap --variant=minbase bookworm "$CACHE.tmp" "$MIRROR" > "$CACHE.log" 2>&1 ||
        { tail -5 "$CACHE.log"; rm -rf "$CACHE.tmp"; skip "debootstrap could not make the root (see $CACHE.log)"; }
    mv "$CACHE.tmp" "$CACHE"
fi
if [ -z "$DEB" ]; then
    "$S/scripts/package.sh" > /tmp/tarn-package.log 2>&1 || { cat /tmp/tarn-package.log; echo "FAIL: package.sh"; exit 1; }
    DEB=$(ls -t "$S"/dist/tarnaudiod_*.deb | head -1)
fi
[ -f "$DEB" ] || { echo "FAIL: no package $DEB"; exit 1; }

T=$(mktemp -d /var/tmp/tarnchroot.XXXXXX)
R=$T/root
FAILS=0
fail() { echo "FAIL: $*"; FAILS=$((FAILS + 1)); }
ok() { echo "ok: $*"; }
cleanup() {
    for m in "$R/var/cache/apt/archives" "$R/dev" "$R/proc"; do
        mountpoint -q "$m" && umount -l "$m"
    done
    rm -rf "$T"
}
trap cleanup EXIT
echo "copying the fresh root"
cp -a "$CACHE" "$R" || { echo "FAIL: cannot copy $CACHE"; exit 1; }
mkdir -p "$CACHE.apt-archives/partial"
mount -t proc proc "$R/proc"
mount --bind /dev "$R/dev"
mount --bind "$CACHE.apt-archives" "$R/var/cache/apt/archives"
cp /etc/resolv.conf "$R/etc/resolv.conf" 2>/dev/null
in_root() { chroot "$R" /usr/bin/env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin HOME=/root DEBIAN_FRONTEND=noninteractive "$@"; }

cp "$DEB" "$R/tmp/"
NAME=$(basename "$DEB")
in_root apt-get update -qq > "$T/apt.log" 2>&1 || { tail "$T/apt.log"; skip "apt-get update failed in the root (no mirror?)"; }
in_root apt-get install -y -qq --no-install-recommends "/tmp/$NAME" > "$T/apt.log" 2>&1 ||
    { tail -20 "$T/apt.log"; fail "apt-get install ./$NAME"; exit 1; }
ok "apt-get install ./$NAME on a fresh Debian 12"
for f in /usr/sbin/tarnaudiod /usr/bin/tarnctl /usr/tarn/bin/mplayer-daemon /etc/tarninfo.conf \
         /usr/lib/systemd/system/tarnaudiod.service /usr/share/man/man8/tarnaudiod.8; do
    [ -e "$R$f" ] || fail "missing after install: $f"
done
[ -L "$R/etc/systemd/system/multi-user.target.wants/tarnaudiod.service" ] || fail "tarnaudiod.service not enabled"
in_root tarnaudiod --version | grep -q "^tarnaudiod " || fail "tarnaudiod --version in the root"

# Music and the configuration, as an administrator would set them.
"$S/scripts/make-demo-songs.sh" "$R/srv/music" 3 > /dev/null 2>&1 || fail "make-demo-songs.sh"
echo 'music_dir=/srv/music' >> "$R/etc/tarninfo.conf"
in_root useradd -m -G audio anna || fail "useradd"

# Every ExecStart of the units, as systemd would run them, in a private
# network namespace; the sound goes to a WAV file (the root has no sound card).
unit_exec() { sed -n 's/^ExecStart=//p' "$R/usr/lib/systemd/system/$1"; }
DAEMON=$(unit_exec tarnaudiod.service)
SCAN=$(unit_exec tarnaudiod-scan.service)
WEB=$(unit_exec tarnweb.service)
cat > "$R/tmp/session.sh" <<SESSION
#!/bin/sh
export TARN_AUDIO_OUT=wav:/tmp/play.wav
$DAEMON > /tmp/daemon.err 2>&1 &
$SCAN
$WEB > /tmp/web.out 2>&1 &
i=0
until tarnctl status > /dev/null 2>&1 || [ \$i -gt 100 ]; do i=\$((i + 1)); sleep 0.1; done
tarnctl source random && tarnctl play 1 || echo "session: control failed"
i=0
until tarnctl --json status | tr -d ' \n' | grep -q '"PlayerState":2,.*"Position":[1-9]' || [ \$i -gt 100 ]; do
    i=\$((i + 1)); sleep 0.1
done
tarnctl status
echo "as anna: \$(setpriv --reuid=anna --regid=anna --init-groups tarnctl status 2>&1 | grep -m1 '^\\[\\|tarnctl:')"
echo "as nobody: \$(setpriv --reuid=nobody --regid=nogroup --clear-groups tarnctl status 2>&1 | grep -m1 '^\\[\\|tarnctl:')"
kill -TERM \$(cat /var/run/tarnaudiod.pid) \$(pidof tarnweb)
i=0
while [ -e /var/run/tarnaudiod.pid ] && [ \$i -lt 100 ]; do i=\$((i + 1)); sleep 0.1; done
[ -e /var/run/tarnaudiod.pid ] && echo "session: daemon did not stop"
echo "wav bytes: \$(stat -c %s /tmp/play.wav 2>/dev/null)"
SESSION
chmod +x "$R/tmp/session.sh"
"$S/scripts/netns-run" chroot "$R" /usr/bin/env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin HOME=/root \
    /tmp/session.sh > "$T/session.out" 2>&1
cat "$T/session.out"
grep -q "^Scanned /srv/music .*3 audio files, 3 added" "$T/session.out" || fail "the scan unit did not scan music_dir"
grep -q "^\[playing\] .* 0:0[1-9]/" "$T/session.out" || fail "no song playing with the installed programs"
grep -q "^as anna: \[playing\]" "$T/session.out" || fail "a member of audio cannot use tarnctl"
grep -q "^as nobody: tarnctl: permission denied" "$T/session.out" || fail "a non-member was not denied"
grep -q "session:" "$T/session.out" && fail "session problems (above)"
bytes=$(sed -n 's/^wav bytes: //p' "$T/session.out")
[ "${bytes:-0}" -gt 100000 ] || fail "the WAV output holds ${bytes:-no} bytes"
grep -q "tarnaudiod: tarnaudiod:530 tarnaudiod exit" "$R/tmp/daemon.err" || fail "--foreground: no log on stderr"
ok "played in a private network namespace with the units' ExecStart lines"

# A changed configuration survives a reinstall; purge removes it.
in_root apt-get install -y -qq --reinstall "/tmp/$NAME" > "$T/apt.log" 2>&1 || fail "reinstall"
grep -q '^music_dir=/srv/music$' "$R/etc/tarninfo.conf" || fail "reinstall overwrote /etc/tarninfo.conf"
grep -q '^audio_volume=' "$R/etc/tarninfo.conf" || fail "the daemon did not save the volume"
in_root apt-get purge -y -qq tarnaudiod > "$T/apt.log" 2>&1 || fail "purge"
[ -e "$R/etc/tarninfo.conf" ] && fail "purge left /etc/tarninfo.conf"
[ -e "$R/usr/sbin/tarnaudiod" ] && fail "purge left the programs"
ok "reinstall keeps the configuration, purge removes it"
[ "$FAILS" = 0 ] && echo "debian_chroot: all passed" && exit 0
echo "debian_chroot: $FAILS failures"
exit 1
