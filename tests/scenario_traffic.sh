#!/bin/bash
# Redirected traffic: a client behind the router fetches pages from a server, the router redirects the packets by its
# table, and the proxies of the appliances answer. Fetches succeed whatever fails.
#   scenario_traffic.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
#   LAB_KILLS   how often case_kills kills tunneld (default 5)
set -u
: "${LAB_SPEED:=4}" "${LAB_PLANE=}"
export LAB_SPEED LAB_PLANE
# shellcheck source=../lab/cases.sh
source "$(dirname "${BASH_SOURCE[0]}")/../lab/cases.sh"
lab_cases "$@"

# Creates router r1 between client c1, server s1 and the appliances. It redirects packets from c1, by group 51.
start_traffic() { # OPTIONS OF wccp_router...
    lab_router r1 10.0.0.1 -- --redirect c1=51 "$@"
    lab_client c1 r1
    lab_server s1 r1
}
# One appliance, which gets redirected packets and returns them by these methods.
start_one() { # FORWARD RETURN INTERCEPT_VALUES [OPTIONS OF wccp_router]...
    start_traffic --forward "$1" --return "$2" "${@:4}"
    # shellcheck disable=SC2086
    start_proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 $3)"
    wait_ready 51 a1
}
tunnel_show_has() { # NODE LINE
    lab_in "$1" "$WCCP_BIN/mgmtctl" tunnel show >"$LAB/shown"
    grep -q "$2" "$LAB/shown" || die "tunnel show has no line \"$2\": $(cat "$LAB/shown")"
}
is_configured() { # NAME VALUE : in group 51 of a1
    [ "$(lab_manage a1 get "/qv/wccpd/wccp/srv_grp/config/51/$1" | jq -r '[.. | .value? // empty][0]')" = "$2" ] || die "the configuration changed"
}
fetches() { # JQ [OPTIONS OF lab_fetch]
    local out
    out=$(lab_fetch c1 "${@:2}")
    jq -e "$1" <<<"$out" >/dev/null || { lab_ctl r1 traffic; die "fetches are not $1: $out"; } >&2
}
fetches_within() { # SECONDS JQ [OPTIONS OF lab_fetch]
    lab_wait "$1" "$2" eval "lab_fetch c1 --timeout $LAB_PATIENCE ${*:3} || true" || die "fetches"
}
# One group for packets from the clients, one for packets to them.
both_groups="$(lab_group 51 10.0.0.1 hash_src_ip=true)
$(lab_group 52 10.0.0.1 hash_src_ip=false hash_dst_ip=true)"
direct='.failed == 0 and (.proxies | keys == [""]) and (.peers | keys | all(startswith("10.1.0.")))'
by() { echo ".failed == 0 and (.proxies | keys == [\"$1\"])"; }
traffic_is() { # SECONDS JQ
    lab_wait "$1" "$2" lab_ctl r1 traffic || die "traffic of r1"
}

# While another group of the policy group has no router, new flows go to the server, and established ones stay with the
# proxy. The same while wccpd is not running.
case_roles() {
    start_traffic --forward gre --return gre
    lab_router r2 10.0.0.2
    start_proxied a1 10.0.0.101 '' '[/qv/wccpd/wccp/policy_grp/config/5]' name=blue "$(lab_group 51 10.0.0.1 policy_grp=5)" \
        "$(lab_group 52 10.0.0.2 policy_grp=5)" "$(lab_intercept 51 ports=80)"
    wait_ready 51 a1
    active_is() { tunneld_is a1 "$2" intercept ".[\"51\"].active == $1"; }
    active_is true 20
    lab_fetch c1 --size 1000 --requests 300 --pause 0.1 >"$LAB/kept" &
    local kept=$! i
    for i in 1 2; do
        lab_ctl r2 stop >/dev/null
        active_is false 30
        explains a1 5 51 standing-by
        fetches "$direct" --count 4
        lab_ctl r2 resume >/dev/null
        active_is true 30
        fetches "$(by a1)" --count 4
    done
    wait $kept
    jq -e "$(by a1)" "$LAB/kept" >/dev/null || die "the established connection: $(cat "$LAB/kept")"
    lab_stop a1 wccpd
    active_is false 5
    fetches "$direct" --count 4
    finish a1
}

