#!/bin/bash
# Real flows: a client behind the router fetches pages of a server, the router redirects them by its table, and the
# proxies of the appliances answer. Whatever fails, fetches go on.
#   scenario_traffic.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
#   LAB_KILLS   how often `kills` kills tunneld (default 5)
set -u
: "${LAB_SPEED:=4}" "${LAB_PLANE=}"
export LAB_SPEED LAB_PLANE
# shellcheck source=../lab/cases.sh
source "$(dirname "${BASH_SOURCE[0]}")/../lab/cases.sh"
lab_cases "$@"

# The router between client c1, server s1 and the appliances; c1 is redirected by group 51 unless the options say more.
start() { # OPTIONS OF wccp_router...
    lab_router r1 10.0.0.1 -- --redirect c1=51 "$@"
    lab_client c1 r1
    lab_server s1 r1
}
explained() { # NODE LINE
    lab_in "$1" "$WCCP_BIN/mgmtctl" tunnel show >"$LAB/explained"
    grep -q "$2" "$LAB/explained" || die "not explained: $(cat "$LAB/explained")"
}
fetches() { # JQ [OPTIONS OF lab_fetch]
    local out
    out=$(lab_fetch c1 "${@:2}")
    jq -e "$1" <<<"$out" >/dev/null || { lab_ctl r1 traffic; die "not $1: $out"; } >&2
}
fetches_within() { # SECONDS JQ [OPTIONS OF lab_fetch]
    lab_wait "$1" "$2" eval "lab_fetch c1 --timeout 1 ${*:3} || true" || die "no fetch"
}
# From the clients by their addresses, and back to them.
both_groups="$(lab_group 51 10.0.0.1 hash_src_ip=true)
$(lab_group 52 10.0.0.1 hash_src_ip=false hash_dst_ip=true)"
direct='.failed == 0 and (.proxies | keys == [""]) and (.peers | keys | all(startswith("10.1.0.")))'
by() { echo ".failed == 0 and (.proxies | keys == [\"$1\"])"; }
traffic_is() { # SECONDS JQ
    lab_wait "$1" "$2" lab_ctl r1 traffic || die "traffic of r1"
}

# Two appliances share the flows by their weights. What is bypassed, and ports that nobody wants, reach the server from
# the client's address. Full-size packets pass both ways.
case_gre_hash() {
    start --forward gre --return gre
    local wanted
    wanted=$(lab_intercept 51 'ports=80 8000-8010' bypass=10.1.0.224/28)
    proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1 weight=50)" "$wanted"
    proxied a2 10.0.0.102 '' "$(lab_group 51 10.0.0.1 weight=100)" "$wanted"
    ready 51 a1 a2
    lab_ctl r1 traffic reset >/dev/null
    fetches '.failed == 0 and .proxies[""] == 16 and (.proxies | .a1 > 25 and .a1 < 50 and .a1 + .a2 == 96) and
        (.peers | has("10.1.0.224") and has("10.1.0.239") and (has("10.1.0.223") | not))' --count 112 --sources 112
    fetches "$direct" --count 8 --sources 8 --port 8080
    # To a proxy packets come in one piece: it offers no more than fits. Those for the server come in two.
    fetches '.failed == 0 and .slowest < 10' --upload 5000000 --count 4 --sources 4
    traffic_is 5 '.lost == 0 and .fragmented == 0 and .refused_returns == 0 and .appliances["10.0.0.101"].flows > 25'
    fetches "$direct and .slowest < 10" --upload 5000000 --count 4 --sources 4 --port 8080
    traffic_is 5 '.lost == 0 and .fragmented > 10000 and .refused_returns == 0'
    local sent
    sent=$(lab_ctl r1 traffic | jq '.appliances["10.0.0.101"]')
    state_is a1 10 tunnel "(.[] | .packets_in == $(jq .packets <<<"$sent") and .packets_out == $(jq .returned <<<"$sent"))"
    state_is a2 10 intercept '.["51"] | .to_proxy > 50 and .bypassed > 0 and .returned > 1000'
    finish a1 a2
}

