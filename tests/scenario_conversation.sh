#!/bin/bash
# The protocol between appliances and simulated routers, which share no code, over real sockets: joining, negotiation,
# election, assignment and leaving, with the kinds of routers and faults that a network can have.
#   scenario_conversation.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
set -u
export LAB_SPEED=${LAB_SPEED:-8}
# shellcheck source=../lab/cases.sh
source "$(dirname "$0")/../lab/cases.sh"
lab_cases "$@"

print_group() { # [ROUTER]... [NAME=VALUE]...
    lab_group 60 priority=7 protocol=17 mask_src_ip=0x7 mask_dst_ip=0 "$@"
}
start_member() { # NAME ADDRESS [ROUTER]... [NAME=VALUE]...
    start_appliance "$1" "$2" "$(print_group "${@:3}")"
}
ids='([.router[]?.id] | sort)'
loads() { echo "[.router[]?.appliance[\"$1\"].load_dist]"; }

case_ios_hash_gre() {
    lab_router r1 10.0.0.1 10.0.0.2 10.0.0.3 -- --forward gre --return gre --assign hash
    start_member a1 10.0.0.101 10.0.0.1 10.0.0.2 10.0.0.3
    router_at_is r1 10.0.0.3 45 60 '$g.assignment.key_change >= 1'
    router_at_is r1 10.0.0.1 5 60 "$(shares 10.0.0.101 256) and \$g.routers == [\"10.0.0.1\", \"10.0.0.2\", \"10.0.0.3\"]"
    wait_role a1 30 60 ACTIVE
    # All routers have acknowledged the second table.
    group_is a1 30 60 '.oper == "ACTIVE, DESIGNATED" and (.debug | test("pend. acks +: 0"))'
    group_is a1 1 60 '[.router[] | select(.state == "TWO-WAY connected" and .fwd_method == "GRE" and .ret_method == "GRE" and
        .assign_method == "HASH" and .appliance["10.0.0.101"].load_dist == 100)] | length == 3'
    [ "$(grep -c 'add tunnel .*: done' "$LAB/a1-tunneld.out")" = 3 ] || die "not three tunnels"
    finish a1
    [ "$(grep -c 'delete tunnel .*: done' "$LAB/a1-tunneld.out")" = 3 ] || die "tunnels are left"
}

case_nexus_mask_l2_md5() {
    local words=(10.0.0.1 10.0.0.2 compatibility=nexus password=squeak)
    lab_router r1 10.0.0.1 -- --format nexus --forward l2 --return l2 --password squeak
    lab_router r2 10.0.0.2 -- --format nexus --forward l2 --return l2 --password squeak
    start_member a2 10.0.0.102 "${words[@]}" weight=30
    start_member a1 10.0.0.101 "${words[@]}" weight=10
    router_is r1 60 60 '$g.assignment.kind == "mask" and ([$g.appliances[] | [.address, .values]] == [["10.0.0.101", 2], ["10.0.0.102", 6]])'
    router_is r2 15 60 '[$g.assignment.masks[0].values[].match // $g.assignment.masks[0].values[].src_ip] == [0,1,2,3,4,5,6,7]'
    wait_role a1 15 60 ACTIVE
    group_is a1 15 60 "$(loads 10.0.0.101) == [25, 25] and $(loads 10.0.0.102) == [75, 75]"
    group_is a2 15 60 '.oper == "ACTIVE"'
    # With different passwords both sides refuse the messages.
    lab_ctl r1 password squeal >/dev/null
    lab_wait_line 15 'refused: wrong digest' "$LAB/r1.log" || die "r1 accepts a wrong digest"
    configure a1 "$(print_group "${words[@]::3}" weight=10)"
    lab_wait_line 15 'refused: not signed' "$LAB/r2.log" || die "r2 accepts a message without a digest"
    finish a1 a2
}

case_multicast() {
    lab_router r1 10.0.0.1 -- --group 224.0.1.9
    lab_router r2 10.0.0.2 -- --group 224.0.1.9
    start_member a2 10.0.0.102 224.0.1.9 assign_method=hash
    start_member a1 10.0.0.101 224.0.1.9 assign_method=hash
    router_is r1 60 60 "$(shares 10.0.0.101 128)"
    router_is r2 15 60 "$(shares 10.0.0.102 128)"
    wait_role a2 15 60 ACTIVE
    group_is a2 15 60 "$(loads 10.0.0.102) == [50, 50]"
    # Both appliances receive the query; only a2 is meant.
    lab_ctl r1 query 10.0.0.102 >/dev/null
    wait_log a1 5 'removal query is not for us'
    finish a2 a1
}

case_other_methods() {
    lab_router r1 10.0.0.1 -- --forward gre --assign mask
    lab_router r2 10.0.0.2 -- --forward gre,l2
    start_member a1 10.0.0.101 10.0.0.1 10.0.0.2 encap=l2
    wait_log a1 20 'incompatible capabilities \(router id 10\.0\.0\.1\) : local: \(fwd encap: L2 '
    group_is a1 20 60 "$ids == [\"10.0.0.2\"]"
    explains a1 5 60 forwarding-not-offered '10.0.0.1 offers forwarding by gre, but L2 is wanted'
    # r1 is in no view; therefore neither the group nor the table waits for it.
    router_is r2 40 60 '$g.assignment.kind == "mask"'
    finish a1
}

