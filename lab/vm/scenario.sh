#!/bin/bash
# Of the kernel's data plane, what only a kernel with GRE shows and the cases of traffic do not: its speed beside plain
# forwarding, the start with many tunnels and intercepts, the end of wccpd and of the whole machine.
#   scenario.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]

figure() { # TEXT : a measured value, on the console and with the results
    echo "        $*" | tee -a "$LAB_TOP/results/figures" >/dev/console
}

# Uploads to a server in the appliance: addressed to it, and by GRE as intercepted flows. The router's side is a GRE link
# of its kernel, since the simulated router would be slower than either.
case_throughput() {
    start --forward gre --return gre
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    lab_start a1 sink "$WCCP_BIN/wccp_router" web --port 3129
    lab_appliance_start a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    ready 51 a1
    lab_in r1 bash -ec '
        ip link add gre1 type gre local 10.0.0.1 remote 10.0.0.101 ttl 64 nopmtudisc ignore-df
        ip link set gre1 mtu 1500 up
        ip route add default dev gre1 table 50
        ip rule add iif c1 preference 50 lookup 50
        ip rule add iif c1 to 10.0.0.0/24 preference 49 lookup main' || die "no GRE in the router"
    local i ratios=() plain carried median
    upload plain 10.0.0.101 3129 >/dev/null
    upload carried 10.2.0.2 80 >/dev/null
    for ((i = 0; i < 15; i++)); do # a fixed number: stopping at a good ratio would favour it
        upload plain 10.0.0.101 3129
        upload carried 10.2.0.2 80
        ratios+=("$(jq -n "$carried / $plain")")
    done
    median=$(printf '%s\n' "${ratios[@]}" | jq -s 'sort | .[length / 2 | floor]')
    figure "throughput by GRE to the proxy: $(jq -n "$median * 100 | round / 100") of plain forwarding (median of ${#ratios[@]} pairs)"
    [ "$(jq -n "$median >= 0.9")" = true ] || die "too slow: ${ratios[*]}"
    # All of it was carried, and none of it given back.
    state_is a1 10 tunnel ".[] | .bytes_in >= 300000000 and .packets_out == 0"
    lab_stop a1 sink
    finish a1
}
upload() { # VARIABLE SERVER PORT : sets it to bytes per second
    local out
    out=$(lab_in c1 "$WCCP_BIN/wccp_router" fetch "$2" --port "$3" --upload 20000000 --timeout 20)
    [ "$(jq .failed <<<"$out")" = 0 ] || die "upload to $2: $out"
    printf -v "$1" %s "$(jq '.bytes / .seconds' <<<"$out")"
}

# wccpd killed: its tunnels are those of the next one. Nothing is twice afterwards.
case_wccpd_killed() {
    start --forward gre --return gre
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    lab_proxy a1
    lab_write_config a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    supervised
    ready 51 a1
    fetches "$(by a1)" --count 4
    local before
    before=$(kept_in_kernel)
    lab_in a1 pkill -KILL -x wccpd
    fetches_within 3 ".failed == 0" --count 4
    lab_wait_event 20 a1 '^process wccpd: .*starts again' || die "not seen to end"
    says a1 60 'created GRE tunnel id'
    ready 51 a1
    fetches "$(by a1)" --count 4
    fetches "$direct" --count 4 --port 8080
    [ "$(kept_in_kernel)" = "$before" ] || die "not the same: $(diff <(echo "$before") <(kept_in_kernel))"
    lab_stop a1 mgmtd || die "mgmtd ended with $?"
    [ -z "$(kept_in_kernel)" ] || die "left: $(kept_in_kernel)"
}
kept_in_kernel() { # without what counts
    lab_in a1 bash -c '
        ip -o -d link show group 2048 | cut -d " " -f 2-
        ip rule | grep -E "lookup 204[0-9]{3}"
        ip route show table all proto 204 | sort
        nft list table ip tunneld 2>/dev/null | sed "s/packets [0-9]* bytes [0-9]*//"'
}

# 32 tunnels, and an intercept for each of 256 groups: how long a tunneld takes after its start until all of it is in a
# kernel from which rules and routes have gone. The links stay, as a killed tunneld leaves them.
case_many() {
    local i routers text=''
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
    lab_wait 120 '[.[] | select(.oper // "" | test("ACTIVE|STANDBY|DESIG"))] | length == 256' lab_state a1 >/dev/null || die "groups"
    lab_wait 20 '. == [32, 256]' kept_counts || die "not in the kernel"
    kill -KILL "$(lab_pid a1 tunneld)"
    lab_in a1 bash -c 'nft delete table ip tunneld; ip route flush table all proto 204
        while ip rule del preference 2048; do :; done 2>/dev/null'
    local began=${EPOCHREALTIME/./} took
    lab_start a1 tunneld tunneld --plane kernel
    lab_wait 20 '. == [32, 256]' kept_counts || die "not in the kernel"
    took=$(((${EPOCHREALTIME/./} - began) / 1000))
    figure "32 tunnels and 256 intercepts: in the kernel $took ms after the start of tunneld"
    [ $took -le 2000 ] || die "after $took ms"
}
kept_counts() { # tables of links with a route; intercepts that hand to the proxy
    lab_in a1 bash -c 'echo "[$(ip route show table all proto 204 | grep -c wccp), $(nft list table ip tunneld | grep -c "tproxy")]"'
}

# What mgmtctl has set is what the machine comes up with after a reboot.
saved() {
    start --forward gre --return gre
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    mkdir -p "$LAB_TOP/state/rvl"
    cp -n "$LAB_TOP"/packaging/*.conf "$LAB_TOP/state/rvl/"
    lab_in a1 mount --bind "$LAB_TOP/state/rvl" /etc/opt/rvl || die "no disk for the configuration"
    lab_proxy a1
}
case_before_reboot() {
    saved
    lab_mgmtd_start a1
    lab_manage a1 group add 51 interface eth0 router 10.0.0.1 || die "no group"
    lab_manage a1 intercept add 51 port 80 to 3129 || die "no intercept"
    lab_stop a1 mgmtd
    supervised
    ready 51 a1
    fetches "$(by a1)" --count 4
}
case_after_reboot() {
    saved
    supervised
    ready 51 a1
    fetches "$(by a1)" --count 4
    fetches "$direct" --count 4 --port 8080
    lab_stop a1 mgmtd || die "mgmtd ended with $?"
    [ -z "$(kept_in_kernel)" ] || die "left: $(kept_in_kernel)"
}

# The cases use what those of traffic are made of.
# shellcheck source=../../tests/scenario_traffic.sh
source "$(dirname "$0")/../../tests/scenario_traffic.sh"