# tunneld is killed repeatedly during transfers: each transfer completes or is reset, wccpd keeps running, and new fetches
# succeed.
case_kills() {
    start_traffic --forward gre --return gre
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    lab_proxy a1
    lab_write_config a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    lab_supervise a1
    wait_ready 51 a1
    local wccpd i transfers results=$LAB/transfers
    wccpd=$(lab_in a1 pgrep -x wccpd)
    for ((i = 1; i <= ${LAB_KILLS-5}; i++)); do
        lab_fetch c1 --parallel 4 --count 4 --size 30000000 --timeout 15 >>"$results" &
        transfers=($!)
        lab_fetch c1 --parallel 4 --count 4 --upload 30000000 --timeout 15 --port 8080 >>"$results" &
        transfers+=($!)
        sleep "0.$((RANDOM % 90 + 10))"
        lab_in a1 pkill -KILL -x tunneld || die "cannot kill tunneld"
        fetches_within 3 "$(by a1)"
        wait "${transfers[@]}"
    done
    jq -se 'length > 0 and all(.[]; .failures | keys - ["reset", "closed"] == [])' "$results" >/dev/null || die "transfers: $(cat "$results")"
    [ "$(lab_in a1 pgrep -x wccpd)" = "$wccpd" ] || die "wccpd was restarted"
    # A link that somebody else deletes is created again.
    lab_in a1 ip link delete wccp0 || die "cannot delete the link"
    fetches_within 12 "$(by a1)"
    # All programs are killed at once; the next ones take over their links and rules.
    lab_in a1 pkill -KILL -x 'mgmtd|tunneld|wccpd'
    lab_wait_exit 5 a1 mgmtd
    lab_supervise a1
    wait_ready 51 a1
    fetches "$(by a1)" --count 4
    lab_stop a1 mgmtd || die "mgmtd exited with $?"
    LAB_KILLED[a1]+='|uds-client-(wccpd|tunneld)-[0-9]+$'
    finish a1
}

# Two appliances share the flows by their weights. Bypassed addresses and other ports reach the server from the client's
# address. Full-size packets pass both ways.
case_gre_hash() {
    start_traffic --forward gre --return gre
    local wanted
    wanted=$(lab_intercept 51 'ports=80 8000-8010' bypass=10.1.0.224/28)
    start_proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1 weight=50)" "$wanted"
    start_proxied a2 10.0.0.102 '' "$(lab_group 51 10.0.0.1 weight=100)" "$wanted"
    wait_ready 51 a1 a2
    lab_ctl r1 traffic reset >/dev/null
    fetches '.failed == 0 and .proxies[""] == 16 and (.proxies | .a1 > 25 and .a1 < 50 and .a1 + .a2 == 96) and
        (.peers | has("10.1.0.224") and has("10.1.0.239") and (has("10.1.0.223") | not))' --count 112 --sources 112
    fetches "$direct" --count 8 --sources 8 --port 8080
    # A proxy announces a segment size that fits into the tunnel; packets to the server are fragmented.
    fetches '.failed == 0 and .slowest < 10' --upload 5000000 --count 4 --sources 4
    traffic_is 5 '.lost == 0 and .fragmented == 0 and .refused_returns == 0 and .appliances["10.0.0.101"].flows > 25'
    fetches "$direct and .slowest < 10" --upload 5000000 --count 4 --sources 4 --port 8080
    traffic_is 5 '.lost == 0 and .fragmented > 10000 and .refused_returns == 0'
    local sent
    sent=$(lab_ctl r1 traffic | jq '.appliances["10.0.0.101"]')
    tunneld_is a1 10 tunnel "(.[] | .packets_in == $(jq .packets <<<"$sent") and .packets_out == $(jq .returned <<<"$sent"))"
    tunneld_is a2 10 intercept '.["51"] | .to_proxy > 50 and .bypassed > 0 and .returned > 1000'
    finish a1 a2
}

# The three GRE formats in which routers redirect.
case_gre_formats() {
    start_traffic --forward gre,l2 --return gre,l2
    start_proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1 encap=gre)" "$(lab_intercept 51 ports=80)"
    wait_ready 51 a1
    local form
    for form in plain ip redirect; do
        lab_ctl r1 gre $form >/dev/null
        fetches "$(by a1)" --count 4 --sources 4
        fetches "$direct" --count 4 --sources 4 --port 8080
    done
    finish a1
}

