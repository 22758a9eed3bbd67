#!/bin/bash
# bench.sh: the project's benchmarks in one run, each figure beside the floor that was measured with it; then the real
# programs: how the start grows with the number of groups, the daemon's memory by room, and how long the engine's lock
# is held while mgmtd is stopped. Figures of two runs are compared as ratios to their own floors, never as times.
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
printf '\n== the start of the daemon and its memory, with groups of 32 routers\n'
bench/daemon_start.sh "$PWD/build/release/bin"
printf '\n== the engine while mgmtd is stopped\n'
bench/mgmtd_stopped.sh "$PWD/build/release/bin"
