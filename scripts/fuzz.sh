#!/bin/sh
# Builds the fuzz targets with clang (libFuzzer, AddressSanitizer,
# UndefinedBehaviorSanitizer) and runs each one for a bounded time.
#   scripts/fuzz.sh            about 20 s per target (the CI smoke run)
#   scripts/fuzz.sh 600        ten minutes per target
#   scripts/fuzz.sh 600 NAME   one target only
# New inputs found are kept in build-fuzz/corpus/<name>/; crashes are written
# to build-fuzz/artifacts/ and make the script fail.
set -e
SECS=${1:-20}
ONLY=$2
cd "$(dirname "$0")/.."
ROOT=$(pwd)
if [ -z "$(ls fuzz/*.cpp 2>/dev/null)" ]; then echo "fuzz: no targets"; exit 0; fi
CC=clang CXX=clang++ cmake -S . -B build-fuzz -DTARN_FUZZ=ON -DTARN_TESTS=OFF -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build build-fuzz -j2 >/dev/null
mkdir -p build-fuzz/artifacts
status=0
for src in fuzz/*.cpp; do
    name=$(basename "$src" .cpp)
    [ -n "$ONLY" ] && [ "$ONLY" != "$name" ] && continue
    mkdir -p "build-fuzz/corpus/$name"
    seeds="fuzz/corpus/$name"
    [ -d "$seeds" ] || seeds=""
    echo "fuzz: $name for ${SECS}s"
    # The targets run inside a private network namespace like every test.
    if ! scripts/netns-run "build-fuzz/bin/fuzz_$name" -max_total_time="$SECS" -timeout=10 -rss_limit_mb=2048 \
        -artifact_prefix="build-fuzz/artifacts/$name-" -print_final_stats=1 \
        "build-fuzz/corpus/$name" $seeds > "build-fuzz/$name.log" 2>&1; then
        echo "fuzz: $name FAILED, see build-fuzz/$name.log and build-fuzz/artifacts/"
        tail -30 "build-fuzz/$name.log"
        status=1
    else
        grep -E "^stat::number_of_executed_units|^#[0-9]+.*DONE" "build-fuzz/$name.log" | tail -1
    fi
done
exit $status