# Every form in which routers redirect, and packets that come back in a form of GRE or by L2.
case_forms() {
    start --forward gre,l2 --return gre,l2
    proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1 encap=gre)" "$(lab_intercept 51 ports=80)"
    ready 51 a1
    local form
    for form in plain ip redirect; do
        lab_ctl r1 gre $form >/dev/null
        fetches "$(by a1)" --count 4 --sources 4
        fetches "$direct" --count 4 --sources 4 --port 8080
    done
    finish a1
}

# By L2 and a mask; what `rest` says happens to the port that nobody wants.
case_l2_mask() {
    start --forward l2 --return l2
    local group="assign_method=mask mask_src_ip=0x3f mask_dst_ip=0"
    # shellcheck disable=SC2086
    proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1 weight=50 $group)" "$(lab_intercept 51 ports=80)"
    # shellcheck disable=SC2086
    proxied a2 10.0.0.102 '' "$(lab_group 51 10.0.0.1 weight=100 $group)" "$(lab_intercept 51 ports=80)"
    ready 51 a1 a2
    fetches '.failed == 0 and (.proxies | .a1 == 21 and .a2 == 43)' --count 64 --sources 64
    fetches "$direct" --count 64 --sources 64 --port 8080
    fetches '.failed == 0' --upload 5000000
    # shellcheck disable=SC2086
    configure a1 "$(lab_group 51 10.0.0.1 weight=50 $group)" "$(lab_intercept 51 ports=80 rest=drop)"
    # shellcheck disable=SC2086
    configure a2 "$(lab_group 51 10.0.0.1 weight=100 $group)" "$(lab_intercept 51 ports=80 rest=forward)"
    fetches_within 5 '.fetched == 43 and .failed == 21' --count 64 --sources 64 --parallel 64 --port 8080
    finish a1 a2
}
case_l2_returned_by_gre() {
    start --forward l2 --return gre
    proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    ready 51 a1
    fetches "$(by a1)" --count 8 --sources 8
    fetches "$direct" --count 8 --sources 8 --port 8080
    traffic_is 5 '.appliances["10.0.0.101"].returned > 8'
    finish a1
}