# L2 and a mask, and the values of `rest` for other ports.
case_l2_mask() {
    start_traffic --forward l2 --return l2
    local group=(10.0.0.1 assign_method=mask mask_src_ip=0x3f mask_dst_ip=0)
    start_proxied a1 10.0.0.101 '' "$(lab_group 51 "${group[@]}" weight=50)" "$(lab_intercept 51 ports=80)"
    start_proxied a2 10.0.0.102 '' "$(lab_group 51 "${group[@]}" weight=100)" "$(lab_intercept 51 ports=80)"
    wait_ready 51 a1 a2
    fetches '.failed == 0 and (.proxies | .a1 == 21 and .a2 == 43)' --count 64 --sources 64
    fetches "$direct" --count 64 --sources 64 --port 8080
    fetches '.failed == 0' --upload 5000000
    configure a1 "$(lab_group 51 "${group[@]}" weight=50)" "$(lab_intercept 51 ports=80 rest=drop)"
    configure a2 "$(lab_group 51 "${group[@]}" weight=100)" "$(lab_intercept 51 ports=80 rest=forward)"
    fetches_within 5 '.fetched == 43 and .failed == 21' --count 64 --sources 64 --parallel 64 --port 8080
    finish a1 a2
}
case_l2_returned_by_gre() {
    start_one l2 gre ports=80
    fetches "$(by a1)" --count 8 --sources 8
    fetches "$direct" --count 8 --sources 8 --port 8080
    traffic_is 5 '.appliances["10.0.0.101"].returned > 8'
    finish a1
}

# While the proxy is down, its flows go to the server, or are dropped. After a while the group leaves its routers, and
# comes back when the proxy does.
case_proxy_down() {
    local quick=(ports=80 interval=1 fall=2 rise=1)
    start_one gre gre "${quick[*]} leave_after=20"
    fetches "$(by a1)" --count 4
    lab_stop a1 proxy KILL
    fetches "$direct" --count 8
    tunneld_is a1 10 intercept '.["51"].proxy == "down"'
    fetches "$direct" --count 8
    router_is r1 30 51 '$g.appliances == []'
    tunneld_is a1 5 intercept '.["51"].left'
    explains a1 5 51 left 'connection refused'
    is_configured admin up
    fetches "$direct" --count 8
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 "${quick[@]}" leave_after=0)"
    router_is r1 30 51 '$g.appliances != []'
    tunneld_is a1 5 intercept '.["51"].left | not'
    explains a1 5 51 proxy-down 'connection refused'
    fetches "$direct" --count 8
    lab_proxy a1
    wait_ready 51 a1
    fetches_within 5 "$(by a1)" --count 4
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 "${quick[@]}" leave_after=0 down=drop)"
    lab_stop a1 proxy KILL
    tunneld_is a1 10 intercept '.["51"].proxy == "down"'
    fetches '.fetched == 0 and .failures == {"connect timeout": 4}' --count 4 --parallel 4 --timeout 1
    lab_proxy a1
    fetches_within 10 "$(by a1)" --count 4
    finish a1
}

