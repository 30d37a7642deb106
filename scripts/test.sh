#!/bin/sh
# Builds everything and runs every test, as CI does:
#   1. scripts/setup.sh (packages; when run as root)
#   2. build/       normal build, ctest --output-on-failure -j2
#   3. build-asan/  AddressSanitizer + UndefinedBehaviorSanitizer build, its ctest
#   4. build-tsan/  ThreadSanitizer build of the tests labelled "upnp" (when any)
#   5. a short fuzz run of each target in fuzz/ (when there are any)
#   6. bench/compare --quick (the side-by-side benchmark, about a minute)
# Every stage runs even when an earlier one failed; the summary at the end
# names the failed stages and the exit status is non-zero if any failed.
#   scripts/test.sh            everything
#   scripts/test.sh --quick    stage 1 and 2 only
#   scripts/test.sh --package  only the Debian package test (fetches Debian's
#                              packages from the mirror into a cached root)
cd "$(dirname "$0")/.." || exit 1
QUICK=0
[ "$1" = "--quick" ] && QUICK=1
if [ "$1" = "--package" ]; then
    cmake -S . -B build -DTARN_PACKAGE_TEST=ON > build.cmake.log 2>&1 || { cat build.cmake.log; exit 1; }
    cmake --build build -j"${TARN_JOBS:-2}" || exit 1
    cd build && exec ctest --output-on-failure -L package
fi
JOBS=${TARN_JOBS:-2}
failed=""

stage() { echo; echo "==== $* ===="; }

if [ "$(id -u)" = "0" ]; then
    stage "setup"
    scripts/setup.sh || { echo "test: package setup failed"; exit 1; }
else
    echo "test: not root, skipping package setup (scripts/setup.sh)"
fi

# build_and_test DIR LABEL CMAKE-ARGS...: configure, build, run ctest.
build_and_test() {
    dir=$1; shift
    name=$1; shift
    stage "$name: configure and build in $dir"
    if ! cmake -S . -B "$dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo "$@" > "$dir.cmake.log" 2>&1; then
        cat "$dir.cmake.log"; failed="$failed $name-configure"; return 1
    fi
    if ! cmake --build "$dir" -j"$JOBS"; then
        failed="$failed $name-build"; return 1
    fi
    stage "$name: ctest"
    (cd "$dir" && ctest --output-on-failure -j"$JOBS") || failed="$failed $name-ctest"
}

mkdir -p build
build_and_test build normal

if [ "$QUICK" = "0" ]; then
    mkdir -p build-asan
    # The daemon sends its standard streams to /dev/null: sanitizer reports
    # of every process go to files, which fail the stage when there are any.
    rm -f build-asan/sanitizer.*
    export ASAN_OPTIONS="${ASAN_OPTIONS:-detect_leaks=1}:log_path=$(pwd)/build-asan/sanitizer"
    export UBSAN_OPTIONS="${UBSAN_OPTIONS:-print_stacktrace=1}:log_path=$(pwd)/build-asan/sanitizer"
    # Leaks inside GLib/GStreamer, libav and libupnp are the libraries' own.
    export LSAN_OPTIONS="${LSAN_OPTIONS:-fast_unwind_on_malloc=0}:print_suppressions=0:suppressions=$(pwd)/scripts/lsan.supp"
    build_and_test build-asan asan -DTARN_SANITIZE=ON
    reports=$(grep -l -E "ERROR: |runtime error" build-asan/sanitizer.* 2>/dev/null)
    if [ -n "$reports" ]; then
        echo "asan: sanitizer reports:"
        for f in $reports; do echo "--- $f"; head -60 "$f"; done
        failed="$failed asan-reports"
    fi
    unset ASAN_OPTIONS UBSAN_OPTIONS LSAN_OPTIONS

    # ThreadSanitizer: only the tests labelled "upnp" (the code with threads).
    stage "tsan: tests labelled upnp"
    mkdir -p build-tsan
    if cmake -S . -B build-tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTARN_TSAN=ON > build-tsan.cmake.log 2>&1; then
        tests=$(cd build-tsan && ctest -N -L upnp | sed -n 's/^ *Test *#[0-9]*: *//p')
        if [ -z "$tests" ]; then
            echo "tsan: no tests labelled upnp"
        else
            targets=""
            for t in $tests; do targets="$targets ${t#*.}"; done
            if cmake --build build-tsan -j"$JOBS" --target tarnaudiod tarnweb mplayer-daemon $targets; then
                (cd build-tsan && TSAN_OPTIONS="${TSAN_OPTIONS:-halt_on_error=1} suppressions=$(pwd)/../scripts/tsan.supp" \
                    ctest --output-on-failure -j"$JOBS" -L upnp) || failed="$failed tsan-ctest"
            else
                failed="$failed tsan-build"
            fi
        fi
    else
        cat build-tsan.cmake.log; failed="$failed tsan-configure"
    fi

    stage "fuzz smoke"
    if ls fuzz/*.cpp > /dev/null 2>&1; then
        scripts/fuzz.sh 20 || failed="$failed fuzz"
    else
        echo "fuzz: no targets in fuzz/"
    fi
fi

if [ "$QUICK" = "0" ]; then
    # Keeps the side-by-side benchmark working; its figures are not judged.
    stage "benchmark smoke: bench/compare --quick"
    bench/compare --quick || failed="$failed bench-compare"
fi

echo
if [ -n "$failed" ]; then
    echo "test: FAILED:$failed"
    exit 1
fi
echo "test: all stages passed"
