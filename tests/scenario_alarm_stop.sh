#!/bin/bash
# mgmtd is stopped (SIGSTOP) while the router of 200 groups flaps: alarms and role changes fill the socket and then the
# queue, which is logged once. Another router still gets Here-I-Am every 10 seconds. SIGTERM ends wccpd within 3 seconds,
# and mgmtd continues normally after SIGCONT.
#   scenario_alarm_stop.sh DIRECTORY_OF_THE_PROGRAMS [SECONDS]
# With SECONDS it does not fill the queue, but runs bench/wccpd_timed, for half of that time with mgmtd running and for
# half with it stopped, and prints how long the engine's lock was held.
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
# With a sanitizer, on a busy machine, wccpd can't serve 200 groups at twenty times the speed.
if ! grep -q __asan_init "$WCCP_BIN/wccpd"; then : "${LAB_SPEED:=20}"; else : "${LAB_SPEED:=10}"; fi
export LAB_SPEED LAB_LOG_LEVEL=notice
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"
measured=${2-}

fail() { echo "$*" >&2; tail -n 15 "$LAB"/a1.log "$LAB"/a1-*.out >&2; exit 1; }
list_hello_times() { jq -c 'select(.what == "here-i-am" and .service == 255) | .t' "$LAB/r2.log"; }
# The router's tables name no appliance, and then do again: two role changes of each group, and sometimes an alarm. wccpd
# answers a query three times at once, and the router answers each of them, so that the flap does not wait for a period of
# the protocol.
flap() {
    local map
    for map in nobodys-map none; do
        lab_ctl r1 fault $map always >/dev/null
        lab_ctl r1 query 10.0.0.101 >/dev/null
        lab_sleep 3
    done
}

lab_router r1 10.0.0.1
lab_router r2 10.0.0.2
lab_appliance a1 10.0.0.101
groups=("$(lab_group 255 10.0.0.2)")
for id in $(seq 51 250); do groups+=("$(lab_group $id 10.0.0.1 priority=$id)"); done
lab_write_config a1 "${groups[@]}"
lab_mgmtd_start a1
lab_tunneld_start a1
lab_start a1 wccpd "wccpd${measured:+_timed}"
lab_wait_role 30 a1 255 ACTIVE && lab_wait_role 30 a1 250 ACTIVE || fail "the groups did not become active"

mgmtd=$(lab_pid a1 mgmtd)
if [ -n "$measured" ]; then
    for state in CONT STOP; do
        # shellcheck disable=SC2086
        kill -$state $mgmtd
        lines=$(wc -l <"$LAB/a1-wccpd.out") began=$SECONDS
        while [ $((SECONDS - began)) -lt $((measured / 2)) ]; do flap; done
        tail -n +$((lines + 2)) "$LAB/a1-wccpd.out" >"$LAB/$state"
    done
    for state in CONT STOP; do
        awk -v state=$state '/ holds / { holds += $3; all += $3 * $5; max = $7 > max ? $7 : max; cpu = $9 > cpu ? $9 : cpu }
            END { printf "%s %d %.1f %d %d\n", state, holds, all / holds, max, cpu }' "$LAB/$state"
    done | awk '
        { holds[$1] = $2; mean[$1] = $3; max[$1] = $4; cpu[$1] = $5 }
        END {
            printf "%-16s %10s %10s %10s %14s\n", "engine lock", "holds", "mean, us", "max, us", "max cpu, us"
            form = "%-16s %10d %10.1f %10d %14d\n"
            printf form, "mgmtd runs", holds["CONT"], mean["CONT"], max["CONT"], cpu["CONT"]
            printf form, "mgmtd stopped", holds["STOP"], mean["STOP"], max["STOP"], cpu["STOP"]
            printf "%-16s %10s %10.2f %10.2f %14.2f\n", "ratio", "", mean["STOP"] / mean["CONT"], max["STOP"] / max["CONT"], cpu["STOP"] / cpu["CONT"]
        }'
else
    # shellcheck disable=SC2086
    kill -STOP $mgmtd
    for _ in $(seq 200); do
        flap
        grep -q 'output queue is full' "$LAB/a1.log" && break
    done
    flap
    [ "$(grep -c 'output queue is full ([0-9]* bytes): peer [^ ]* is not reading, frames are dropped' "$LAB/a1.log")" = 1 ] ||
        fail "a full queue was not logged exactly once"
    # The tolerance is for a busy machine: a wccpd that waits for mgmtd would send nothing at all.
    list_hello_times | jq -es '[.[1:], .[:-1]] | transpose | map(.[0] - .[1]) | length > 25 and max < 60 and
        (sort | .[length / 10 | floor] > 9 and .[length * 9 / 10 | floor] < 11.5)' >/dev/null ||
        fail "Here-I-Am does not come every 10 seconds: $(list_hello_times | tr '\n' ' ')"
    lab_wait 5 '.groups["255"] | .assignment.kind != "none" and .appliances[0].address == "10.0.0.101"' lab_ctl r2 show ||
        fail "the steady router has lost the appliance"
fi

began=${EPOCHREALTIME/./}
# shellcheck disable=SC2046
kill -TERM $(lab_pid a1 wccpd)
lab_wait_exit 3 a1 wccpd || fail "after SIGTERM wccpd exited with $?"
[ $((${EPOCHREALTIME/./} - began)) -lt 3000000 ] || fail "the shutdown took too long"
[[ $(tail -n 3 "$LAB/a1.log") = *"WCCP: wccp manager is exiting"*"WCCP daemon exiting with code 0"* ]] || fail "no orderly shutdown"
# shellcheck disable=SC2086
kill -CONT $mgmtd "${LAB_PID[a1/mgmtd]}"
lab_wait_event 10 a1 '^session of wccpd-[0-9]* closed' || fail "mgmtd did not continue"
lab_stop a1 mgmtd || fail "mgmtd exited with $?"
exit 0