# New connections go to the server while established ones continue: with a limit, during a drain, and while wccpd is
# killed and started again. The weight grows in steps, and the link is removed last.
case_leaving() {
    local long drain
    start_one gre gre 'ports=80 slow_start=12'
    lab_wait_event 20 a1 'announces 100 % of its weight' || die "no end of the slow start"
    [ "$(lab_events a1 | grep -o 'announces [0-9]*' | tr -dc '0-9\n' | xargs)" = '20 40 60 80 100' ] || die "$(lab_events a1)"
    begin_long
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80 limit=7)"
    tunneld_is a1 5 intercept '.["51"].overloaded'
    explains a1 5 51 overload '8 flows'
    [ "$(lab_manage a1 alarms | jq -c 'map(.name)')" = '["overload"]' ] || die "$(lab_manage a1 alarms)"
    fetches "$direct" --count 4
    tunneld_is a1 5 intercept '.["51"].overload >= 4'
    end_long
    tunneld_is a1 5 intercept '.["51"].overloaded | not'
    fetches "$(by a1)" --count 4
    lab_manage a1 alarms | jq -e '. == []' >/dev/null || die "$(lab_manage a1 alarms)"
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"

    begin_long
    lab_manage a1 drain 51 for 30 wait >"$LAB/drained" &
    drain=$!
    router_is r1 10 51 '$g.appliances[0].weight == 0'
    explains a1 5 51 drain '8 flows left'
    lab_manage a1 drain show | jq -e '.drains == [{group: 51, state: "draining", flows: 8, until: .drains[0].until}]' >/dev/null || die "$(lab_manage a1 drain show)"
    fetches "$direct" --count 4
    end_long
    wait $drain || die "drain: $(cat "$LAB/drained")"
    router_is r1 10 51 '$g.appliances == []'
    fetches "$direct" --count 4
    is_configured weight 100
    lab_manage a1 drain cancel >/dev/null || die "the drain was not cancelled"
    wait_ready 51 a1
    fetches "$(by a1)" --count 4

    begin_long
    lab_stop a1 wccpd KILL
    tunneld_is a1 5 intercept '.["51"].active | not'
    fetches "$direct" --count 4
    lab_wccpd_start a1
    wait_ready 51 a1
    fetches "$(by a1)" --count 4
    end_long
    [ "$(lab_in a1 ip -o link show group 2048 | wc -l)" = 1 ] || die "not the same link"

    lab_stop a1 wccpd || die "wccpd exited with $?"
    lab_sleep 2
    lab_in a1 ip link show wccp0 >/dev/null || die "the link is gone before the tunnel has lingered"
    fetches "$direct" --count 4
    lab_stop a1 tunneld || die "tunneld exited with $?"
    explains a1 5 null tunneld-absent
    ! lab_in a1 ip link show wccp0 >"$LAB/remains" 2>&1 || die "the link is left"
    finish a1
}
# Opens eight connections, each of which requests a page only in end_long.
begin_long() {
    rm -f "$LAB/ask"
    # shellcheck disable=SC2016
    lab_in c1 bash -c '
        for i in {1..8}; do exec {socket}<>/dev/tcp/10.2.0.2/80 || exit; sockets+=($socket); done
        until [ -e "$0/ask" ]; do sleep 0.1; done
        for socket in "${sockets[@]}"; do
            printf "GET / HTTP/1.0\r\n\r\n" >&"$socket"
            grep -qi "^x-proxy: a1" <&"$socket" || exit
        done' "$LAB" 2>"$LAB/long" &
    long=$!
    tunneld_is a1 5 intercept '.["51"].flows == 8'
}
end_long() {
    touch "$LAB/ask"
    wait "$long" || die "long connections: $(cat "$LAB/long")"
}

# A router that redirects the proxy's own requests as well: they reach the server, and `tunnel show` reports it. The same
# if the proxy uses the client's addresses.
case_own_traffic() {
    start_traffic --forward gre --return gre --redirect eth0=51 --redirect s1=52
    start_proxied a1 10.0.0.101 "${1-}" "$both_groups" "$(lab_intercept 51 ports=80)"
    wait_ready 51 a1
    wait_ready 52 a1
    fetches "$(by a1)" --count 32 --sources 32
    tunneld_is a1 10 tunnel '[.[].own] | add >= 32'
    tunnel_show_has a1 "the router redirects this appliance's own traffic"
    explains a1 5 null own-traffic
    finish a1
}
case_own_spoofed() {
    case_own_traffic keep
}

# The proxies use the clients' addresses; a second group takes the server's answers to the right proxy.
case_spoofed() {
    start_traffic --forward gre --return gre --redirect s1=52
    local node
    for node in 1 2; do
        start_proxied a$node 10.0.0.10$node keep "$both_groups" "$(lab_intercept 51 ports=80)"
    done
    wait_ready 51 a1 a2
    wait_ready 52 a1 a2
    fetches '.failed == 0 and (.proxies | .a1 > 16 and .a2 > 16) and (.peers | length == 64 and (keys | all(startswith("10.1.0."))))' \
        --count 64 --sources 64 --size 100000
    fetches '.failed == 0' --upload 5000000 --count 2 --sources 2
    fetches "$direct" --count 16 --sources 16 --port 8080
    finish a1 a2
}

# The router sends from the address of another interface: the packets are refused, and counted by that address, until
# `tunnel accept`.
case_accept() {
    start_one gre gre ports=80 --gre-source 10.1.0.1
    fetches '.fetched == 0' --timeout 1
    tunneld_is a1 10 plane '.refused_source["10.1.0.1"] >= 1'
    tunnel_show_has a1 'refused source 10\.1\.0\.1: mgmtctl tunnel accept 10\.1\.0\.1'
    explains a1 5 null refused-source 10.1.0.1
    lab_manage a1 tunnel accept 10.1.0.1 >/dev/null || die "tunnel accept failed"
    fetches_within 5 "$(by a1)" --count 4
    fetches "$direct" --count 4 --port 8080
    finish a1
}

lab_case
