#!/bin/bash
# Cases of the data plane `kernel`, for a kernel with GRE, that tests/scenario_traffic.sh does not have: its speed
# compared with plain forwarding, the start with many tunnels and intercepts, the end of wccpd and of the whole machine.
#   scenario.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]

figure() { # TEXT : a measured value, on the console and with the results
    echo "        $*" | tee -a "$LAB_TOP/results/figures" >/dev/console
}

# A server in the appliance, which flows reach by GRE. The router's side is a GRE link of its kernel, which the simulated
# router would slow down.
sink_by_gre() {
    start_traffic --forward gre --return gre
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    lab_start a1 sink "$WCCP_BIN/wccp_router" web --port 3129
    lab_appliance_start a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    wait_ready 51 a1
    lab_in r1 bash -ec '
        ip link add gre1 type gre local 10.0.0.1 remote 10.0.0.101 ttl 64 nopmtudisc ignore-df
        echo 1 >/proc/sys/net/ipv6/conf/gre1/disable_ipv6
        ip link set gre1 mtu 1500 up
        ip route add default dev gre1 table 50
        ip rule add iif c1 preference 50 lookup 50
        ip rule add iif c1 to 10.0.0.0/24 preference 49 lookup main' || die "no GRE in the router"
}
# A server beside the appliance, to which the appliance forwards the router's packets.
server_by_forwarding() {
    lab_bare s2 && lab_plug s2 "${LAB_INIT[s2]}" 10.0.0.50
    lab_gateway s2 10.0.0.101
    nsenter -t "${LAB_INIT[s2]}" --net "$WCCP_BIN/wccp_router" web --port 3129 >"$LAB/s2.out" 2>&1 &
    LAB_PID[s2/web]=$!
    lab_in r1 bash -ec 'echo 0 >/proc/sys/net/ipv4/conf/eth0/send_redirects
        ip route add default via 10.0.0.101 dev eth0 table 51
        ip rule add iif c1 to 10.0.0.50 preference 48 lookup 51' || die "the router does not send it to the appliance"
    lab_in a1 bash -ec 'cd /proc/sys/net/ipv4/conf
        for name in all eth0; do echo 0 >$name/send_redirects; done; echo 1 >eth0/forwarding' || die "a1 does not forward"
}
median_of() { # VALUE... , rounded
    printf '%s\n' "$@" | jq -s 'sort | .[length / 2 | floor] * 100 | round / 100'
}
# Uploads as intercepted flows, compared with the same ones forwarded by the appliance, and addressed to its socket.
case_throughput() {
    sink_by_gre
    server_by_forwarding
    local i ratios=() direct=() plain carried socket
    upload plain 10.0.0.50 3129 >/dev/null
    upload carried 10.2.0.2 80 >/dev/null
    for ((i = 0; i < 15; i++)); do # a fixed number: stopping at a good ratio would favour it
        upload plain 10.0.0.50 3129
        upload carried 10.2.0.2 80
        upload socket 10.0.0.101 3129
        ratios+=("$(jq -n "$carried / $plain")")
        direct+=("$(jq -n "$carried / $socket")")
    done
    figure "throughput by GRE to the proxy: $(median_of "${ratios[@]}") of plain forwarding," \
        "$(median_of "${direct[@]}") of delivery to a socket (medians of ${#ratios[@]} pairs)"
    [ "$(jq -n "$(median_of "${ratios[@]}") >= 0.9")" = true ] || die "too slow: ${ratios[*]}"
    # All of it was delivered, and none of it returned.
    tunneld_is a1 10 tunnel ".[] | .bytes_in >= 300000000 and .packets_out == 0"
    finish a1
}
upload() { # VARIABLE SERVER PORT : sets it to bytes per second
    local out
    out=$(lab_in c1 "$WCCP_BIN/wccp_router" fetch "$2" --port "$3" --upload 20000000 --timeout 20)
    [ "$(jq .failed <<<"$out")" = 0 ] || die "upload to $2: $out"
    printf -v "$1" %s "$(jq '.bytes / .seconds' <<<"$out")"
}

# Large TCP segments, which the router's kernel leaves to the receiver to split: a user-space data plane gets them whole.
case_large() {
    sink_by_gre
    local size carried
    upload carried 10.2.0.2 80
    size=$(lab_in a1 ip -j -s link show eth0 | jq '.[0].stats64.rx | .bytes / .packets | round')
    figure "uploaded in packets of $size bytes, $(jq -n "$carried / 1e6 | round") MB/s"
    [ "$size" -gt 3000 ] || die "none of them is large"
    tunneld_is a1 10 tunnel '.[] | .bytes_in > 20000000 and ([.refused[]?] | add // 0) == 0'
    finish a1
}

