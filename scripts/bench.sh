#!/bin/bash
# bench.sh: the project's benchmarks in one run, each figure beside the floor that was measured with it, and the
# daemon's memory by room. Figures of two runs are compared as ratios to their own floors, never as times.
set -eu
cd "$(dirname "$0")/.."
scripts/install-deps.sh build lab test
mkdir -p build
cmake --preset release >build/release.log 2>&1
cmake --build --preset release >>build/release.log 2>&1 || { tail -n 30 build/release.log; exit 1; }
for program in build/release/bin/*_bench; do
    printf '\n== %s\n' "${program##*/}"
    lab/in-appliance "$program" --benchmark_min_time="${MIN_TIME:-0.2}" 2>/dev/null
done
printf '\n== memory of wccpd with nobody to talk to\n'
lab/in-appliance bash -c '
    bin=$1; "$bin/wccpd" & daemon=$!
    sleep 9.5; scripts/memory.sh $daemon; kill -TERM $daemon; wait $daemon' _ "$PWD/build/release/bin"
