#!/bin/bash
# tunneld is absent, slow, refuses, does not answer, hangs or dies. Groups report the tunnels that they lack, the others
# keep working, and wccpd shuts down in time.
#   scenario_tunneld.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
set -u
: "${LAB_SPEED:=4}" # wccpd waits for tunneld in real seconds
export LAB_SPEED
# shellcheck source=../lab/cases.sh
source "$(dirname "$0")/../lab/cases.sh"
lab_cases "$@"

start_group() { # TUNNELD : options of tunneld, or none
    lab_router r1 10.0.0.1 -- --forward gre --return gre
    LAB_TUNNELD=$1
    start_appliance a1 10.0.0.101 "$(lab_group 51 10.0.0.1)"
}
no_tunnel='failed to add tunnel: id: 232 10.0.0.101 <=> 10.0.0.1'
# The group does not accept a router without a tunnel: it tries again at each message of the router, and keeps sending
# Here-I-Am.
check_no_tunnel() {
    wait_log a1 20 "$no_tunnel"
    group_is a1 5 51 '.oper == "INIT" and .num_routers == 0'
    router_is r1 30 51 '.counters.rx_here_i_am >= 3 and $g.assignment.kind != "hash" and $g.assignment.kind != "mask"'
    [ "$(lab_log a1 | grep -c "$no_tunnel")" -ge 2 ] || die "the tunnel was requested only once"
}
check_tunnel() {
    wait_role a1 40 51 ACTIVE
    router_is r1 5 51 '[$g.appliances[].address] == ["10.0.0.101"]'
    finish a1 -- 'GRE tunnel L2 return add timed out' 'Error code'
    grep -q 'delete tunnel 232 .*: done' "$LAB/a1-tunneld.out" || die "the tunnel is left"
}

