#!/bin/bash
# daemon_start.sh [BIN [GROUPS...]]: the real programs with that many groups of 32 routers (default 1, 32, 64, 128 and
# 256): how long the daemon takes from its launch to the line that says that it is ready, and what memory it locks,
# by room, once all groups are assigned.
#
# The time is that of the clock and, since the machine may be busy, the processor time of the daemon and of mgmtd.
# The cost of one group is compared with the cost at the first number above 1: a start that looks at every node
# for every node would show there.
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"
[ $# -gt 0 ] && shift
sizes=("$@"); [ $# -gt 0 ] || sizes=(1 32 64 128 256)
die() { echo "$*" >&2; tail -n 20 "$LAB/a1.log" "$LAB"/a1-*.out >&2; exit 1; }

addresses=(); for i in $(seq 32); do addresses+=("10.0.0.$i"); done
lab_router r1 "${addresses[@]}"
lab_appliance a1 10.0.0.101
inside=/proc/${LAB_INIT[a1]}/root

configure() { # GROUPS
    awk -v groups="$1" 'BEGIN {
        for (id = 255; id > 255 - groups; id--) {
            printf "[/qv/wccpd/wccp/srv_grp/config/%d]\ninterface = eth0\npriority = %d\n", id, id
            for (i = 1; i <= 32; i++) printf "router/%d/ipaddr = 10.0.0.%d\n", i, i
        }
    }' >"$inside$LAB_CONFIG"
}
cpu_us() { # NODE NAME: of all threads of the program
    cat /proc/"$(pid_of "$1" "$2")"/task/*/schedstat | awk '{ sum += $1 } END { printf "%d", sum / 1000 }'
}
pid_of() { local pid; pid=$(lab_pid "$1" "$2"); echo "${pid% }"; }

first=0 # what the first number takes, and what one more group costs at the second
each_first=0
printf '%-8s %10s %14s %14s %22s\n' groups 'ready, ms' 'wccpd cpu, ms' 'mgmtd cpu, ms' 'of one group, us (ratio)'
for groups in "${sizes[@]}"; do
    configure "$groups"
    : >"$LAB/a1.log"
    lab_start a1 mgmtd mgmtd --config $LAB_CONFIG
    lab_start a1 tunneld tunneld
    lab_wait_line 20 '^mgmtd ready' "$LAB/a1-mgmtd.out" || die "mgmtd does not start"
    tail -n +1 -f "$LAB/a1.log" 2>/dev/null | while read -r line; do
        case $line in
        *"WCCP daemon launched"*) echo "launched ${EPOCHREALTIME/./}" ;;
        *"encap entries"*) echo "ready ${EPOCHREALTIME/./}" && break ;;
        esac
    done >"$LAB/times" &
    before=$(cpu_us a1 mgmtd)
    lab_start a1 wccpd wccpd
    lab_wait_line 60 '^ready' "$LAB/times" || die "the daemon is not ready"
    own=$(cpu_us a1 wccpd) other=$(($(cpu_us a1 mgmtd) - before))
    wall=$(awk '{ at[$1] = $2 } END { printf "%d", (at["ready"] - at["launched"]) / 1000 }' "$LAB/times")
    each=0 ratio=-
    if [ $first = 0 ]; then
        first=$((own + other))
    else
        each=$(((own + other - first) / (groups - sizes[0])))
        [ $each_first != 0 ] || each_first=$each
        ratio=$(awk "BEGIN { printf \"%.2f\", $each / $each_first }")
    fi
    printf '%-8d %10d %14d %14d %14d (%s)\n' "$groups" "$wall" $((own / 1000)) $((other / 1000)) $each "$ratio"
    if [ "$groups" = "${sizes[0]}" ] || [ "$groups" = "${sizes[-1]}" ]; then
        lab_wait 120 "[.groups[] | select(.assignment.kind != \"none\")] | length == $groups" lab_ctl r1 "@10.0.0.32" show ||
            die "not all groups are assigned"
        "$top/scripts/memory.sh" "$(pid_of a1 wccpd)" | sed 's/^/    /'
    fi
    lab_stop a1 wccpd || die "the daemon ended with $?"
    lab_stop a1 mgmtd; lab_stop a1 tunneld
    : >"$LAB/a1-mgmtd.out"
done
