#!/bin/bash
# The lab itself: its clock, and that it leaves no process when it is interrupted, at any moment and by any signal, also
# if an ordinary user runs it (where the kernel allows that).
#   scenario_lab_ends.sh DIRECTORY_OF_THE_PROGRAMS
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
export LAB_MARK=lab-$$-$RANDOM
failed=0

as=()
# The command that the lab runs until it is interrupted.
command='source "$LAB_HOME/topology.sh"; eval "${nodes//declare/declare -g}"
    lab_appliance_start a1 "$(lab_group 51 10.0.0.1)"; sleep 60'
list_lab_processes() {
    grep -lzx "LAB_OF_TEST=$LAB_MARK" /proc/[0-9]*/environ 2>/dev/null | cut -d/ -f3
}
interrupt_lab() { # SIGNAL SECONDS
    "${as[@]}" setsid env --default-signal=INT LAB_OF_TEST="$LAB_MARK" \
        "$top/lab/topology.sh" --routers 1 --appliances 1 bash -c "$command" </dev/null >/dev/null 2>&1 &
    local shell=$!
    # Bash starts background processes with SIGINT ignored, until env changes that.
    while (( 0x$(awk '/^SigIgn/ { print $2 }' /proc/$shell/status) & 2 )); do sleep 0.01; done
    sleep "$2"
    local target=$shell
    [ "$1" != INT ] || target=-$shell # like ^C, which goes to the whole process group
    kill -s "$1" -- $target
    wait $shell 2>/dev/null
    local i
    for i in $(seq 50); do
        [ -n "$(list_lab_processes)" ] || return
        sleep 0.1
    done
    echo "left after SIG$1 at $2 s:" >&2
    # shellcheck disable=SC2046
    ps -o pid,args -p $(list_lab_processes | paste -sd,) >&2
    # shellcheck disable=SC2046
    kill -KILL $(list_lab_processes)
    failed=1
}
# The lab exits with the status of its command.
out=$(LAB_OF_TEST=$LAB_MARK "$top/lab/topology.sh" --routers 2 --appliances 2 \
    bash -c '"$WCCP_BIN/wccp_router" ctl "$LAB/r2.ctl" show; exit 7') && status=0 || status=$?
[ "$status" = 7 ] && [[ $out = *'"router":"10.0.0.2"'* ]] || { echo "status $status, output: $out" >&2; failed=1; }
[ -z "$(list_lab_processes)" ] || { echo "a lab that exited left processes" >&2; failed=1; }

# The faster clock shortens a sleep, unless it is very short.
fast=(env "LD_PRELOAD=$(dirname "$WCCP_BIN")/lib/libfast_clock.so" FAST_CLOCK=10)
measure_ms() { # COMMAND...
    local began=${EPOCHREALTIME/[.,]/}
    "$@"
    echo $(((${EPOCHREALTIME/[.,]/} - began) / 1000))
}
long=$(measure_ms "${fast[@]}" sleep 5) short=$(measure_ms "${fast[@]}" sleep 0.019)
[ "$long" -ge 500 ] && [ "$long" -lt 3000 ] && [ "$short" -ge 19 ] || { echo "5 s took $long ms, 19 ms $short" >&2; failed=1; }

for signal in KILL TERM INT; do
    for moment in 0.03 0.1 0.2 0.35 0.6 1.5; do interrupt_lab $signal $moment; done
done
if [ "$(id -u)" = 0 ]; then
    as=(setpriv --reuid 65534 --regid 65534 --clear-groups)
    if "${as[@]}" unshare --user --map-root-user true 2>/dev/null && "${as[@]}" test -x "$WCCP_BIN/wccp_router"; then
        out=$("${as[@]}" "$top/lab/topology.sh" --routers 1 --appliances 1 \
            bash -c '"$WCCP_BIN/wccp_router" ctl "$LAB/r1.ctl" show' 2>&1)
        [[ $out = *'"router":"10.0.0.1"'* ]] || { echo "as an ordinary user: $out" >&2; failed=1; }
        interrupt_lab KILL 0.5
        interrupt_lab TERM 0.5
    else
        echo "not tested as an ordinary user: no user namespaces, or no access to the programs"
    fi
fi
exit $failed
