#!/bin/bash
# stress.sh [NAME...]: the tests with threads in their long form (a minute of sending, a thousand closings and so on),
# each under the address and under the thread sanitizer, all of them or those named. What fails keeps its log in
# build/stress/; ends with 1 when one did.
set -u
cd "$(dirname "$0")/.." || exit 1
mkdir -p build/stress
names=("$@")
[ $# -gt 0 ] || for source in tests/*_mt_test.cpp; do names+=("$(basename "$source" .cpp)"); done
status=0
for preset in asan tsan; do
    { cmake --preset $preset && cmake --build --preset $preset -j "$(nproc)" --target "${names[@]}"; } \
        >build/stress/$preset.log 2>&1 || { tail -n 40 build/stress/$preset.log; exit 1; }
    # The thread sanitizer wants its usual places in memory.
    run=(); [ $preset = asan ] || run=(setarch -R)
    for name in "${names[@]}"; do
        log=build/stress/$name.$preset.log start=$SECONDS
        if WCCP_STRESS=1 TSAN_OPTIONS="detect_deadlocks=1 second_deadlock_stack=1" \
            timeout 900 "${run[@]}" lab/in-appliance "build/$preset/bin/$name" >"$log" 2>&1; then
            echo "$name ($preset): passed in $((SECONDS - start)) s"
        else
            status=1
            echo "$name ($preset): FAILED, see $log"
            tail -n 20 "$log"
        fi
    done
done
exit $status