# While the proxy is down its flows pass by it, or not at all; in time the group leaves its routers, and comes back with
# the proxy.
case_proxy_down() {
    start --forward gre --return gre
    local quick='ports=80 interval=1 fall=2 rise=1'
    # shellcheck disable=SC2086
    proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 "${quick%% *}" ${quick#* } leave_after=20)"
    ready 51 a1
    fetches "$(by a1)" --count 4
    lab_stop a1 proxy KILL
    fetches "$direct" --count 8
    state_is a1 10 intercept '.["51"].proxy == "down"'
    fetches "$direct" --count 8
    router_is r1 30 51 '$g.appliances == []'
    state_is a1 5 intercept '.["51"].left'
    [ "$(lab_manage a1 get /qv/wccpd/wccp/srv_grp/config/51/admin | jq -r '[.. | .value? // empty][0]')" = up ] || die "the configuration has changed"
    fetches "$direct" --count 8
    # shellcheck disable=SC2086
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 "${quick%% *}" ${quick#* } leave_after=0)"
    router_is r1 30 51 '$g.appliances != []'
    state_is a1 5 intercept '.["51"].left | not'
    fetches "$direct" --count 8
    lab_proxy a1
    ready 51 a1
    fetches_within 5 "$(by a1)" --count 4
    # shellcheck disable=SC2086
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80 ${quick#* } leave_after=0 down=drop)"
    lab_stop a1 proxy KILL
    state_is a1 10 intercept '.["51"].proxy == "down"'
    fetches '.fetched == 0 and .failures == {"connect timeout": 4}' --count 4 --parallel 4 --timeout 1
    lab_proxy a1
    fetches_within 10 "$(by a1)" --count 4
    finish a1
}

# New connections pass the appliance by, and those that have begun go on: with a limit, during a drain, and while wccpd is
# killed and started again. The weight comes in steps, and the link goes last of all.
case_leaving() {
    start --forward gre --return gre
    local long drain
    proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80 slow_start=12)"
    ready 51 a1
    lab_wait_event 20 a1 'announces 100 % of its weight' || die "no end of the slow start"
    [ "$(lab_events a1 | grep -o 'announces [0-9]*' | tr -dc '0-9\n' | xargs)" = '20 40 60 80 100' ] || die "$(lab_events a1)"
    begin_long
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80 limit=7)"
    state_is a1 5 intercept '.["51"].overloaded'
    lab_manage a1 alarms | jq -e 'length == 1 and .[0].name == "overload"' >/dev/null || die "$(lab_manage a1 alarms)"
    fetches "$direct" --count 4
    state_is a1 5 intercept '.["51"].overload >= 4'
    end_long
    state_is a1 5 intercept '.["51"].overloaded | not'
    fetches "$(by a1)" --count 4
    lab_manage a1 alarms | jq -e '. == []' >/dev/null || die "$(lab_manage a1 alarms)"
    configure a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"

    begin_long
    lab_manage a1 drain 51 for 30 wait >"$LAB/drained" &
    drain=$!
    router_is r1 10 51 '$g.appliances[0].weight == 0'
    lab_manage a1 drain show | jq -e '.drains == [{group: 51, state: "draining", flows: 8, until: .drains[0].until}]' >/dev/null || die "$(lab_manage a1 drain show)"
    fetches "$direct" --count 4
    end_long
    wait $drain || die "drained: $(cat "$LAB/drained")"
    router_is r1 10 51 '$g.appliances == []'
    fetches "$direct" --count 4
    [ "$(lab_manage a1 get /qv/wccpd/wccp/srv_grp/config/51/weight | jq -r '[.. | .value? // empty][0]')" = 100 ] || die "the configuration has changed"
    lab_manage a1 drain cancel >/dev/null || die "not cancelled"
    ready 51 a1
    fetches "$(by a1)" --count 4

    begin_long
    lab_stop a1 wccpd KILL
    state_is a1 5 intercept '.["51"].active | not'
    fetches "$direct" --count 4
    lab_wccpd_start a1
    ready 51 a1
    fetches "$(by a1)" --count 4
    end_long
    [ "$(lab_in a1 ip -o link show group 2048 | wc -l)" = 1 ] || die "not the same link"

    lab_stop a1 wccpd || die "wccpd: $?"
    lab_sleep 2
    lab_in a1 ip link show wccp0 >/dev/null || die "nothing lingers"
    fetches "$direct" --count 4
    lab_stop a1 tunneld || die "tunneld: $?"
    ! lab_in a1 ip link show wccp0 >"$LAB/remains" 2>&1 || die "a link remains"
    finish a1
}
# Eight connections, which ask for a page each only at the end.
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
    state_is a1 5 intercept '.["51"].flows == 8'
}
end_long() {
    touch "$LAB/ask"
    wait "$long" || die "long connections: $(cat "$LAB/long")"
}

# A router that redirects the proxy's own requests as well: they reach the server, and the operator is told. The same
# when they look like the client's.
case_own_traffic() {
    start --forward gre --return gre --redirect eth0=51 --redirect s1=52
    proxied a1 10.0.0.101 "${1-}" "$both_groups" "$(lab_intercept 51 ports=80)"
    ready 51 a1
    ready 52 a1
    fetches "$(by a1)" --count 32 --sources 32
    state_is a1 10 tunnel '[.[].own] | add >= 32'
    explained a1 "the router redirects this appliance's own traffic"
    finish a1
}
case_own_spoofed() {
    case_own_traffic keep
}

# The proxies keep the clients' addresses; what the server answers comes to the right one by a second group.
case_spoofed() {
    start --forward gre --return gre --redirect s1=52
    local node
    for node in 1 2; do
        proxied a$node 10.0.0.10$node keep "$both_groups" "$(lab_intercept 51 ports=80)"
    done
    ready 51 a1 a2
    ready 52 a1 a2
    fetches '.failed == 0 and (.proxies | .a1 > 16 and .a2 > 16) and (.peers | length == 64 and (keys | all(startswith("10.1.0."))))' \
        --count 64 --sources 64 --size 100000
    fetches '.failed == 0' --upload 5000000 --count 2 --sources 2
    fetches "$direct" --count 16 --sources 16 --port 8080
    finish a1 a2
}

