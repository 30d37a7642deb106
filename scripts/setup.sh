#!/bin/sh
# Installs every Debian package the project needs to build, run and test.
# Safe to run again: apt-get skips what is already installed.
set -e
PKGS="build-essential cmake pkg-config git clang libclang-rt-14-dev
libgtest-dev libgmock-dev
libupnp-dev libjsoncpp-dev rapidjson-dev
libgstreamer1.0-dev libgstreamer-plugins-base1.0-dev gstreamer1.0-tools
gstreamer1.0-plugins-base gstreamer1.0-plugins-good gstreamer1.0-plugins-ugly
gstreamer1.0-libav gstreamer1.0-alsa
libtag1-dev libsqlite3-dev sqlite3 libcurl4-openssl-dev libcpp-httplib-dev libssl-dev
lame flac vorbis-tools sox iproute2 procps util-linux python3 curl
gmediarender rygel rygel-playbin minidlna mpd
chromium chromium-driver python3-selenium
systemd man-db bash-completion dpkg-dev fakeroot debootstrap"
if [ "$(id -u)" != "0" ]; then
    echo "setup.sh must run as root to install packages. Run:"
    echo "  sudo apt-get update && sudo apt-get install -y $(echo $PKGS)"
    exit 1
fi
missing=""
for p in $PKGS; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing="$missing $p"
done
if [ -z "$missing" ]; then
    echo "setup: all packages present"
    exit 0
fi
echo "setup: installing:$missing"
export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
apt-get install -y -qq --no-install-recommends $missing
# Packaged services must not start on their own: the tests start them in
# private network namespaces with their own configuration.
for s in minidlna mpd; do
    (systemctl disable --now "$s" 2>/dev/null || service "$s" stop 2>/dev/null) >/dev/null 2>&1 || true
done
echo "setup: done"
