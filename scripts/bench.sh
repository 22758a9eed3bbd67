#!/bin/bash
# bench.sh: runs all benchmarks. The micro-benchmarks print each figure with a baseline measured in the same run; compare
# two runs by the ratios to their baselines, not by times. Then the real programs: the start of wccpd by the number of
# groups, its memory by use, and how long the engine's lock is held while mgmtd is stopped.
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
printf '\n== start of wccpd and its memory, with groups of 32 routers\n'
bench/daemon_start.sh "$PWD/build/release/bin"
printf '\n== the lock of the engine while mgmtd is stopped\n'
bench/mgmtd_stopped.sh "$PWD/build/release/bin"
