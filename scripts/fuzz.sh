#!/bin/bash
# fuzz.sh SECONDS [NAME...]: runs the fuzzers of fuzz/, or those that are named, for that long each, as many at a time
# as there are processors. Exits with 1 if one of them found something.
#
# Seeds are in fuzz/corpus/NAME/: *.hex is hexadecimal text with comments after "#", other files are used as they are.
# Inputs that reach new code are kept in build/fuzz/corpus/ for the next run, inputs that fail in build/fuzz/failures/.
set -u
cd "$(dirname "$0")/.." || exit 1
[ $# -gt 0 ] || { echo "usage: fuzz.sh SECONDS [NAME...]" >&2; exit 2; }
seconds=$1; shift
mkdir -p build/fuzz/failures
names=("$@")
[ $# -gt 0 ] || for source in fuzz/*_fuzz.cpp; do names+=("$(basename "$source" .cpp)"); done
{ cmake --preset asan && cmake --build --preset asan -j "$(nproc)" --target "${names[@]}"; } >build/fuzz.log 2>&1 ||
    { tail -n 40 build/fuzz.log; exit 1; }

unpack_seeds() { # NAME DIRECTORY
    local seed
    rm -rf "$2"; mkdir -p "$2"
    for seed in fuzz/corpus/"$1"/*; do
        case $seed in
        *.hex) perl -ne 's/#.*//; s/\s+//g; print pack "H*", $_' "$seed" >"$2/$(basename "$seed" .hex)" ;;
        *) [ -f "$seed" ] && cp "$seed" "$2/" ;;
        esac
    done
}
run_fuzzer() { # NAME
    local name=$1 seeds=build/fuzz/seeds/$1 corpus=build/fuzz/corpus/$1 log=build/fuzz/$1.log
    unpack_seeds "$name" "$seeds"
    mkdir -p "$corpus"
    if lab/in-appliance "build/asan/bin/$name" -max_total_time="$seconds" -max_len=9000 -timeout=10 \
        -print_final_stats=1 -artifact_prefix="build/fuzz/failures/$name-" "$corpus" "$seeds" >"$log" 2>&1; then
        printf '%s: %s inputs in %s s, %s seeds, nothing found; %s\n' "$name" \
            "$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")" "$seconds" "$(find "$seeds" -type f | wc -l)" \
            "$(grep -oE 'cov: [0-9]+ ft: [0-9]+' "$log" | tail -n 1)"
    else
        printf '%s: FAILED\n' "$name"
        grep -vE '^#[0-9]+' "$log" | tail -n 40
        return 1
    fi
}

status=0 running=0
for name in "${names[@]}"; do
    if [ $running -ge "$(nproc)" ]; then wait -n || status=1; running=$((running - 1)); fi
    run_fuzzer "$name" &
    running=$((running + 1))
done
while [ $running -gt 0 ]; do wait -n || status=1; running=$((running - 1)); done
exit $status
