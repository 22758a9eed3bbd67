#!/bin/bash
# The appliance and the lab's routers, which share no code, over real sockets: join, agree, elect, assign and part, in
# the forms that a network has. Each case is a lab of its own; all run side by side, by the faster clock.
#   scenario_conversation.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
set -u
export LAB_SPEED=${LAB_SPEED:-8}
# shellcheck source=../lab/cases.sh
source "$(dirname "$0")/../lab/cases.sh"
lab_cases "$@"

group() { # [ROUTER]... [NAME=VALUE]...
    lab_group 60 priority=7 protocol=17 mask_src_ip=0x7 mask_dst_ip=0 "$@"
}
member() { # NAME ADDRESS, and the words of its group
    appliance "$1" "$2" "$(group "${@:3}")"
}
ids='([.router[]?.id] | sort)'
loads() { echo "[.router[]?.appliance[\"$1\"].load_dist]"; }

case_ios_hash_gre() {
    lab_router r1 10.0.0.1 10.0.0.2 10.0.0.3 -- --forward gre --return gre --assign hash
    member a1 10.0.0.101 10.0.0.1 10.0.0.2 10.0.0.3
    lab_wait 45 '.groups["60"].assignment.key_change >= 1' lab_ctl r1 @10.0.0.3 show || die "no table"
    lab_wait 5 '[.groups["60"].assignment.buckets[] | select(. == "10.0.0.101")] | length == 256' lab_ctl r1 @10.0.0.1 show || die share
    lab_wait 5 '.groups["60"].routers == ["10.0.0.1","10.0.0.2","10.0.0.3"]' lab_ctl r1 @10.0.0.1 show || die view
    role a1 30 60 ACTIVE
    # After the second table, all have acknowledged.
    group_is a1 30 60 '.oper == "ACTIVE, DESIGNATED" and (.debug | test("pend. acks +: 0"))'
    group_is a1 1 60 '[.router[] | select(.state == "TWO-WAY connected" and .fwd_method == "GRE" and .ret_method == "GRE" and
        .assign_method == "HASH" and .appliance["10.0.0.101"].load_dist == 100)] | length == 3'
    [ "$(grep -c 'add tunnel .*: done' "$LAB/a1-tunneld.out")" = 3 ] || die "the tunnels"
    finish a1
    [ "$(grep -c 'delete tunnel .*: done' "$LAB/a1-tunneld.out")" = 3 ] || die "tunnels are left"
}

case_nexus_mask_l2_md5() {
    local words=(10.0.0.1 10.0.0.2 compatibility=nexus password=squeak)
    lab_router r1 10.0.0.1 -- --form nexus --forward l2 --return l2 --password squeak
    lab_router r2 10.0.0.2 -- --form nexus --forward l2 --return l2 --password squeak
    member a2 10.0.0.102 "${words[@]}" weight=30
    member a1 10.0.0.101 "${words[@]}" weight=10
    router_is r1 60 60 '$g.assignment.kind == "mask" and ([$g.appliances[] | [.address, .values]] == [["10.0.0.101", 2], ["10.0.0.102", 6]])'
    router_is r2 15 60 '[$g.assignment.masks[0].values[].match // $g.assignment.masks[0].values[].src_ip] == [0,1,2,3,4,5,6,7]'
    role a1 15 60 ACTIVE
    group_is a1 15 60 "$(loads 10.0.0.101) == [25, 25] and $(loads 10.0.0.102) == [75, 75]"
    group_is a2 15 60 '.oper == "ACTIVE"'
    # Another password here: each refuses the other.
    lab_ctl r1 password squeal >/dev/null
    lab_wait_line 15 'refused: wrong digest' "$LAB/r1.log" || die "r1 takes the wrong digest"
    configure a1 "$(group "${words[@]::3}" weight=10)"
    lab_wait_line 15 'refused: not signed' "$LAB/r2.log" || die "r2 takes no digest"
    finish a1 a2
}

case_multicast() {
    lab_router r1 10.0.0.1 -- --group 224.0.1.9
    lab_router r2 10.0.0.2 -- --group 224.0.1.9
    member a2 10.0.0.102 224.0.1.9 assign_method=hash
    member a1 10.0.0.101 224.0.1.9 assign_method=hash
    router_is r1 60 60 "$(shares 10.0.0.101 128)"
    router_is r2 15 60 "$(shares 10.0.0.102 128)"
    role a2 15 60 ACTIVE
    group_is a2 15 60 "$(loads 10.0.0.102) == [50, 50]"
    # Both hear what is sent to one: it is asked alone.
    lab_ctl r1 query 10.0.0.102 >/dev/null
    says a1 5 'removal query is not for us'
    finish a2 a1
}

case_other_methods() {
    lab_router r1 10.0.0.1 -- --forward gre --assign mask
    lab_router r2 10.0.0.2 -- --forward gre,l2
    member a1 10.0.0.101 10.0.0.1 10.0.0.2 encap=l2
    says a1 20 'incompatible capabilities \(router id 10\.0\.0\.1\) : local: \(fwd encap: L2 '
    group_is a1 20 60 "$ids == [\"10.0.0.2\"]"
    # The table waits for r1 as little as the group does: nobody reports it.
    router_is r2 40 60 '$g.assignment.kind == "mask"'
    finish a1
}

