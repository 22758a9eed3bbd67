#!/bin/bash
# daemon_start.sh [BIN [GROUPS...]]: measures the start of wccpd with that many groups of 32 routers (default 1, 32, 64, 128
# and 256), until it logs that it is ready, and its memory by use once all groups have assignments.
#
# It prints the elapsed time and the processor times of wccpd and mgmtd, which depend less on the load of the machine. The
# cost per group is compared with that at the first number above 1: it would grow if the start took quadratic time.
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

write_groups() { # GROUPS
    awk -v groups="$1" 'BEGIN {
        for (id = 255; id > 255 - groups; id--) {
            printf "[/qv/wccpd/wccp/srv_grp/config/%d]\ninterface = eth0\npriority = %d\n", id, id
            for (i = 1; i <= 32; i++) printf "router/%d/ipaddr = 10.0.0.%d\n", i, i
        }
    }' >"$inside$LAB_CONFIG"
}
cpu_us() { # NODE NAME : prints the processor time of all threads of a program
    cat /proc/"$(pid_of "$1" "$2")"/task/*/schedstat | awk '{ sum += $1 } END { printf "%d", sum / 1000 }'
}
pid_of() { local pid; pid=$(lab_pid "$1" "$2"); echo "${pid% }"; }

first=0      # processor time with the first number of groups
each_first=0 # cost per further group at the second number
printf '%-8s %10s %14s %14s %22s\n' groups 'ready, ms' 'wccpd cpu, ms' 'mgmtd cpu, ms' 'of one group, us (ratio)'
for groups in "${sizes[@]}"; do
    write_groups "$groups"
    : >"$LAB/a1.log"
    lab_start a1 mgmtd mgmtd --config $LAB_CONFIG
    lab_start a1 tunneld tunneld
    lab_wait_line 20 '^mgmtd ready' "$LAB/a1-mgmtd.out" || die "mgmtd did not start"
    tail -n +1 -f "$LAB/a1.log" 2>/dev/null | while read -r line; do
        case $line in
        *"WCCP daemon launched"*) echo "launched ${EPOCHREALTIME/./}" ;;
        *"encap entries"*) echo "ready ${EPOCHREALTIME/./}" && break ;;
        esac
    done >"$LAB/times" &
    before=$(cpu_us a1 mgmtd)
    lab_start a1 wccpd wccpd
    lab_wait_line 60 '^ready' "$LAB/times" || die "wccpd did not start"
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
            die "not all groups have assignments"
        "$top/scripts/memory.sh" "$(pid_of a1 wccpd)" | sed 's/^/    /'
    fi
    lab_stop a1 wccpd || die "wccpd exited with $?"
    lab_stop a1 mgmtd; lab_stop a1 tunneld
    : >"$LAB/a1-mgmtd.out"
done
