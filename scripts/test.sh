#!/bin/bash
# test.sh: everything that a change has to pass, from a bare checkout on Debian 12: the format of the sources, their
# includes and what the documents quote, all tests under release and under the address and undefined-behaviour
# sanitizers, those with threads under the thread sanitizer, a build with clang, a short run of each fuzzer, the Debian
# package, and what needs Debian's own kernel in a virtual machine. Installs what is missing; leaves nothing but build/.
#   test.sh [STEP...]   only these steps, of: form release asan tsan clang tidy fuzz package vm
set -u
cd "$(dirname "$0")/.." || exit 1
scripts/install-deps.sh build lab test || exit 1
jobs=$(nproc)
steps=("$@"); [ $# -gt 0 ] || steps=(form release asan tsan clang fuzz package vm)
passed=0 failed=0
declare -a bad=() second=()

note() { printf '\n== %s\n' "$*"; }
result() { # NAME STATUS
    if [ "$2" = 0 ]; then passed=$((passed + 1)); else failed=$((failed + 1)); bad+=("$1"); fi
}
sources() { git ls-files -co --exclude-standard '*.cpp' '*.h'; }
build() { # PRESET [TARGET...]
    cmake --preset "$1" >"build/$1.log" 2>&1 &&
        cmake --build --preset "$1" -j "$jobs" ${2:+--target "${@:2}"} >>"build/$1.log" 2>&1 ||
        { tail -n 40 "build/$1.log"; return 1; }
}
run_ctest() { # PRESET ARGUMENTS...
    # A test that fails is run once more: some hold real programs to their seconds, on a machine that may be busy. The
    # summary names those that needed it.
    local preset=$1 out; shift
    out=build/$preset/ctest.log
    ctest --test-dir "build/$preset" -j $((jobs * 2)) --output-on-failure --no-tests=error --repeat until-pass:2 "$@" >"$out" 2>&1
    local status=$?
    if [ $status -ne 0 ]; then grep -vE '^ *[0-9]+/[0-9]+ Test .* Passed|^ *Start ' "$out" | tail -n 150; fi
    local name
    for name in $(sed -n 's/^ *[0-9]*\/[0-9]* Test *#[0-9]*: \([a-z0-9_]*\) .*\*\*\*.*/\1/p' "$out" | sort -u); do
        grep -qE "Test +#[0-9]+: $name [. ]+Passed" "$out" && second+=("$name ($preset)")
    done
    local total fails
    total=$(sed -n 's/^.*tests passed, \([0-9]*\) tests failed out of \([0-9]*\).*/\2/p' "$out" | tail -n 1)
    fails=$(sed -n 's/^.*tests passed, \([0-9]*\) tests failed out of \([0-9]*\).*/\1/p' "$out" | tail -n 1)
    passed=$((passed + ${total:-0} - ${fails:-0})); failed=$((failed + ${fails:-0}))
    if [ $status -ne 0 ]; then bad+=("tests under $preset"); [ "${fails:-0}" -gt 0 ] || failed=$((failed + 1)); fi
}
run_package() {
    scripts/install-deps.sh package >build/package.log 2>&1 || { tail -n 3 build/package.log; result "tools for the package" 1; return; }
    build release wccp_router fast_clock || { result "build for the package" 1; return; }
    tests/scenario_package.sh
    local status=$?
    [ $status = 77 ] || result "package" $status
}
run_vm() {
    if ! scripts/install-deps.sh vm >build/vm.log 2>&1; then
        tail -n 3 build/vm.log
        echo 'skipped: qemu cannot be installed here'
        return
    fi
    build release wccpd mgmtd mgmtctl tunneld wccp_router fast_clock || { result "build for the virtual machine" 1; return; }
    lab/vm.sh | tee build/vm.log
    local status=${PIPESTATUS[0]} fails
    fails=$(grep -c '^FAILED ' build/vm.log)
    passed=$((passed + $(grep -c '^ok ' build/vm.log))); failed=$((failed + fails))
    if [ "$status" -ne 0 ]; then bad+=("virtual machine"); [ "$fails" -gt 0 ] || failed=$((failed + 1)); fi
}

mkdir -p build
for step in "${steps[@]}"; do
    began=$SECONDS
    note "$step"
    case $step in
    form)
        sources | xargs clang-format-14 --dry-run --Werror; result "format of the sources" $?
        scripts/check-includes.sh; result "includes" $?
        scripts/check-docs.sh; result "documents" $? ;;
    release | asan) if build "$step"; then run_ctest "$step"; else result "build of $step" 1; fi ;;
    tsan) if build tsan threaded_tests; then run_ctest tsan -L threads; else result "build of tsan" 1; fi ;;
    clang) build clang; result "build with clang" $? ;;
    # One file for each run: the analyser's look at va_lists takes what it saw in one file over to the next.
    tidy) cmake --preset clang >/dev/null && sources | grep '\.cpp$' | grep -vE '^(tests|bench|fuzz)/' |
        xargs -P "$jobs" -n 1 clang-tidy-14 --quiet -p build/clang; result "clang-tidy" $? ;;
    fuzz) scripts/fuzz.sh 15; result "fuzzing" $? ;;
    package) run_package ;;
    vm) run_vm ;;
    *) echo "test.sh: no step $step" >&2; exit 2 ;;
    esac
    printf '%s: %d s\n' "$step" $((SECONDS - began))
done
[ ${#second[@]} = 0 ] || printf 'passed only at its second run: %s\n' "${second[@]}"
[ ${#bad[@]} = 0 ] || printf 'failed: %s\n' "${bad[@]}"
printf '\n%d passed, %d failed\n' "$passed" "$failed"
[ "$failed" = 0 ]