case_shutdown() {
    lab_router r1 10.0.0.1
    member a2 10.0.0.102 10.0.0.1 assign_method=hash
    member a1 10.0.0.101 10.0.0.1 assign_method=hash
    router_is r1 60 60 "$(shares 10.0.0.101 128)"
    role a2 15 60 ACTIVE
    configure a2
    router_is r1 5 60 '.counters.rx_shutdown == 1 and ([$g.appliances[].address] == ["10.0.0.101"])'
    # The place of one that has left is shared among the others, whose own stays where it was.
    router_is r1 40 60 "$(shares 10.0.0.101 256)"
    lab_stop a1 wccpd || die "a1 ended with $?"
    router_is r1 2 60 '.counters.rx_shutdown == 2 and $g.appliances == []'
    finish a1 a2
}

case_weight() {
    local words=(10.0.0.1 assign_method=hash)
    lab_router r1 10.0.0.1
    member a2 10.0.0.102 "${words[@]}"
    member a1 10.0.0.101 "${words[@]}"
    router_is r1 60 60 "$(shares 10.0.0.102 128)"
    configure a2 "$(group "${words[@]}" weight=300)"
    router_is r1 25 60 "$(shares 10.0.0.102 192)"
    # All its weight gone, it keeps nothing and is no longer active.
    configure a2 "$(group "${words[@]}" weight=0)"
    router_is r1 25 60 "$(shares 10.0.0.102 0)"
    role a2 15 60 BACKUP
    group_is a2 5 60 '.oper == "BACKUP"'
    finish a1 a2
}

case_silence() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    member a1 10.0.0.101 10.0.0.1 10.0.0.2
    role a1 60 60 ACTIVE
    group_is a1 5 60 "$ids == [\"10.0.0.1\", \"10.0.0.2\"]"
    lab_ctl r2 stop >/dev/null
    group_is a1 50 60 "$ids == [\"10.0.0.1\"] and .oper == \"ACTIVE, DESIGNATED\""
    lab_ctl r1 stop >/dev/null
    role a1 50 60 BACKUP
    group_is a1 5 60 '.router == null and .oper == "INIT"'
    lab_wait_event 60 a1 '^alarm raised: eth0:grp:60 .*adjacency down' || die "no alarm"
    lab_ctl r1 resume >/dev/null
    lab_ctl r2 resume >/dev/null
    role a1 60 60 ACTIVE
    lab_wait_event 60 a1 '^alarm cleared: eth0:grp:60 .*adjacency down' || die "the alarm stands"
    finish a1
}

case_faults() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2 -- --join first
    member a1 10.0.0.101 10.0.0.1 10.0.0.2
    role a1 60 60 ACTIVE
    # Nothing that r2 sends wrongly takes the group out of ACTIVE. The query makes it answer at once.
    local fault text expected=()
    while read -r fault text; do
        lab_mark a1
        lab_ctl r2 fault "$fault" >/dev/null || die "$fault"
        lab_ctl r2 query 10.0.0.101 >/dev/null || die "query"
        says a1 14 "$text"
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
    member a1 10.0.0.101 10.0.0.1
    # Here-I-Am comes every 10 seconds and the router asks after 4: it lives by its answers, three to each query.
    router_is r1 60 60 '.counters.tx_removal_query >= 3 and ($g.appliances | length) == 1 and .counters.left == null'
    role a1 30 60 ACTIVE
    lab_ctl r1 query 10.0.0.101 >/dev/null
    lab_sleep 4
    [ "$(tac "$LAB/r1.log" | grep -m1 -B9 removal-query | grep -c '"what":"here-i-am"')" -ge 3 ] || die "not three answers"
    finish a1
}

# Of many groups by GRE, with a tunneld that takes its time.
case_cable() {
    local routers=(10.0.0.1 10.0.0.2 10.0.0.3) id groups=() added
    local back='[.[].oper] | length == 8 and all(. == "ACTIVE, DESIGNATED")'
    adds() { grep -c 'add tunnel' "$LAB/a1-tunneld.out"; }
    LAB_TUNNELD='--slow 100'
    lab_router r1 "${routers[@]}" -- --forward gre --return gre
    for id in $(seq 60 67); do groups+=("$(lab_group "$id" "${routers[@]}" assign_method=hash)"); done
    appliance a1 10.0.0.101 "${groups[@]}"
    lab_wait 60 "$back" lab_state a1 || die "not all are active"
    lab_link a1 down
    role a1 10 60 BACKUP
    group_is a1 5 60 '.oper == "INIT" and .router == null'
    sleep 1
    added=$(adds)
    lab_link a1 up
    # And again while the first router waits for its tunnel: what the others have answered is still in the socket.
    until [ "$(adds)" -gt "$added" ]; do sleep 0.02; done
    lab_link a1 down
    sleep 1.5
    lab_link a1 up
    lab_wait 60 "$back" lab_state a1 || die "not all have come back"
    lab_in a1 ip address del 10.0.0.101/24 dev eth0
    role a1 10 60 BACKUP
    group_is a1 5 60 '.oper == "INIT"'
    lab_in a1 ip address add 10.0.0.111/24 dev eth0
    lab_in a1 ip route add default via 10.0.0.254
    router_at_is r1 10.0.0.3 60 60 "$(shares 10.0.0.111 256)"
    lab_wait 60 "$back" lab_state a1 || die "not all have come back with another address"
    finish a1
}

lab_case
