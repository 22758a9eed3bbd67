#!/bin/bash
# stress.sh [NAME...]: runs the tests with threads in their long form, each with the address and with the thread sanitizer,
# and scenario_daemon, which then kills mgmtd a hundred times, with the address sanitizer. NAME: only these. Logs are in
# build/stress/. Exits with 1 if a test fails.
set -u
cd "$(dirname "$0")/.." || exit 1
mkdir -p build/stress
names=("$@")
[ $# -gt 0 ] || for source in tests/*_mt_test.cpp tests/scenario_daemon.sh; do
    source=${source##*/}; names+=("${source%.*}")
done
status=0

run_stressed() { # NAME PRESET COMMAND...
    local name=$1 preset=$2 start=$SECONDS
    local log=build/stress/$name.$preset.log; shift 2
    if WCCP_STRESS=1 TSAN_OPTIONS="detect_deadlocks=1 second_deadlock_stack=1" timeout 900 "$@" >"$log" 2>&1; then
        echo "$name ($preset): passed in $((SECONDS - start)) s"
    else
        status=1
        echo "$name ($preset): FAILED, see $log"
        tail -n 20 "$log"
    fi
}

for preset in asan tsan; do
    targets=() scenarios=()
    for name in "${names[@]}"; do
        case $name in
        scenario_*) [ $preset = tsan ] || scenarios+=("$name") ;;
        *) targets+=("$name") ;;
        esac
    done
    [ ${#scenarios[@]} = 0 ] || targets+=(wccpd mgmtd mgmtctl tunneld wccp_router fast_clock)
    [ ${#targets[@]} -gt 0 ] || continue
    { cmake --preset $preset && cmake --build --preset $preset -j "$(nproc)" --target "${targets[@]}"; } \
        >build/stress/$preset.log 2>&1 || { tail -n 40 build/stress/$preset.log; exit 1; }
    # The thread sanitizer does not work with every address space layout.
    with=(); [ $preset = asan ] || with=(setarch -R)
    for name in "${targets[@]}"; do
        [[ $name != *_test ]] || run_stressed "$name" $preset "${with[@]}" lab/in-appliance "build/$preset/bin/$name"
    done
    for name in "${scenarios[@]}"; do run_stressed "$name" $preset "tests/$name.sh" "$PWD/build/$preset/bin"; done
done
exit $status
