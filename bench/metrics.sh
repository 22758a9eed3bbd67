#!/bin/bash
# metrics.sh [BIN [GROUPS [SCRAPES]]]: measures the cost of a scrape of the metrics with that many groups (256) of 32
# routers, over HTTP as the socket unit serves it: the time from the request to the last byte, the processor time of
# each program, the size plain and compressed, the number of series, and how long the engine lock was held for it at
# most. The floor is the time of a request that is answered without a query (404).
#
#   METRICS_KEEP    a file for the text of the last scrape
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"
groups=${2:-256} scrapes=${3:-20}
die() { echo "$*" >&2; tail -n 8 "$LAB/a1.log" "$LAB"/a1-*.out >&2; exit 1; }

addresses=(); for i in $(seq 32); do addresses+=("10.0.0.$i"); done
lab_router r1 "${addresses[@]}"
lab_appliance a1 10.0.0.101
LAB_FOUND[a1]=$(lab_remains a1)
awk -v groups="$groups" 'BEGIN {
    for (id = 255; id > 255 - groups; id--) {
        printf "[/qv/wccpd/wccp/srv_grp/config/%d]\ninterface = eth0\npriority = %d\n", id, id
        for (i = 1; i <= 32; i++) printf "router/%d/ipaddr = 10.0.0.%d\n", i, i
    }
}' >"/proc/${LAB_INIT[a1]}/root$LAB_CONFIG"
lab_mgmtd_start a1
lab_tunneld_start a1
lab_start a1 wccpd wccpd_timed
lab_wait 120 "[.groups[] | select(.assignment.kind != \"none\")] | length == $groups" lab_ctl r1 "@10.0.0.32" show ||
    die "not all groups are assigned"
lab_start a1 http "$(command -v systemd-socket-activate)" --accept --inetd -l 127.0.0.1:9815 "$WCCP_BIN/mgmtctl" metrics --http
lab_sleep 12 # one more round of the protocol

cpu_us() { # NAME: of all threads of the program
    local pid; pid=$(lab_pid a1 "$1")
    # shellcheck disable=SC2086
    cat /proc/${pid% }/task/*/schedstat | awk '{ sum += $1 } END { printf "%d", sum / 1000 }'
}
request() { lab_in a1 curl -s -o "$LAB/$1" -w '%{time_total}\n' "http://127.0.0.1:9815/$1"; }
summary() { sort -n | awk '{ t[NR] = $1 * 1000 } END { printf "median %.1f ms, most %.1f ms\n", t[int((NR + 1) / 2)], t[NR] }'; }
for _ in $(seq "$scrapes"); do request nothing; done >"$LAB/floor"
lines=$(wc -l <"$LAB/a1-wccpd.out") before=()
for name in wccpd mgmtd; do before+=("$(cpu_us $name)"); done
for _ in $(seq "$scrapes"); do request metrics; sleep 0.2; done >"$LAB/times"
for name in wccpd mgmtd; do
    echo "$name: $((($(cpu_us $name) - before[0]) / scrapes / 1000)) ms of a processor for each scrape"
    before=("${before[@]:1}")
done
sleep 1.2
[ "$(tail -n 1 "$LAB/metrics")" != "" ] && [ "$(grep -c '^wccp_router_heard_seconds' "$LAB/metrics")" = $((groups * 32)) ] || die "not all routers are there: $(head -c 300 "$LAB/metrics")"
echo "request to last byte: $(summary <"$LAB/times")"
echo "a request without a query: $(summary <"$LAB/floor")"
echo "size: $(wc -c <"$LAB/metrics") bytes, gzip -1 $(gzip -1 <"$LAB/metrics" | wc -c), gzip -6 $(gzip <"$LAB/metrics" | wc -c)"
echo "series: $(grep -vc '^#' "$LAB/metrics")"
tail -n +$((lines + 2)) "$LAB/a1-wccpd.out" | awk '/ main / { holds += $12; max = $14 > max ? $14 : max; cpu = $16 > cpu ? $16 : cpu; all = $7 > all ? $7 : all }
    END { printf "engine lock: held %d times by the main thread, at most %d us (%d us of a processor); by any thread at most %d us\n", holds, max, cpu, all }'
[ -z "${METRICS_KEEP-}" ] || cp "$LAB/metrics" "$METRICS_KEEP"
lab_stop a1 http
lab_end a1