case_weight() {
    local words=(10.0.0.1 assign_method=hash)
    lab_router r1 10.0.0.1
    start_member a2 10.0.0.102 "${words[@]}"
    start_member a1 10.0.0.101 "${words[@]}"
    router_is r1 60 60 "$(shares 10.0.0.102 128)"
    configure a2 "$(print_group "${words[@]}" weight=300)"
    router_is r1 25 60 "$(shares 10.0.0.102 192)"
    # With weight 0 it gets no buckets and is no longer active.
    configure a2 "$(print_group "${words[@]}" weight=0)"
    router_is r1 25 60 "$(shares 10.0.0.102 0)"
    wait_role a2 15 60 BACKUP
    group_is a2 5 60 '.oper == "BACKUP"'
    explains a2 5 60 weight-zero '10.0.0.101 100%'
    finish a1 a2
}

case_routers_stop() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    start_member a1 10.0.0.101 10.0.0.1 10.0.0.2
    wait_role a1 60 60 ACTIVE
    group_is a1 5 60 "$ids == [\"10.0.0.1\", \"10.0.0.2\"]"
    lab_ctl r2 stop >/dev/null
    group_is a1 50 60 "$ids == [\"10.0.0.1\"] and .oper == \"ACTIVE, DESIGNATED\""
    lab_ctl r1 stop >/dev/null
    wait_role a1 50 60 BACKUP
    group_is a1 5 60 '.router == null and .oper == "INIT"'
    explains a1 5 60 router-silent 10.0.0.1
    lab_wait_event 60 a1 '^alarm raised: eth0:grp:60 .*adjacency down' || die "no alarm"
    lab_ctl r1 resume >/dev/null
    lab_ctl r2 resume >/dev/null
    wait_role a1 60 60 ACTIVE
    lab_wait_event 60 a1 '^alarm cleared: eth0:grp:60 .*adjacency down' || die "the alarm is still active"
    finish a1
}

case_faults() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2 -- --join first
    start_member a1 10.0.0.101 10.0.0.1 10.0.0.2
    wait_role a1 60 60 ACTIVE
    # No malformed message of r2 makes the group leave ACTIVE. The query makes the appliance, and then r2, answer at once.
    local fault text expected=()
    while read -r fault text; do
        lab_mark a1
        lab_ctl r2 fault "$fault" >/dev/null || die "$fault"
        lab_ctl r2 query 10.0.0.101 >/dev/null || die "query"
        wait_log a1 14 "$text"
        expected+=("$text")
    done <<'END'
bad-length do not match. sender ip: 10.0.0.2
other-security rxed mismatch security opt: 1 configured opt: 0
many-components too many optional components
routers-33 bad number of routers \(33\) in ICU pkt
appliances-33 bad number of appliances \(33\) in ICU pkt
odd-component ICU component type \(77\) not recognized
huge-map unload assignment map: packet length is BAD
other-group rxed service group \(188\) is not configured
cut WCCP: unloading capability comp. failed
other-service service group config mismatch \(router id: 10.0.0.2\)
no-router-id invalid router id in ICU. 0.0.0.0
bad-version rxed verion \(256\) is not supported
END
    [ "$(lab_events a1 | grep -c '^role of group 60')" = 2 ] || die "the group left ACTIVE"
    group_is a1 1 60 '.debug | test("rx err authen. mismatch   : 1\\n")'
    finish a1 -- "${expected[@]}"
}

case_removal_query() {
    lab_router r1 10.0.0.1 -- --query-after 4 --drop-after 20
    start_member a1 10.0.0.101 10.0.0.1
    # The router sends a query after 4 seconds without a message, and Here-I-Am comes every 10: the appliance stays a
    # member by its answers, three to each query.
    router_is r1 60 60 '.counters.tx_removal_query >= 3 and ($g.appliances | length) == 1 and .counters.left == null'
    wait_role a1 30 60 ACTIVE
    lab_ctl r1 query 10.0.0.101 >/dev/null
    lab_sleep 4
    # To one query at least: the router may have sent the last one just now.
    awk '/"what":"removal-query"/ { answers = 0 } /"what":"here-i-am"/ && ++answers >= 3 { found = 1 } END { exit !found }' \
        "$LAB/r1.log" || die "not three answers"
    finish a1
}

# The cable of an appliance with many groups is unplugged and plugged in, while tunneld takes 100 ms for each tunnel.
case_cable() {
    local routers=(10.0.0.1 10.0.0.2 10.0.0.3) id groups=() added
    local back='[.[].oper] | length == 8 and all(. == "ACTIVE, DESIGNATED")'
    adds() { grep -c 'add tunnel' "$LAB/a1-tunneld.out"; }
    LAB_TUNNELD='--slow 100'
    lab_router r1 "${routers[@]}" -- --forward gre --return gre
    for id in $(seq 60 67); do groups+=("$(lab_group "$id" "${routers[@]}" assign_method=hash)"); done
    start_appliance a1 10.0.0.101 "${groups[@]}"
    lab_wait 60 "$back" lab_state a1 || die "not all groups are active"
    lab_link a1 down
    wait_role a1 10 60 BACKUP
    group_is a1 5 60 '.oper == "INIT" and .router == null'
    sleep 1
    added=$(adds)
    lab_link a1 up
    # Again, while the first router waits for its tunnel and the answers of the others are still in the socket.
    until [ "$(adds)" -gt "$added" ]; do sleep 0.02; done
    lab_link a1 down
    sleep 1.5
    lab_link a1 up
    lab_wait 60 "$back" lab_state a1 || die "not all groups are active again"
    lab_in a1 ip address del 10.0.0.101/24 dev eth0
    wait_role a1 10 60 BACKUP
    group_is a1 5 60 '.oper == "INIT"'
    lab_in a1 ip address add 10.0.0.111/24 dev eth0
    lab_in a1 ip route add default via 10.0.0.254
    router_at_is r1 10.0.0.3 60 60 "$(shares 10.0.0.111 256)"
    lab_wait 60 "$back" lab_state a1 || die "not all groups are active with another address"
    finish a1
}

lab_case
