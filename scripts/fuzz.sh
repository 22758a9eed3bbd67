#!/bin/bash
# fuzz.sh SECONDS [NAME...]: runs each fuzzer of fuzz/ (or those named) for so long, from its seeds in
# fuzz/corpus/NAME/. Seeds are hexadecimal text with comments after "#"; files of any other kind are taken as they
# are. What a run finds beyond them stays in build/fuzz/corpus/ for the next one, an input that fails in
# build/fuzz/failures/. Ends with 1 when one failed.
set -u
cd "$(dirname "$0")/.." || exit 1
[ $# -gt 0 ] || { echo "usage: fuzz.sh SECONDS [NAME...]" >&2; exit 2; }
seconds=$1; shift
mkdir -p build/fuzz/failures
names=("$@")
[ $# -gt 0 ] || for source in fuzz/*_fuzz.cpp; do names+=("$(basename "$source" .cpp)"); done
{ cmake --preset fuzz && cmake --build --preset fuzz -j "$(nproc)" --target "${names[@]}"; } >build/fuzz.log 2>&1 ||
    { tail -n 40 build/fuzz.log; exit 1; }
status=0
for name in "${names[@]}"; do
    seeds=build/fuzz/seeds/$name corpus=build/fuzz/corpus/$name
    rm -rf "$seeds"; mkdir -p "$seeds" "$corpus"
    for seed in fuzz/corpus/"$name"/*; do
        case $seed in
        *.hex) perl -ne 's/#.*//; s/\s+//g; print pack "H*", $_' "$seed" >"$seeds/$(basename "$seed" .hex)" ;;
        *) [ -f "$seed" ] && cp "$seed" "$seeds/" ;;
        esac
    done
    log=build/fuzz/$name.log
    if lab/in-appliance "build/fuzz/bin/$name" -max_total_time="$seconds" -max_len=9000 -timeout=10 \
        -print_final_stats=1 -artifact_prefix="build/fuzz/failures/$name-" "$corpus" "$seeds" >"$log" 2>&1; then
        printf '%s: %s inputs in %s s, %s seeds, nothing found; %s\n' "$name" \
            "$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")" "$seconds" "$(find "$seeds" -type f | wc -l)" \
            "$(grep -oE 'cov: [0-9]+ ft: [0-9]+' "$log" | tail -n 1)"
    else
        status=1
        printf '%s: FAILED\n' "$name"
        grep -vE '^#[0-9]+' "$log" | tail -n 40
    fi
done
exit $status
