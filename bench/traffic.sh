#!/bin/bash
# traffic.sh [BIN [PART...]]: what the user-space data plane carries, beside plain forwarding by the kernel between the
# same namespaces in the same run. The parts, all of them unless some are named:
#   tcp       throughput to the proxy, and the appliance's processor time for a megabyte
#   packets   packets of 64 bytes a second, of 4096 flows and of one, and the loss at half of that rate
#   upload    100 MB by full-size packets, whose GRE packets are fragmented, to a server: the longest pause
#   orders    from the order of a tunnel to the first packet, under way and after a quiet minute
#   start     32 tunnels and 256 intercepts: rules, routes and links made, found again, and taken over
#   idle      wake-ups of tunneld after a quiet minute
#
# What is compared. The client, the router, the server and the switch have processor 0, the appliance has processor 1:
# what it receives is processed there (receive packet steering), its programs are bound to it. In all ways the
# appliance gets packets of its MTU one by one, since veth has no receive offload unless it is asked for, and TCP
# segmentation is done before. Plain, the appliance's kernel forwards the client's TCP stream to a server beside it on
# the switch, and what the server answers back to the client. Redirected, the stream comes through GRE and the packet
# ring into the TUN device and by TPROXY to the proxy's socket. The socket line is for information: the stream is
# addressed to a socket of the appliance, which is less work than forwarding each packet, since the kernel merges
# segments on their way to a socket. The `packets` take the same way and are forwarded by the appliance, plain or, for
# redirected ones, as `rest` says; they are counted when they leave it. The client sends as many as it can, and all of
# the way is processor 1's work: with a processor of its own the client would send more than the appliance can take.
# Of one flow they can be merged, of 4096 flows in turn they cannot; with the shortcut of the kernel that makes no difference. Processor time is all of processor 1,
# interrupts included, without idling; what the router does for GRE is not in it, except with `packets`. Rounds alternate,
# the result is the median of their ratios. A round during which others had more than 5 % of processor 1 is repeated.
#   TRAFFIC_SECONDS    of a round (4)          TRAFFIC_ROUNDS    (5)
#   TRAFFIC_LOSS_SECONDS   of the loss (60)    TRAFFIC_QUIET     seconds of quiet (61)
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
: "${TRAFFIC_SECONDS:=4}" "${TRAFFIC_ROUNDS:=5}" "${TRAFFIC_LOSS_SECONDS:=60}" "${TRAFFIC_QUIET:=61}"
export LAB_PLANE=user
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"
[ $# -gt 0 ] && shift
parts=("$@"); [ $# -gt 0 ] || parts=(tcp packets upload orders start idle protection)
load=$WCCP_BIN/traffic_load
die() { echo "$*" >&2; tail -n 12 "$LAB"/*.log "$LAB"/*.out >&2; exit 1; }

# ---- the network

on() { # PROCESSOR NODE COMMAND...
    lab_in "$2" taskset -c "$1" "${@:3}"
}
steer() { # NODE DEVICE PROCESSOR: what the device receives is processed there, or "here"; "-" is the switch
    # shellcheck disable=SC2016
    local script='mount -t sysfs sysfs /sys && echo "$2" >"/sys/class/net/$1/queues/rx-0/rps_cpus"'
    local -A masks=([here]=0 [0]=1 [1]=2)
    local where=(); [ "$1" = - ] || where=(nsenter -t "${LAB_INIT[$1]}" --net)
    "${where[@]}" unshare --mount bash -c "$script" - "$2" "${masks[$3]}" || die "$2 of $1 is not steered"
}
set_up() {
    lab_router r1 10.0.0.1 -- --forward gre --return gre
    lab_client c1 r1
    lab_server s1 r1
    lab_bare s2 && lab_plug s2 "${LAB_INIT[s2]}" 10.0.0.50
    lab_gateway s2 10.0.0.101
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    lab_start a1 proxy "$(command -v taskset)" -c 1 "$load" sink 3129
    on 0 s1 "$load" sink 8000 &
    on 0 s2 "$load" sink 8000 &
    lab_appliance_start a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    lab_wait_role 60 a1 51 ACTIVE || die "no role"
    lab_wait 20 '.[] | select(.name == "/qv/tunneld/intercept/state/51/proxy") | .value == "up"' \
        lab_manage a1 walk /qv/tunneld/intercept/state || die "the proxy is not up"
    tunneld=$(lab_pid a1 tunneld)
    taskset -a -p -c 1 "$tunneld" >/dev/null
    proxy=$(lab_pid a1 proxy)
    # The router redirects what the client sends to 10.2.0.2.
    on 0 r1 "$WCCP_BIN/traffic_wrap" eth0 >"$LAB/wrap.out" 2>&1 &
    lab_wait_line 5 ready "$LAB/wrap.out" || die "no router"
    # shellcheck disable=SC2016
    lab_in r1 bash -c 'cd /proc/sys/net/ipv4
        for name in all default eth0 c1; do echo 0 >conf/$name/rp_filter; echo 0 >conf/$name/send_redirects; done
        echo 1 >ip_forward
        ip rule add iif c1 to 10.2.0.0/24 preference 90 lookup 90
        ip rule add iif c1 to 10.0.0.50 preference 91 lookup 90
        ip route add default via 10.0.0.101 dev eth0 table 90'
    lab_in c1 "$load" split eth0
    lab_in a1 "$load" split eth0 # each packet that it forwards counts
    # What the appliance forwards plainly goes out where it came in.
    lab_in a1 bash -c 'cd /proc/sys/net/ipv4/conf
        for name in all eth0; do echo 0 >$name/send_redirects; done; echo 1 >eth0/forwarding'
    steer a1 eth0 1
    steer - v-a1 0
    mac=$(lab_in r1 ip -j link show c1 | jq -r '.[0].address')
    # Of the small packets only the number is wanted.
    nft 'add table netdev lab; add chain netdev lab small { type filter hook ingress device "v-a1" priority 0; }
        add rule netdev lab small udp dport 9 drop' || die "no filter"
}
rest_is() { # return|forward
    lab_configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80 rest="$1")" || die "not configured"
    sleep 1
}

# ---- measuring

# Of processor 1, in seconds: busy, user time of others than tunneld and the proxy, all. Busy is what is not idle: the
# kernel samples the rest by a tick, which stands still on an idle processor and misses most of the short interrupts.
ticks() {
    cat "/proc/$tunneld/stat" "/proc/$proxy/stat" /proc/stat /proc/uptime | awk -v hertz="$(getconf CLK_TCK)" '
        $1 ~ /^[0-9]/ && NF > 2 { sub(/.*\)/, ""); own += $12 }
        $1 == "cpu1" { idle = $5 + $6; user = $2 + $3 }
        NF == 2 && $1 ~ /^[0-9]/ { all = $1 }
        END { print all - idle / hertz, (user - own) / hertz, all }'
}
# Until the machine does next to nothing, for a minute at most: others may be building.
wait_for_calm() {
    local before after i
    for ((i = 0; i < 300; i++)); do
        before=$(ticks); sleep 0.2; after=$(ticks)
        awk -v before="$before" -v after="$after" 'BEGIN {
            split(before, b); split(after, a); exit a[1] - b[1] > 0.1 * (a[3] - b[3]) }' && return
    done
}
measure() { # COMMAND... : sets out, busy (seconds of processor 1), others (share)
    local before after
    wait_for_calm
    before=$(ticks)
    out=$("$@") || die "$* failed"
    after=$(ticks)
    read -r busy others share < <(awk -v before="$before" -v after="$after" 'BEGIN {
        split(before, b); split(after, a)
        print a[1] - b[1], (a[2] - b[2]) / (a[3] - b[3]), (a[1] - b[1]) / (a[3] - b[3]) }')
    quiet=$(awk "BEGIN { print ($others < ${TRAFFIC_OTHERS:-0.05}) }")
}
median() { sort -g | awk '{ at[NR] = $1 } END { print NR % 2 ? at[(NR + 1) / 2] : (at[NR / 2] + at[NR / 2 + 1]) / 2 }'; }
sent_by_a1() { cat /proc/net/dev | awk '$1 == "v-a1:" { print $3 }'; }

# Rounds one way after the other until enough were quiet. One line of each round: rate, cost and share of processor 1,
# of each way in turn.
rounds() { # FUNCTION THAT SETS rate AND cost, GIVEN A WAY; WAYS, plain AND redirected FIRST
    local good=0 attempts=0 line way calm
    : >"$LAB/$1.rounds"
    while [ $good -lt "$TRAFFIC_ROUNDS" ]; do
        attempts=$((attempts + 1)) line='' calm=1
        for way in "${@:2}"; do
            "$1" "$way"
            line+="$rate $cost $share "
            [ "$quiet" = 1 ] || calm=0
        done
        [ -z "${TRAFFIC_VERBOSE-}" ] || echo "    $1: $line others $others"
        if [ $calm = 0 ]; then
            [ $attempts -lt $((10 * TRAFFIC_ROUNDS)) ] || die "$1: the machine is too busy"
            continue
        fi
        echo "$line" >>"$LAB/$1.rounds"
        good=$((good + 1))
    done
    [ $attempts = $good ] || echo "($((attempts - good)) rounds were disturbed and measured again)"
}
of_rounds() { # FUNCTION AWK: the median of an expression
    awk "{ print $2 }" "$LAB/$1.rounds" | median
}
figure() { # NAME VALUE WANTED: a number beside its limit, "<= 50" or ">= 0.9"
    local verdict
    verdict=$(awk "BEGIN { print ($2 $3 ? \"\" : \"  MISSED\") }")
    printf '%-64s %10s   (wanted %s)%s\n' "$1" "$2" "$3" "$verdict"
    [ -z "$verdict" ] || missed=1
}
missed=0

# ---- the parts

tcp() { # plain|redirected|socket
    local -A to=([plain]='10.0.0.50 8000' [redirected]='10.2.0.2 80' [socket]='10.0.0.101 3129')
    # shellcheck disable=SC2086
    measure on 0 c1 "$load" source ${to[$1]} "$TRAFFIC_SECONDS" 0
    rate=$(jq '.bytes / .seconds / 1e6' <<<"$out")
    cost=$(jq ".bytes as \$bytes | $busy * 1e9 / \$bytes" <<<"$out") # milliseconds for a megabyte
}
part_tcp() {
    tcp redirected # ARP, caches
    tcp plain
    rounds tcp plain redirected socket
    printf '%-24s %10s %16s %22s\n' 'TCP' 'MB/s' 'cpu 1, ms/MB' 'cpu 1, share of time'
    printf '%-24s %10.0f %16.3f %22.2f\n' \
        'plain, forwarded' "$(of_rounds tcp '$1')" "$(of_rounds tcp '$2')" "$(of_rounds tcp '$3')" \
        'redirected, to the proxy' "$(of_rounds tcp '$4')" "$(of_rounds tcp '$5')" "$(of_rounds tcp '$6')" \
        'plain, to a socket' "$(of_rounds tcp '$7')" "$(of_rounds tcp '$8')" "$(of_rounds tcp '$9')"
    figure 'throughput, redirected to forwarded' "$(of_rounds tcp '$4 / $1')" '>= 0.9'
    figure 'processor time for a megabyte, redirected to forwarded' "$(of_rounds tcp '$5 / $2')" '<= 1.3'
    printf '%-64s %10s\n' 'throughput, redirected to a socket of the appliance' "$(of_rounds tcp '$4 / $7')" \
        'processor time for a megabyte, redirected to a socket' "$(of_rounds tcp '$5 / $8')"
}

send_small() { # plain|redirected FLOWS RATE SECONDS: sets sent and delivered
    local -A to=([plain]=10.0.0.50 [redirected]=10.2.0.2)
    local before
    before=$(sent_by_a1)
    measure on 1 c1 "$load" packets eth0 "$mac" "${to[$1]}" "${@:2}"
    sleep 0.2
    sent=$(jq .sent <<<"$out")
    delivered=$(($(sent_by_a1) - before))
}
flows=4096
small() { # plain|redirected
    send_small "$1" $flows 0 "$TRAFFIC_SECONDS"
    rate=$(jq "$delivered / .seconds / 1000" <<<"$out")
    cost=$(awk "BEGIN { print $busy * 1e6 / $delivered }")
}
part_packets() {
    rest_is forward
    steer - v-a1 here
    printf '%-24s %10s %16s %22s\n' '64-byte packets' '1000/s' 'cpu 1, us each' 'cpu 1, share of time'
    for flows in 1 4096; do
        rounds small plain redirected
        printf '%-24s %10.0f %16.2f %22.2f\n' "plain, $flows flows" "$(of_rounds small '$1')" "$(of_rounds small '$2')" \
            "$(of_rounds small '$3')" "redirected, $flows flows" "$(of_rounds small '$4')" "$(of_rounds small '$5')" \
            "$(of_rounds small '$6')"
        figure "packets a second of $flows flows, redirected to plain" "$(of_rounds small '$4 / $1')" '>= 0.5'
    done
    local half
    half=$(of_rounds small '$4 * 500')
    send_small redirected 4096 "$half" "$TRAFFIC_LOSS_SECONDS"
    figure "lost of $sent packets at ${half%.*} a second in $TRAFFIC_LOSS_SECONDS s" $((sent - delivered)) '<= 0'
    [ "$sent" = "$delivered" ] || lab_manage a1 walk /qv/tunneld | jq -c '.[] | select((.value // 0) != 0) | [.name, .value]' |
        grep -E 'refused|packets'
    rest_is return
}

# The router does what a BPF program cannot: it fragments, puts together and takes back what is returned.
part_upload() {
    on 0 r1 "$load" router 10.0.0.1 10.0.0.101 gre0 >"$LAB/gre0.out" 2>&1 &
    lab_wait_line 5 ready "$LAB/gre0.out" || die "no router"
    lab_in r1 bash -c 'ip link set gre0 up mtu 1500 && ip route replace default dev gre0 table 90'
    measure on 0 c1 "$load" source 10.2.0.2 8000 0 100000000
    echo "upload: $out"
    figure 'upload of 100 MB through the appliance, longest pause (s)' "$(jq .longest_pause <<<"$out")" '< 1'
    lab_in r1 ip route replace default via 10.0.0.101 dev eth0 table 90
    figure 'its segment size' "$(jq .mss <<<"$out")" '>= 1448'
}

# The flow's bucket is another appliance's: its packets are given to the kernel as what is to be passed on, and find
# their socket.
protected() { # off|on
    local -A times=([off]=0 [on]=300)
    lab_in a1 "$WCCP_BIN/mgmtctl" protection time "${times[$1]}" >/dev/null || die "not configured"
    sleep 2
    tcp redirected
}
part_protection() {
    lab_appliance a0 10.0.0.90
    lab_gateway a0 10.0.0.1
    lab_appliance_start a0 "$(lab_group 51 10.0.0.1)"
    lab_wait 60 '.[] | select(.name == "/qv/tunneld/protection/state/group/51/slots") | .value == 128' \
        lab_manage a1 walk /qv/tunneld/protection/state || die "no other appliance"
    protected on
    rounds protected off on
    figure 'throughput, flow protection on to off' "$(of_rounds protected '$4 / $1')" '>= 0.97'
    figure 'processor time for a megabyte, flow protection on to off' "$(of_rounds protected '$5 / $2')" '<= 1.05'
    lab_end a0 || die "the other appliance does not end in order"
}
part_orders() {
    local times=$LAB/orders i
    lab_alone "$WCCP_BIN/tunneld_timed" orders "$WCCP_BIN/tunneld" 50 0 >"$times" || die 'orders failed'
    figure 'tunnel ordered to first packet, one after the other: median (ms)' "$(awk '{ print $2 }' "$times" | median)" '< 50'
    figure '                                                     maximum (ms)' "$(awk '{ print $2 }' "$times" | sort -g | tail -n 1)" '< 50'
    : >"$times"
    local waiting=()
    for i in $(seq 50); do # side by side, each in an appliance of its own, at moments of its own
        lab_alone "$WCCP_BIN/tunneld_timed" orders "$WCCP_BIN/tunneld" 1 "$((TRAFFIC_QUIET + i / 5)).$((RANDOM % 900 + 100))" \
            >>"$times" & waiting+=($!)
        sleep 0.2 # not all start at once
    done
    wait "${waiting[@]}"
    [ "$(wc -l <"$times")" = 50 ] || die 'orders after quiet failed'
    figure 'tunnel ordered to first packet, after a quiet minute: median (ms)' "$(awk '{ print $2 }' "$times" | median)" '< 50'
    figure '                                                      maximum (ms)' "$(awk '{ print $2 }' "$times" | sort -g | tail -n 1)" '< 50'
}
lab_alone() { "$LAB_HOME/in-appliance" "$@"; }

part_start() {
    lab_alone "$WCCP_BIN/tunneld_timed" reconcile user 32 256 >"$LAB/start" || die 'start failed'
    local what ms
    while IFS=: read -r what ms; do
        figure "32 tunnels, 256 intercepts $what (ms)" "${ms% ms}" '< 2000'
    done <"$LAB/start"
}

switches() { awk '/^voluntary_ctxt_switches/ { sum += $2 } END { print sum }' "/proc/$tunneld"/task/*/status; }
part_idle() {
    local before
    sleep "$TRAFFIC_QUIET"
    before=$(switches)
    sleep 10
    figure 'wake-ups of tunneld in a second, one intercept, quiet' "$(awk "BEGIN { print ($(switches) - $before) / 10 }")" '<= 20'
}

for part in "${parts[@]}"; do
    case $part in tcp | packets | upload | idle | protection) [ -n "${tunneld-}" ] || set_up ;; esac
    "part_$part"
done
if [ -n "${tunneld-}" ]; then
    lab_end a1 || die "the appliance does not end in order"
fi
exit $missed