case_absent() {
    start_group none
    check_no_tunnel
    lab_tunneld_start a1
    check_tunnel
}
case_slow() {
    start_group '--slow 400'
    check_tunnel
}
case_silent() {
    start_group --silent
    wait_log a1 20 'GRE tunnel add timed out'
    check_no_tunnel
    lab_stop a1 tunneld KILL
    lab_tunneld_start a1
    check_tunnel
}
case_refusing() {
    start_group --refuse
    check_no_tunnel
    explains a1 5 51 tunnel-refused 10.0.0.1
    finish a1
}
run_within() { # MILLISECONDS COMMAND...
    local began=${EPOCHREALTIME/./} took
    "${@:2}" || die "failed: ${*:2}"
    took=$(((${EPOCHREALTIME/./} - began) / 1000))
    [ $took -le "$1" ] || die "took $took ms: ${*:2}"
}
# While ten routers wait for tunnels, a group that needs none sends its messages in time, and mgmtctl gets answers: after
# one wait of 2 s for tunneld, but never after two.
case_silent_for_other_group() {
    LAB_SPEED=1 # tunneld's timeout is in real seconds
    lab_router r1 10.0.0.{1..10} -- --forward gre --return gre
    lab_router r2 10.0.0.20 -- --forward l2 --return l2
    LAB_TUNNELD=--silent
    start_appliance a1 10.0.0.101 "$(lab_group 51 10.0.0.{1..10})" "$(lab_group 52 10.0.0.20)"
    local i
    for i in {1..56}; do
        run_within 3000 lab_manage a1 get /qv/wccpd/wccp/srv_grp/state/52/oper >/dev/null
        sleep 0.5
    done
    wait_role a1 30 52 ACTIVE
    jq -es '[.[] | select(.what == "here-i-am") | .t] | [.[1:], .[:-1]] | transpose | map(.[0] - .[1]) |
        length >= 2 and max < 12.5' "$LAB/r2.log" >/dev/null || die "late Here-I-Am: $(grep -o '^.*here-i-am' "$LAB/r2.log")"
    finish a1 -- 'GRE tunnel L2 return add timed out'
}
case_silent_at_start() {
    lab_router r1 10.0.0.1 -- --forward l2 --return l2
    lab_appliance a1 10.0.0.101
    LAB_FOUND[a1]=$(lab_remains a1)
    lab_write_config a1 "$(for i in {51..60}; do lab_group "$i" 10.0.0.1; done)"
    lab_mgmtd_start a1
    lab_tunneld_start a1 --silent
    run_within 5000 lab_wccpd_start a1
    [ "$(lab_log a1 | grep -c 'GRE tunnel L2 return add timed out')" = 10 ] || die "the timeout is not logged for each group"
    finish a1 -- 'GRE tunnel L2 return add timed out'
}
# Group 51 has the routers 10.0.0.1 to 8, group 52 the next eight, ...
groups_of_eight() { # FIRST LAST
    local i routers
    for ((i = $1; i <= $2; i++)); do
        mapfile -t routers < <(seq -f 10.0.0.%g $((8 * (i - 51) + 1)) $((8 * (i - 50))))
        lab_group "$i" "${routers[@]}"
    done
}
case_hung_at_delete() {
    LAB_SPEED=2 # the waits for tunneld are in real seconds, and routers give up after 25 s of the protocol
    lab_router r1 10.0.0.{1..32} -- --forward gre --return gre
    start_appliance a1 10.0.0.101 "$(groups_of_eight 51 54)"
    local i
    for i in {51..54}; do wait_role a1 60 "$i" ACTIVE; done
    [ "$(lab_log a1 | grep -c 'created GRE tunnel id')" = 32 ] || die "not 32 tunnels"
    kill -STOP "$(lab_pid a1 tunneld)"
    configure a1 "$(groups_of_eight 52 54)"
    run_within 3000 lab_manage a1 get /qv/wccpd/wccp/srv_grp/state/54/oper >/dev/null
    run_within 5000 lab_stop a1 wccpd
    for i in {1..32}; do
        router_at_is r1 "10.0.0.$i" 5 $((51 + (i - 1) / 8)) '.counters.rx_shutdown == 1'
    done
    lab_continue a1 tunneld || die "tunneld did not continue"
    finish a1
}
# Under mgmtd, tunneld is replaced unnoticed when it crashes, and keeps the tunnel with its interface index. When it exits,
# wccpd is stopped and started again as well.
case_crash() {
    lab_router r1 10.0.0.1 -- --forward gre --return gre
    lab_appliance a1 10.0.0.101
    lab_write_config a1 "$(lab_group 51 10.0.0.1)"
    : >"$LAB/a1-mgmtd.out"
    lab_clock # for mgmtd and, by inheritance, for the programs that it starts
    lab_start a1 mgmtd "$(command -v env)" "${LAB_CLOCK[@]:1}" "$WCCP_BIN/mgmtd" --config "$LAB_CONFIG" --supervise --wccpd "$WCCP_BIN/wccpd" --tunneld "$WCCP_BIN/tunneld"
    wait_role a1 60 51 ACTIVE
    lab_mark a1
    local before; before=$(lab_in a1 ip -o link show group 2048)
    lab_in a1 pkill -KILL -x tunneld
    lab_wait_event 10 a1 '^process tunneld: ended by SIGKILL, replaced' || die "tunneld was not replaced"
    [ -n "$before" ] && [ "$(lab_in a1 ip -o link show group 2048 | cut -d: -f1,2)" = "$(cut -d: -f1,2 <<<"$before")" ] || die "the tunnel was not taken over"
    lab_in a1 pkill -TERM -x tunneld
    wait_log a1 10 'WCCP daemon exiting with code 0'
    router_is r1 5 51 '.counters.rx_shutdown == 1 and $g.appliances == []'
    lab_wait_event 10 a1 '^process wccpd: exited with 0, starts again' || die "the exit of wccpd was not noticed"
    wait_log a1 20 'WCCP daemon launched'
    wait_log a1 60 'created GRE tunnel id 232 10.0.0.101 <=> 10.0.0.1'
    router_is r1 60 51 '[$g.appliances[].address] == ["10.0.0.101"] and $g.assignment.kind == "hash"'
    wait_role a1 20 51 ACTIVE
    lab_stop a1 mgmtd || die "mgmtd exited with $?"
    [ "$(lab_in a1 pgrep -cx 'wccpd|tunneld')" = 0 ] || die "programs are left running"
    lab_clean_log a1 || die "log of a1"
}

lab_case