# The router sends from the address of another interface: refused and counted by that address, until it is accepted.
case_accept() {
    start --forward gre --return gre --gre-source 10.1.0.1
    proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    ready 51 a1
    fetches '.fetched == 0' --timeout 1
    state_is a1 10 plane '.refused_source["10.1.0.1"] >= 1'
    explained a1 'refused source 10\.1\.0\.1: mgmtctl tunnel accept 10\.1\.0\.1'
    lab_manage a1 tunnel accept 10.1.0.1 >/dev/null || die "not accepted"
    fetches_within 5 "$(by a1)" --count 4
    fetches "$direct" --count 4 --port 8080
    finish a1
}

# While a group of its policy group has no router, new flows pass by the proxy, and those that it has go on. The same
# when no wccpd says anything of roles.
case_roles() {
    start --forward gre --return gre
    lab_router r2 10.0.0.2
    proxied a1 10.0.0.101 '' '[/qv/wccpd/wccp/policy_grp/config/5]' name=blue "$(lab_group 51 10.0.0.1 policy_grp=5)" \
        "$(lab_group 52 10.0.0.2 policy_grp=5)" "$(lab_intercept 51 ports=80)"
    ready 51 a1
    ready_role() { state_is a1 "$1" intercept ".[\"51\"].active == $2"; }
    ready_role 20 true
    lab_fetch c1 --size 1000 --requests 300 --pause 0.1 >"$LAB/kept" &
    local kept=$! i
    for i in 1 2; do
        lab_ctl r2 stop >/dev/null
        ready_role 30 false
        fetches "$direct" --count 4
        lab_ctl r2 resume >/dev/null
        ready_role 30 true
        fetches "$(by a1)" --count 4
    done
    wait $kept
    jq -e "$(by a1)" "$LAB/kept" >/dev/null || die "not kept: $(cat "$LAB/kept")"
    lab_stop a1 wccpd
    ready_role 5 false
    fetches "$direct" --count 4
    finish a1
}

# tunneld killed again and again during transfers: each ends well or is reset, wccpd stays, and new fetches work.
case_kills() {
    start --forward gre --return gre
    lab_appliance a1 10.0.0.101
    lab_gateway a1 10.0.0.1
    lab_proxy a1
    lab_write_config a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80)"
    lab_supervise a1
    role a1 60 51 ACTIVE
    ready 51 a1
    local wccpd i transfers results=$LAB/transfers
    wccpd=$(lab_in a1 pgrep -x wccpd)
    for ((i = 1; i <= ${LAB_KILLS-5}; i++)); do
        lab_fetch c1 --parallel 4 --count 4 --size 30000000 --timeout 15 >>"$results" &
        transfers=$!
        lab_fetch c1 --parallel 4 --count 4 --upload 30000000 --timeout 15 --port 8080 >>"$results" &
        transfers+=" $!"
        sleep "0.$((RANDOM % 90 + 10))"
        lab_in a1 pkill -KILL -x tunneld || die "no tunneld to kill"
        fetches_within 3 "$(by a1)"
        # shellcheck disable=SC2086
        wait $transfers
    done
    jq -se 'length > 0 and all(.[]; .failures | keys - ["reset", "closed"] == [])' "$results" >/dev/null || die "transfers: $(cat "$results")"
    [ "$(lab_in a1 pgrep -x wccpd)" = "$wccpd" ] || die "wccpd has gone"
    # What somebody else removes comes back by itself.
    lab_in a1 ip link delete wccp0 || die "no link to delete"
    fetches_within 12 "$(by a1)"
    # All of them at once, with their rules: the next ones take them over.
    lab_in a1 pkill -KILL -x 'mgmtd|tunneld|wccpd'
    lab_wait_exit 5 a1 mgmtd
    lab_supervise a1
    role a1 60 51 ACTIVE
    ready 51 a1
    fetches "$(by a1)" --count 4
    lab_stop a1 mgmtd || die "mgmtd ended with $?"
    LAB_KILLED[a1]+='|uds-client-(wccpd|tunneld)-[0-9]+$'
    finish a1
}

lab_case
