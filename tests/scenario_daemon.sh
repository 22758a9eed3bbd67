#!/bin/bash
# wccpd with mgmtd, tunneld and one router: pid file, sessions, locked memory, missing privileges, and the order of
# shutdown after SIGTERM and after the loss of mgmtd. Then mgmtd is killed at random moments of the start of wccpd.
#   scenario_daemon.sh DIRECTORY_OF_THE_PROGRAMS        WCCP_STRESS=1: a hundred kills instead of five
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
export LAB_SPEED=${LAB_SPEED:-8}
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"

rounds=5; [ -z "${WCCP_STRESS-}" ] || rounds=100
fail() { echo "$*" >&2; lab_show a1; exit 1; }
# Expects these lines, in this order, in the log since the last start of wccpd.
log_has() { # LINE...
    local text line
    text=$(tac "$LAB/a1.log" | sed '/WCCP daemon launched/q' | tac)
    for line; do
        [[ $text = *"$line"* ]] || fail "missing in the log, or in the wrong place: $line"
        text=${text#*"$line"}
    done
}
last_steps=("WCCP: alarms: clearing all alarms." "qv_alm_mgmt_shutdown: cancel alm thread"
    "qv_alm_thread: out of main loop, exiting..." "qv_alm_mgmt_shutdown: alm thread exited"
    "WCCP: wccp manager is exiting" "WCCP daemon exiting with code 0")

lab_router r1 10.0.0.1
lab_appliance a1 10.0.0.101
lab_appliance_start a1 "$(lab_group 51 10.0.0.1 weight=100)"
pid_file=/proc/${LAB_INIT[a1]}/root/run/wccpd.pid
for _ in $(seq 40); do [ -s "$pid_file" ] && break; sleep 0.05; done
[ "$(cat "$pid_file")" = "$(lab_in a1 pgrep -x wccpd)" ] || fail "wrong process id in the pid file"
[ "$(stat -c %a "$pid_file")" = 644 ] || fail "wrong mode of the pid file"
[ "$(lab_events a1 | grep -c '^session of wccpd-[0-9]* open')" = 2 ] || fail "not two sessions"
lab_wait_role 45 a1 51 ACTIVE || fail "the group did not become active"
lab_wait 5 '.groups["51"].assignment.kind as $kind | $kind == "hash" or $kind == "mask"' lab_ctl r1 show ||
    fail "the router has no table"
# Every mapped page is locked, used or not: malloc arenas of threads, or stacks of the default size, would exceed this.
locked=$(awk '$1 == "VmLck:" { print $2 }' "/proc/$(lab_pid a1 wccpd | tr -d ' ')/status")
[ "$locked" -le 7168 ] || grep -q __asan_init "$WCCP_BIN/wccpd" || fail "$locked kB are locked"

lab_configure a1 "$(lab_group 51 10.0.0.1 weight=7)" || fail "mgmtd refused the weight"
lab_wait 15 '.groups["51"].appliances[0].weight == 7' lab_ctl r1 show || fail "the weight did not reach the router"
log_has "Received event: /mgmtd/notify/dbchange" "WCCP config: set weight to 7" "WCCP Modify config complete"

# A program that lacks a privilege reports it and exits.
expect_lacking() { # PROGRAM EXPRESSION COMMAND... : COMMAND runs the program
    local output
    output=$(lab_in a1 timeout 10 "${@:3}" "$WCCP_BIN/$1" 2>&1 >/dev/null)
    [ $? = 1 ] && grep -Eq "^$1: .*$2" <<<"$output" || fail "$1 without privileges: $output"
}
expect_lacking wccpd 'missing privilege: CAP_IPC_LOCK, .* \(now 64 KiB\)' prlimit --memlock=65536 setpriv --bounding-set -all --inh-caps -all
expect_lacking wccpd 'missing privilege: running as root or as user 0' setpriv --reuid 65534 --clear-groups --ambient-caps +ipc_lock --inh-caps +ipc_lock
expect_lacking tunneld 'missing privileges: CAP_NET_ADMIN, CAP_NET_RAW' \
    unshare --mount sh -c 'mount -t tmpfs tmpfs /run && exec "$@"' - setpriv --bounding-set -all --inh-caps -all
for program in wccpd tunneld mgmtd mgmtctl; do
    [[ $("$WCCP_BIN/$program" --version) =~ ^$program\ [0-9]+\.[0-9]+\.[0-9]+$ ]] || fail "$program --version"
    "$WCCP_BIN/$program" --help | grep -q -e --version || fail "$program --help"
done

lab_stop a1 wccpd || fail "after SIGTERM wccpd exited with $?"
log_has "Received SIGTERM" "${last_steps[@]}"
lab_wait_event 2 a1 '^forgotten with its session: /qv/alarms/state/role/51' || fail "mgmtd kept the role"
[ "$(lab_events a1 | grep -c '^session of wccpd-[0-9]* closed')" = 2 ] || fail "the sessions were not closed"

lab_wccpd_start a1
lab_wait_role 10 a1 51 BACKUP || fail "wccpd did not start again"
lab_sleep 1
lab_stop a1 mgmtd KILL 2>/dev/null
lab_wait_exit 10 a1 wccpd || fail "without mgmtd wccpd exited with $?"
# If the alarm session notices the loss first, its thread ends by itself, at any place in this order.
log_has "Lost connection to mgmtd; exiting" "qv_alm_thread: out of main loop, exiting..."
log_has "Lost connection to mgmtd; exiting" "${last_steps[0]}" "${last_steps[1]}" "${last_steps[3]}" "${last_steps[@]:4}"
lab_clean_log a1 'Lost connection to mgmtd'

# wccpd exits with the loss of its session; without a session it keeps trying, until SIGTERM.
for ((round = 1; round <= rounds; round++)); do
    lab_mgmtd_start a1
    lab_start a1 wccpd wccpd
    moment=$((RANDOM % 500))
    sleep "0.$(printf %03d $moment)"
    lab_stop a1 mgmtd KILL 2>/dev/null
    lab_wait_exit 5 a1 wccpd; status=$?
    if [ $status = 124 ] && ! lab_events a1 | grep -q '^session of wccpd'; then
        lab_stop a1 wccpd; status=$?
    fi
    [ $status = 0 ] || fail "round $round, mgmtd killed after $moment ms: wccpd exited with $status"
done
# The next mgmtd takes over the socket of the killed one, and removes it.
lab_mgmtd_start a1
lab_end a1 || fail "end of a1"
