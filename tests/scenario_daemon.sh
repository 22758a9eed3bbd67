#!/bin/bash
# The whole appliance: mgmtd, tunneld and wccpd, and one router. A group comes up from the configuration, a change of
# its weight reaches the router, SIGTERM and the loss of mgmtd end the daemon in order; then mgmtd is killed at random
# moments of the start.
#   scenario_daemon.sh DIRECTORY_OF_THE_PROGRAMS        WCCP_STRESS=1: a hundred times in the place of five
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"

rounds=5; [ -z "${WCCP_STRESS-}" ] || rounds=100
fail() { echo "$*" >&2; cat "$LAB"/a1-*.out >&2; tail -n 60 "$LAB/a1.log" >&2; exit 1; }

lab_router r1 10.0.0.1
lab_appliance a1 10.0.0.101
inside=/proc/${LAB_INIT[a1]}/root
config=/etc/opt/rvl/mgmtd.conf
configure() { # WEIGHT
    cat >"$inside$config" <<END
[/logging/syslog/process/wccpd]
log_level = info
[/qv/wccpd/wccp/srv_grp/config/51]
interface = eth0
weight = $1
router/1/ipaddr = 10.0.0.1
END
}
manage() {
    : >"$LAB/a1-mgmtd.out"
    lab_start a1 mgmtd mgmtd --config $config
    lab_wait_line 10 '^mgmtd ready' "$LAB/a1-mgmtd.out" || fail "mgmtd does not start"
}
# How the daemon ended, without being told to: its status, or 124 when it is still there.
own_end() { # SECONDS
    local i
    for ((i = 0; i < $1 * 20; i++)); do
        lab_alive a1 wccpd || { wait "${LAB_PID[a1/wccpd]}"; return; }
        sleep 0.05
    done
    return 124
}
# The lines stand in the log in this order, from the last start of the daemon on.
in_order() { # LINE...
    local text line
    text=$(tac "$LAB/a1.log" | sed '/WCCP daemon launched/q' | tac)
    for line; do
        [[ $text = *"$line"* ]] || fail "not in the log, or not in its place: $line"
        text=${text#*"$line"}
    done
}
last_steps=("WCCP: alarms: clearing all alarms." "qv_alm_mgmt_shutdown: cancel alm thread"
    "qv_alm_thread: out of main loop, exiting..." "qv_alm_mgmt_shutdown: alm thread exited"
    "WCCP: wccp manager is exiting" "WCCP daemon exiting with code 0")

configure 100
manage
lab_start a1 tunneld tunneld
lab_start a1 wccpd wccpd
lab_wait_line 10 'wccpd_init: encap entries:' "$LAB/a1.log" || fail "the daemon is not ready"
pid_file=$inside/run/wccpd.pid
for _ in $(seq 40); do [ -s "$pid_file" ] && break; sleep 0.05; done
[ "$(cat "$pid_file")" = "$(lab_in a1 pgrep -x wccpd)" ] || fail "the pid file names somebody else"
[ "$(stat -c %a "$pid_file")" = 644 ] || fail "the mode of the pid file"
[ "$(grep -c '^session of wccpd-[0-9]* open' "$LAB/a1-mgmtd.out")" = 2 ] || fail "two sessions are awaited"
lab_wait_line 45 '^role of group 51: ACTIVE' "$LAB/a1-mgmtd.out" || fail "the group does not become active"
lab_wait 1 '.groups["51"].assignment.kind as $kind | $kind == "hash" or $kind == "mask"' lab_ctl r1 show ||
    fail "the router has no table"

configure 7
kill -HUP "$(lab_pid a1 mgmtd)"
lab_wait 15 '.groups["51"].appliances[0].weight == 7' lab_ctl r1 show || fail "the weight does not arrive"
in_order "Received event: /mgmtd/notify/dbchange" "WCCP config: set weight to 7" "WCCP Modify config complete"

lab_stop a1 wccpd || fail "after SIGTERM the daemon ended with $?"
in_order "Received SIGTERM" "${last_steps[@]}"
[ "$(grep -c '^session of wccpd-[0-9]* closed' "$LAB/a1-mgmtd.out")" = 2 ] || fail "the sessions are not closed"

lab_start a1 wccpd wccpd
lab_wait_line 10 '^role of group 51: BACKUP' "$LAB/a1-mgmtd.out" || fail "the daemon does not start again"
sleep 1
lab_stop a1 mgmtd KILL 2>/dev/null
own_end 10 || fail "without mgmtd the daemon ended with $?"
# The alarm session may be the first to notice, and then its thread ends by itself, at any place among the others.
in_order "Lost connection to mgmtd; exiting" "qv_alm_thread: out of main loop, exiting..."
in_order "Lost connection to mgmtd; exiting" "${last_steps[0]}" "${last_steps[1]}" "${last_steps[3]}" "${last_steps[@]:4}"

# A daemon that has not reached mgmtd waits to be told; one that has a session ends with it.
for ((round = 1; round <= rounds; round++)); do
    manage
    lab_start a1 wccpd wccpd
    moment=$((RANDOM % 500))
    sleep "0.$(printf %03d $moment)"
    lab_stop a1 mgmtd KILL 2>/dev/null
    own_end 5; status=$?
    if [ $status = 124 ] && ! grep -q '^session of wccpd' "$LAB/a1-mgmtd.out"; then
        lab_stop a1 wccpd; status=$?
    fi
    [ $status = 0 ] || fail "round $round, mgmtd killed after $moment ms: the daemon ended with $status"
done
exit 0
