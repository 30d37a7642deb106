#!/bin/sh
# Builds the Debian package dist/tarnaudiod_<version>_<arch>.deb with CPack:
# the install rules (packaging/CMakeLists.txt) without etc/tarninfo.conf,
# which the maintainer scripts make from the default only when missing;
# library dependencies computed by dpkg-shlibdeps.
#   scripts/package.sh            (build dir: TARN_BUILD_DIR, default build-package)
# Install it with: apt-get install ./dist/tarnaudiod_<version>_<arch>.deb
cd "$(dirname "$0")/.." || exit 1
case "$1" in
    -h|--help) sed -n '2,7p' "$0" | sed 's/^# \{0,1\}//'; exit 0 ;;
    "") ;;
    *) echo "package: unknown option $1 (see --help)" >&2; exit 2 ;;
esac
B=${TARN_BUILD_DIR:-build-package}
case "$B" in /*) ;; *) B=$(pwd)/$B ;; esac
for tool in dpkg-shlibdeps fakeroot; do
    command -v $tool > /dev/null || { echo "package: $tool is missing (scripts/setup.sh installs it)" >&2; exit 1; }
done
mkdir -p "$B" dist
cmake -S . -B "$B" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DCMAKE_INSTALL_PREFIX=/usr -DTARN_TESTS=OFF \
    > "$B/package-cmake.log" 2>&1 || { cat "$B/package-cmake.log"; echo "package: cmake failed"; exit 1; }
cmake --build "$B" -j"${TARN_JOBS:-2}" --target tarnaudiod tarnctl tarnlib tarnweb mplayer-daemon ||
    { echo "package: build failed"; exit 1; }
(cd "$B" && cpack -G DEB -D CPACK_STRIP_FILES=ON) > "$B/package-cpack.log" 2>&1 ||
    { cat "$B/package-cpack.log"; echo "package: cpack failed"; exit 1; }
DEB=$(sed -n 's/.*package: \(.*\.deb\) generated.*/\1/p' "$B/package-cpack.log" | tail -1)
[ -f "$DEB" ] || { cat "$B/package-cpack.log"; echo "package: no package made"; exit 1; }
echo "package: $DEB"
dpkg-deb --field "$DEB" Package Version Architecture Depends
