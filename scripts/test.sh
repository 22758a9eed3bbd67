#!/bin/bash
# test.sh: everything that a change has to pass, from a bare checkout on Debian 12. Installs the packages it needs and
# writes only below build/.
#   test.sh [STEP...]   only these steps, of: form release asan tsan tidy tidy-all fuzz package vm
#
#   form      format of the sources, includes between rooms, quotations in the documents
#   release   GCC: all tests and scenarios
#   asan      clang with the address and undefined-behaviour sanitizers: all tests and scenarios; builds the fuzzers
#   tsan      clang with the thread sanitizer: the tests that have threads
#   tidy      clang-tidy on the files that have changed (tidy-all, not part of a full run: on all files)
#   fuzz      a short run of each fuzzer
#   package   the Debian package on a system of its own
#   vm        cases that need Debian's own kernel, in a virtual machine
set -u
cd "$(dirname "$0")/.." || exit 1
scripts/install-deps.sh build lab test || exit 1
scripts/install-deps.sh metrics || echo 'skipped: prometheus cannot be downloaded here, and its checks are left out'
jobs=$(nproc)
export LAB_PATIENCE=${LAB_PATIENCE:-3} # the machine may be slow, and the tests share it
steps=("$@"); [ $# -gt 0 ] || steps=(form release asan tsan tidy fuzz package vm)
passed=0 failed=0
declare -a failures=() passed_at_second_run=()
aside='' # process that runs the steps package and vm at the same time as others

count_result() { # NAME STATUS
    if [ "$2" = 0 ]; then passed=$((passed + 1)); else failed=$((failed + 1)); failures+=("$1"); fi
}
list_sources() { git ls-files -co --exclude-standard '*.cpp' '*.h'; }
build_preset() { # PRESET [TARGET...]
    cmake --preset "$1" >"build/$1.log" 2>&1 &&
        cmake --build --preset "$1" -j "$jobs" ${2:+--target "${@:2}"} >>"build/$1.log" 2>&1 ||
        { tail -n 40 "build/$1.log"; return 1; }
}

# A test that fails is run once more, since scenarios hold real programs to their seconds on a machine that may be busy.
run_ctest() { # PRESET ARGUMENTS...
    local preset=$1 log=build/$1/ctest.log status name total fails; shift
    ctest --test-dir "build/$preset" -j $((jobs * 3)) --output-on-failure --no-tests=error --repeat until-pass:2 "$@" >"$log" 2>&1
    status=$?
    if [ $status -ne 0 ]; then grep -vE '^ *[0-9]+/[0-9]+ Test .* Passed|^ *Start ' "$log" | tail -n 150; fi
    for name in $(sed -n 's/^ *[0-9]*\/[0-9]* Test *#[0-9]*: \([a-z0-9_]*\) .*\*\*\*.*/\1/p' "$log" | sort -u); do
        grep -qE "Test +#[0-9]+: $name [. ]+Passed" "$log" && passed_at_second_run+=("$name ($preset)")
    done
    total=$(sed -n 's/^.*tests passed, \([0-9]*\) tests failed out of \([0-9]*\).*/\2/p' "$log" | tail -n 1)
    fails=$(sed -n 's/^.*tests passed, \([0-9]*\) tests failed out of \([0-9]*\).*/\1/p' "$log" | tail -n 1)
    passed=$((passed + ${total:-0} - ${fails:-0})); failed=$((failed + ${fails:-0}))
    if [ $status -ne 0 ]; then failures+=("tests under $preset"); [ "${fails:-0}" -gt 0 ] || failed=$((failed + 1)); fi
}

# The commit to compare with: where this branch left the main branch. On the main branch itself, and in a clone that has
# no other, ten commits back, or as many as the clone has.
find_base() {
    local branch base
    for branch in origin/main main; do
        base=$(git merge-base HEAD $branch 2>/dev/null) && [ "$base" != "$(git rev-parse HEAD)" ] && { echo "$base"; return; }
    done
    git rev-list --first-parent -n 11 HEAD | tail -n 1
}
list_tidy_sources() { # changed|all
    { if [ "$1" = all ]; then list_sources; else
        git diff --name-only HEAD; git log --format= --name-only "$(find_base)..HEAD"
    fi; } | sed -n 's/\.h$/.cpp/; /\.cpp$/p' | grep -vE '^(tests|bench|fuzz)/' | awk '!seen[$0]++' |
        while read -r file; do [ ! -e "$file" ] || echo "$file"; done
}
# Files are analysed one at a time: clang-tidy 14 carries its state of va_lists over from one file to the next.
run_tidy() { # reads the names of the files
    cmake --preset asan -B build/tidy -DWCCP_PRECOMPILE=OFF -DWCCP_UNITY=OFF >build/tidy.log 2>&1 || { tail -n 20 build/tidy.log; return 1; }
    xargs -r -P "$jobs" -n 1 clang-tidy-14 --quiet -p build/tidy
}
run_package() {
    scripts/install-deps.sh package >build/package.log 2>&1 || { tail -n 3 build/package.log; count_result "tools for the package" 1; return; }
    build_preset release wccp_router fast_clock || { count_result "build for the package" 1; return; }
    tests/scenario_package.sh
    local status=$?
    [ $status = 77 ] || count_result "package" $status
}
run_vm() {
    if ! scripts/install-deps.sh vm >build/vm.log 2>&1; then
        tail -n 3 build/vm.log
        echo 'skipped: qemu cannot be installed here'
        return
    fi
    build_preset release wccpd mgmtd mgmtctl tunneld wccp_router fast_clock || { count_result "build for the virtual machine" 1; return; }
    lab/vm.sh | tee build/vm.log
    local status=${PIPESTATUS[0]} fails
    fails=$(grep -c '^FAILED ' build/vm.log)
    passed=$((passed + $(grep -c '^ok ' build/vm.log))); failed=$((failed + fails))
    if [ "$status" -ne 0 ]; then failures+=("virtual machine"); [ "$fails" -gt 0 ] || failed=$((failed + 1)); fi
}
# The package and the virtual machine wait more than they work: another run of this script does them meanwhile. Its result
# is counted here when it has ended.
start_aside() {
    [[ " ${steps[*]} " == *' tsan '*' package vm '* ]] || return 0
    "$0" package vm >build/aside.log 2>&1 &
    aside=$!
    trap 'kill "$aside" 2>/dev/null' EXIT
}
finish_aside() {
    local passes fails
    wait "$aside"
    grep -vE '^(failed: .*|[0-9]+ passed, .*|)$' build/aside.log
    read -r passes _ fails _ < <(tail -n 1 build/aside.log)
    if [[ $passes$fails =~ ^[0-9]+$ ]]; then
        passed=$((passed + passes)); failed=$((failed + fails))
    else
        failed=$((failed + 1))
    fi
    mapfile -t -O ${#failures[@]} failures < <(sed -n 's/^failed: //p' build/aside.log)
}

mkdir -p build
for step in "${steps[@]}"; do
    began=$SECONDS
    case $step in
    tsan) start_aside ;;
    package | vm) [ -z "$aside" ] || continue ;;
    esac
    printf '\n== %s\n' "$step"
    case $step in
    form)
        list_sources | xargs clang-format-14 --dry-run --Werror; count_result "format of the sources" $?
        scripts/check-includes.sh; count_result "includes" $?
        scripts/check-docs.sh; count_result "documents" $? ;;
    release | asan)
        scripts/install-deps.sh browser >build/browser.log 2>&1 || echo 'chromium cannot be installed here: no browser opens the page'
        if build_preset "$step"; then run_ctest "$step"; else count_result "build of $step" 1; fi ;;
    tsan) if build_preset tsan threaded_tests; then run_ctest tsan -L threads; else count_result "build of tsan" 1; fi ;;
    tidy) list_tidy_sources changed | head -n 25 | run_tidy; count_result "clang-tidy" $? ;;
    tidy-all) list_tidy_sources all | run_tidy; count_result "clang-tidy" $? ;;
    fuzz) scripts/fuzz.sh 15; count_result "fuzzing" $? ;;
    package) run_package ;;
    vm) run_vm ;;
    *) echo "test.sh: no step $step" >&2; exit 2 ;;
    esac
    printf '%s: %d s\n' "$step" $((SECONDS - began))
done
[ -z "$aside" ] || finish_aside
[ ${#passed_at_second_run[@]} = 0 ] || printf 'passed only at its second run: %s\n' "${passed_at_second_run[@]}"
[ ${#failures[@]} = 0 ] || printf 'failed: %s\n' "${failures[@]}"
printf '\n%d passed, %d failed\n' "$passed" "$failed"
[ "$failed" = 0 ]
