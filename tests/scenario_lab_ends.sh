#!/bin/bash
# The lab itself: its clock, and its end. A lab that is interrupted, at whatever moment and by whatever signal, leaves
# no process behind; as an ordinary user as well, where the kernel allows that.
#   scenario_lab_ends.sh DIRECTORY_OF_THE_PROGRAMS
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
export LAB_MARK=lab-$$-$RANDOM
failed=0

as=()
# What the lab runs: the programs of its appliance, until it is interrupted.
whole='source "$LAB_HOME/topology.sh"; eval "${nodes//declare/declare -g}"
    lab_appliance_start a1 "$(lab_group 51 10.0.0.1)"; sleep 60'
marked() { # the processes of our labs
    grep -lzx "LAB_OF_TEST=$LAB_MARK" /proc/[0-9]*/environ 2>/dev/null | cut -d/ -f3
}
interrupt() { # SIGNAL SECONDS
    "${as[@]}" setsid env --default-signal=INT LAB_OF_TEST="$LAB_MARK" \
        "$top/lab/topology.sh" --routers 1 --appliances 1 bash -c "$whole" </dev/null >/dev/null 2>&1 &
    local shell=$!
    # Bash starts it with SIGINT ignored; the moment counts from where env has changed that.
    while (( 0x$(awk '/^SigIgn/ { print $2 }' /proc/$shell/status) & 2 )); do sleep 0.01; done
    sleep "$2"
    local whom=$shell
    [ "$1" != INT ] || whom=-$shell # a terminal's ^C reaches all of its processes; a shell alone would wait for its child
    kill -s "$1" -- $whom
    wait $shell 2>/dev/null
    local i
    for i in $(seq 50); do
        [ -n "$(marked)" ] || return
        sleep 0.1
    done
    echo "after SIG$1 at $2 s these are left:" >&2
    # shellcheck disable=SC2046
    ps -o pid,args -p $(marked | paste -sd,) >&2
    # shellcheck disable=SC2046
    kill -KILL $(marked)
    failed=1
}
round() {
    local signal moment
    for signal in KILL TERM INT; do
        for moment in 0.03 0.1 0.2 0.35 0.6 1.5; do interrupt $signal $moment; done
    done
}

# One that ends by itself has the status of its command, and has shown that the lab works.
out=$(LAB_OF_TEST=$LAB_MARK "$top/lab/topology.sh" --routers 2 --appliances 2 \
    bash -c '"$WCCP_BIN/wccp_router" ctl "$LAB/r2.ctl" show; exit 7') && status=0 || status=$?
[ "$status" = 7 ] && [[ $out = *'"router":"10.0.0.2"'* ]] || { echo "status $status, output: $out" >&2; failed=1; }
[ -z "$(marked)" ] || { echo "a lab that ended leaves processes" >&2; failed=1; }

# The faster clock: a sleep takes its part of the time, unless it is too short to be about a protocol.
fast=(env "LD_PRELOAD=$(dirname "$WCCP_BIN")/lib/libfast_clock.so" FAST_CLOCK=10)
took() { # milliseconds
    local began=${EPOCHREALTIME/[.,]/}
    "$@"
    echo $(((${EPOCHREALTIME/[.,]/} - began) / 1000))
}
long=$(took "${fast[@]}" sleep 5) short=$(took "${fast[@]}" sleep 0.019)
[ "$long" -ge 500 ] && [ "$long" -lt 3000 ] && [ "$short" -ge 19 ] || { echo "5 s took $long ms, 19 ms $short" >&2; failed=1; }

round
if [ "$(id -u)" = 0 ]; then
    as=(setpriv --reuid 65534 --regid 65534 --clear-groups)
    if "${as[@]}" unshare --user --map-root-user true 2>/dev/null && "${as[@]}" test -x "$WCCP_BIN/wccp_router"; then
        out=$("${as[@]}" "$top/lab/topology.sh" --routers 1 --appliances 1 \
            bash -c '"$WCCP_BIN/wccp_router" ctl "$LAB/r1.ctl" show' 2>&1)
        [[ $out = *'"router":"10.0.0.1"'* ]] || { echo "as an ordinary user: $out" >&2; failed=1; }
        interrupt KILL 0.5
        interrupt TERM 0.5
    else
        echo "not tried as an ordinary user: no user namespaces, or the programs can't be reached"
    fi
fi
exit $failed