# The life of an appliance: each form of GRE, a bypass, its proxy down and up again, each of its programs killed, and a
# reboot. The state of the kernel is the same after each loss, and flows continue.
case_life() {
    start_traffic --forward gre --return gre
    saved
    lab_write_config a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80 interval=1 fall=2 rise=1 leave_after=3)"
    lab_supervise a1
    wait_role a1 60 51 ACTIVE
    wait_ready 51 a1
    local form before wccpd
    for form in plain ip redirect; do
        lab_ctl r1 gre $form >/dev/null
        fetches "$(by a1)" --count 4
        fetches "$direct" --count 4 --port 8080
    done
    lab_manage a1 bypass add 10.1.0.130/31 >/dev/null || die "no bypass"
    fetches_within 5 "$bypassed" --count 4 --sources 4
    before=$(kept_in_kernel)

    lab_stop a1 proxy KILL
    fetches "$direct" --count 4
    router_is r1 30 51 '$g.appliances == []'
    fetches "$direct" --count 4
    lab_proxy a1
    wait_ready 51 a1
    fetches_within 5 "$(by a1)" --count 2

    wccpd=$(lab_in a1 pgrep -x wccpd)
    lab_in a1 pkill -KILL -x tunneld
    fetches_within 3 "$(by a1)" --count 2
    same_in_kernel "$before"
    [ "$(lab_in a1 pgrep -x wccpd)" = "$wccpd" ] || die "wccpd has gone"

    lab_in a1 pkill -KILL -x wccpd
    fetches_within 3 '.failed == 0' --count 4
    lab_wait_event 20 a1 '^process wccpd: .*starts again' || die "not seen to end"
    wait_log a1 60 'created GRE tunnel id'
    wait_ready 51 a1
    fetches "$(by a1)" --count 2
    same_in_kernel "$before"

    lab_in a1 pkill -KILL -x mgmtd
    lab_wait_exit 5 a1 mgmtd
    fetches_within 3 '.failed == 0' --count 2
    lab_supervise a1
    wait_role a1 60 51 ACTIVE
    wait_ready 51 a1
    fetches "$bypassed" --count 4 --sources 4
    same_in_kernel "$before"
    sync
    : >"$LAB_TOP/state/reboot"
}
bypassed='.failed == 0 and .proxies == {"": 2, "a1": 2}'
case_after_reboot() {
    start_traffic --forward gre --return gre
    saved
    lab_supervise a1
    wait_role a1 60 51 ACTIVE
    wait_ready 51 a1
    fetches "$bypassed" --count 4 --sources 4
    fetches "$direct" --count 4 --port 8080
    lab_stop a1 mgmtd || die "mgmtd ended with $?"
    [ -z "$(kept_in_kernel)" ] || die "left: $(kept_in_kernel)"
}
# An appliance that keeps its configuration on the disk.
saved() {
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    mkdir -p "$LAB_TOP/state/rvl"
    cp -n "$LAB_TOP"/packaging/*.conf "$LAB_TOP/state/rvl/"
    lab_in a1 mount --bind "$LAB_TOP/state/rvl" /etc/opt/rvl || die "no disk for the configuration"
    lab_proxy a1
}
same_in_kernel() { # AS IT WAS
    local i now
    for ((i = 0; i < 20; i++)); do
        now=$(kept_in_kernel)
        [ "$now" != "$1" ] || return 0
        sleep 0.5
    done
    die "not the same: $(diff <(echo "$1") <(echo "$now"))"
}
kept_in_kernel() { # without what counts, and in no order: it depends on what was there before
    lab_in a1 bash -c '
        ip -o -d link show group 2048 | cut -d " " -f 2-
        ip rule | grep -E "lookup 204[0-9]{3}" | sort
        ip route show table all proto 204 | sort
        nft list table ip tunneld 2>/dev/null | sed "s/packets [0-9]* bytes [0-9]*//" | sort'
}

# 32 tunnels, and an intercept for each of 256 groups: how long a tunneld takes after its start to restore all rules and
# routes. The links are already there, as a killed tunneld leaves them.
case_many() {
    local i routers text='' LAB_LOG_LEVEL=notice
    lab_router r1 10.0.0.{1..32} -- --forward gre --return gre
    lab_router r2 10.0.0.40 -- --forward l2 --return l2
    for ((i = 0; i < 256; i++)); do
        routers=(10.0.0.40)
        [ $i -ge 4 ] || mapfile -t routers < <(seq -f 10.0.0.%g $((8 * i + 1)) $((8 * i + 8)))
        text+=$(lab_group $i "${routers[@]}"; lab_intercept $i "ports=80 $((1000 + i))-$((2000 + i))" interval=3600)$'\n'
    done
    lab_appliance a1 10.0.0.101
    lab_proxy a1
    lab_appliance_start a1 "$text"
    many_in_kernel 150
    kill -KILL "$(lab_pid a1 tunneld)"
    lab_in a1 bash -c 'nft delete table ip tunneld; ip route flush table all proto 204
        while ip rule del preference 2048; do :; done 2>/dev/null'
    local began=${EPOCHREALTIME/./} took
    lab_tunneld_start a1
    many_in_kernel 20
    took=$(((${EPOCHREALTIME/./} - began) / 1000))
    figure "32 tunnels and 256 intercepts: in the kernel $took ms after the start of tunneld"
    [ "$(lab_in a1 nft list table ip tunneld | grep -c 'tproxy to :')" = 256 ] || die "not all intercepts"
    [ $took -le 2000 ] || die "after $took ms"
}
# The rules are added in one transaction: it is enough to find those of the last group. Listing all of them takes long.
many_in_kernel() { # SECONDS
    lab_in a1 timeout "$1" bash -c '
        until [ "$(ip route show table all proto 204 | grep -c wccp)" = 32 ] &&
            nft list chain ip tunneld group/255 2>/dev/null | grep -q tproxy; do sleep 0.1; done' || die "not in the kernel"
}

# The cases use the functions of tests/scenario_traffic.sh.
# shellcheck source=../../tests/scenario_traffic.sh
source "$(dirname "$0")/../../tests/scenario_traffic.sh"
