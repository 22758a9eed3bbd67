#!/bin/bash
# The engine and the lab's routers, which share no code, over real sockets: join, agree, elect, assign and part, in
# the forms that a network has. Each case is a lab of its own; all run side by side.
#   scenario_conversation.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
cases=(ios_hash_gre nexus_mask_l2_md5 multicast other_methods shutdown weight silence faults removal_query cable)

if [ "${LAB_INSIDE-}" != 1 ] && [ "${2-}" != --one ]; then
    command -v jq >/dev/null || { echo "no jq"; exit 77; }
    [ $# -lt 2 ] || cases=("${@:2}")
    out=$(mktemp -d)
    trap 'rm -rf "$out"' EXIT
    failed=0
    for case in "${cases[@]}"; do
        "$0" "$WCCP_BIN" --one "$case" >"$out/$case" 2>&1 </dev/null &
        running+=($!)
    done
    for i in "${!cases[@]}"; do
        if wait "${running[$i]}"; then echo "ok      ${cases[$i]}"; continue; fi
        echo "FAILED  ${cases[$i]}"; sed 's/^/        /' "$out/${cases[$i]}"
        failed=1
    done
    exit $failed
fi

# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"

die() { echo "$*" >&2; tail -n 12 "$LAB"/*.log "$LAB"/*.out >&2; exit 1; }
tell() { lab_in "$1" "$WCCP_BIN/wccp_router" ctl /run/wccpd/host.sock "${@:2}"; }
state() { tell "$1" show; }
appliance() { # NAME ADDRESS
    lab_appliance "$1" "$2"
    lab_start "$1" host wccp_engine_host
    lab_start "$1" tunneld tunneld
    local i
    for i in $(seq 100); do state "$1" >/dev/null 2>&1 && return; sleep 0.1; done
    die "no engine in $1"
}
add() { # APPLIANCE WORDS... : group 60
    tell "$1" add 60 priority 7 protocol 17 hash src_ip mask_src_ip 0x7 "${@:2}" >/dev/null || die "$1 refuses its group"
}
router_is() { lab_wait "$2" ".groups[\"60\"] as \$g | $3" lab_ctl "$1" show || die "router $1"; }   # NAME SECONDS JQ
engine_is() { lab_wait "$2" ".groups[\"60\"] as \$g | $3" state "$1" || die "appliance $1"; }        # NAME SECONDS JQ
shares() { echo "([\$g.assignment.buckets[]? | select(. == \"$1\")] | length) == $2"; }
# No line at error level in any appliance, but for those that the case explains.
calm() { # [EXPECTED]
    local bad
    bad=$(grep -hE '^<(24|25|26|27)>' "$LAB"/a*.log | grep -vE "${1:-^$}")
    [ -z "$bad" ] || die "at error level: $bad"
}
end() { # APPLIANCE... : in order, with status 0
    local a
    for a; do lab_stop "$a" host || die "$a ended with $?"; done
}

case_ios_hash_gre() {
    lab_router r1 10.0.0.1 10.0.0.2 10.0.0.3 -- --forward gre --return gre --assign hash
    appliance a1 10.0.0.101
    add a1 router 10.0.0.1 router 10.0.0.2 router 10.0.0.3
    lab_wait 45 '.groups["60"].assignment.key_change >= 1' lab_ctl r1 @10.0.0.3 show || die "no table"
    lab_wait 5 '[.groups["60"].assignment.buckets[] | select(. == "10.0.0.101")] | length == 256' lab_ctl r1 @10.0.0.1 show || die share
    lab_wait 5 '.groups["60"].routers == ["10.0.0.1","10.0.0.2","10.0.0.3"]' lab_ctl r1 @10.0.0.1 show || die view
    # After the second table, all have acknowledged.
    engine_is a1 30 '$g.state == "ACTIVE" and $g.designated and $g.pending_acks == 0 and $g.forward == 1 and $g.assign == 1'
    engine_is a1 1 '[$g.routers[] | select(.two_way and .acked and .tunnel and .self == 256)] | length == 3'
    end a1
    calm
}

case_nexus_mask_l2_md5() {
    lab_router r1 10.0.0.1 -- --form nexus --forward l2 --return l2 --password squeak
    lab_router r2 10.0.0.2 -- --form nexus --forward l2 --return l2 --password squeak
    appliance a2 10.0.0.102
    appliance a1 10.0.0.101
    add a2 router 10.0.0.1 router 10.0.0.2 compat nexus password squeak weight 30
    sleep 1.2
    add a1 router 10.0.0.1 router 10.0.0.2 compat nexus password squeak weight 10
    router_is r1 60 '$g.assignment.kind == "mask" and ([$g.appliances[] | [.address, .values]] == [["10.0.0.101", 2], ["10.0.0.102", 6]])'
    router_is r2 5 '[$g.assignment.masks[0].values[].match // $g.assignment.masks[0].values[].src_ip] == [0,1,2,3,4,5,6,7]'
    engine_is a1 15 '$g.state == "ACTIVE" and ([$g.routers[] | [.self, .total]] == [[2, 8], [2, 8]])'
    engine_is a2 15 '$g.state == "ACTIVE" and ($g.designated | not)'
    # Another password here: each refuses the other.
    lab_ctl r1 password squeal >/dev/null
    lab_wait_line 15 'refused: wrong digest' "$LAB/r1.log" || die "r1 takes the wrong digest"
    tell a1 set 60 password none >/dev/null
    lab_wait_line 15 'refused: not signed' "$LAB/r2.log" || die "r2 takes no digest"
    calm
}

case_multicast() {
    lab_router r1 10.0.0.1 -- --group 224.0.1.9
    lab_router r2 10.0.0.2 -- --group 224.0.1.9
    appliance a2 10.0.0.102
    appliance a1 10.0.0.101
    add a2 router 224.0.1.9 assign hash
    sleep 1.2
    add a1 router 224.0.1.9 assign hash
    router_is r1 60 "$(shares 10.0.0.101 128)"
    router_is r2 5 "$(shares 10.0.0.102 128)"
    engine_is a2 15 '$g.state == "ACTIVE" and ([$g.routers[].self] == [128, 128])'
    # Both hear what is sent to one: it is asked alone.
    lab_ctl r1 query 10.0.0.102 >/dev/null
    lab_wait_line 5 'removal query is not for us' "$LAB/a1.log" || die "a1 heard no query"
    end a2 a1
    calm
}

case_other_methods() {
    lab_router r1 10.0.0.1 -- --forward gre --assign mask
    lab_router r2 10.0.0.2 -- --forward gre,l2
    appliance a1 10.0.0.101
    add a1 router 10.0.0.1 router 10.0.0.2 forward l2
    lab_wait_line 20 'incompatible capabilities \(router id 10\.0\.0\.1\) : local: \(fwd encap: L2 ' "$LAB/a1.log" || die "r1 accepted"
    engine_is a1 20 '[$g.routers[].id] == ["10.0.0.2"]'
    # The table waits for r1 as little as the group does: nobody reports it.
    router_is r2 40 '$g.assignment.kind == "mask"'
    calm
}

case_shutdown() {
    lab_router r1 10.0.0.1
    appliance a2 10.0.0.102
    appliance a1 10.0.0.101
    add a2 router 10.0.0.1 assign hash
    sleep 1.2
    add a1 router 10.0.0.1 assign hash
    router_is r1 60 "$(shares 10.0.0.101 128)"
    engine_is a2 15 '$g.state == "ACTIVE"'
    tell a2 del 60 >/dev/null || die "del"
    router_is r1 2 '.counters.rx_shutdown == 1 and ([$g.appliances[].address] == ["10.0.0.101"])'
    # The place of one that has left is shared among the others, whose own stays where it was.
    router_is r1 40 "$(shares 10.0.0.101 256)"
    lab_stop a1 host || die "a1 ended with $?"
    router_is r1 2 '.counters.rx_shutdown == 2 and $g.appliances == []'
    calm
}

case_weight() {
    lab_router r1 10.0.0.1
    appliance a2 10.0.0.102
    appliance a1 10.0.0.101
    add a2 router 10.0.0.1 assign hash
    sleep 1.2
    add a1 router 10.0.0.1 assign hash
    router_is r1 60 "$(shares 10.0.0.102 128)"
    tell a2 set 60 weight 300 >/dev/null
    router_is r1 25 "$(shares 10.0.0.102 192)"
    # All its weight gone, it keeps nothing and is no longer active.
    tell a2 set 60 weight 0 >/dev/null
    router_is r1 25 "$(shares 10.0.0.102 0)"
    engine_is a2 15 '$g.state == "BACKUP"'
    calm
}

case_silence() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    appliance a1 10.0.0.101
    add a1 router 10.0.0.1 router 10.0.0.2
    engine_is a1 60 '$g.state == "ACTIVE" and ($g.routers | length) == 2'
    lab_ctl r2 stop >/dev/null
    engine_is a1 50 '[$g.routers[].id] == ["10.0.0.1"] and $g.state == "ACTIVE"'
    lab_ctl r1 stop >/dev/null
    engine_is a1 50 '$g.routers == [] and $g.state == "INIT" and $g.assign == 0'
    lab_ctl r1 resume >/dev/null
    engine_is a1 60 '$g.state == "ACTIVE"'
    calm 'Error code 14001 returned' # of alarms, for which there is no session under this host
}

case_faults() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2 -- --join first
    appliance a1 10.0.0.101
    add a1 router 10.0.0.1 router 10.0.0.2
    engine_is a1 60 '$g.state == "ACTIVE"'
    # Nothing that r2 sends wrongly takes the group out of ACTIVE. The query makes it answer at once.
    local fault text
    while read -r fault text; do
        lab_ctl r2 fault "$fault" >/dev/null || die "$fault"
        lab_ctl r2 query 10.0.0.101 >/dev/null || die "query"
        lab_wait_line 14 "$text" "$LAB/a1.log" || die "$fault: no line"
        engine_is a1 1 '$g.state == "ACTIVE"'
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
    engine_is a1 1 '$g.rx_icu_failures >= 4'
    end a1
}

case_removal_query() {
    lab_router r1 10.0.0.1 -- --query-after 4 --drop-after 20
    appliance a1 10.0.0.101
    add a1 router 10.0.0.1
    # Here-I-Am comes every 10 seconds and the router asks after 4: it lives by its answers, three to each query.
    router_is r1 60 '.counters.tx_removal_query >= 3 and ($g.appliances | length) == 1 and .counters.left == null'
    engine_is a1 30 '$g.state == "ACTIVE"'
    lab_ctl r1 query 10.0.0.101 >/dev/null
    sleep 4
    [ "$(tac "$LAB/r1.log" | grep -m1 -B9 removal-query | grep -c '"what":"here-i-am"')" -ge 3 ] || die "not three answers"
    calm
}

case_cable() {
    lab_router r1 10.0.0.1
    appliance a1 10.0.0.101
    add a1 router 10.0.0.1 assign hash
    engine_is a1 60 '$g.state == "ACTIVE"'
    lab_link a1 down
    engine_is a1 10 '$g.state == "INIT" and $g.routers == [] and $g.next_here_i_am == 0'
    lab_link a1 up
    engine_is a1 60 '$g.state == "ACTIVE"'
    lab_in a1 ip address del 10.0.0.101/24 dev eth0
    engine_is a1 10 '$g.state == "INIT"'
    lab_in a1 ip address add 10.0.0.111/24 dev eth0
    lab_in a1 ip route add default via 10.0.0.254
    router_is r1 60 "$(shares 10.0.0.111 256)"
    engine_is a1 15 '$g.state == "ACTIVE"'
    end a1
}

"case_$3"
