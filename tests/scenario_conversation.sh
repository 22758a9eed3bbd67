#!/bin/bash
# The appliance and the lab's routers, which share no code, over real sockets: join, agree, elect, assign and part, in
# the forms that a network has. Each case is a lab of its own; all run side by side, by the faster clock.
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
export LAB_SPEED=${LAB_SPEED:-8}
source "$top/lab/topology.sh"
lab_enter "$0" "$@"

die() { echo "$*" >&2; tail -n 12 "$LAB"/*.log "$LAB"/*.out >&2; exit 1; }
group() { # [ROUTER]... [NAME=VALUE]...
    lab_group 60 priority=7 protocol=17 mask_src_ip=0x7 mask_dst_ip=0 "$@"
}
appliance() { # NAME ADDRESS, and the words of its group
    lab_appliance "$1" "$2"
    lab_appliance_start "$1" "$(group "${@:3}")"
}
change() { # NAME, and the words of its group
    lab_configure "$1" "$(group "${@:2}")" || die "$1 refuses its group"
}
router_is() { lab_wait "$2" ".groups[\"60\"] as \$g | $3" lab_ctl "$1" show || die "router $1"; } # NAME SECONDS JQ
appliance_is() { lab_wait "$2" "$3" lab_state "$1" 60 || die "appliance $1"; }                   # NAME SECONDS JQ
role_is() { lab_wait_role "$2" "$1" 60 "$3" || die "appliance $1"; }                             # NAME SECONDS ROLE
shares() { echo "([\$g.assignment.buckets[]? | select(. == \"$1\")] | length) == $2"; }
ids='([.router[]?.id] | sort)'
loads() { echo "[.router[]?.appliance[\"$1\"].load_dist]"; }
# In order, with status 0 and nothing left; no line at error level in any appliance, but for those that are explained.
end() { # APPLIANCE... [-- EXPRESSION...]
    local appliances=()
    while [ $# -gt 0 ] && [ "$1" != -- ]; do appliances+=("$1"); shift; done
    [ $# -gt 0 ] && shift
    lab_end "${appliances[@]}" || die "the end"
    local a
    for a in "$LAB"/a?.log; do a=${a##*/}; lab_clean_log "${a%.log}" "$@" || die "not clean"; done
}

case_ios_hash_gre() {
    lab_router r1 10.0.0.1 10.0.0.2 10.0.0.3 -- --forward gre --return gre --assign hash
    appliance a1 10.0.0.101 10.0.0.1 10.0.0.2 10.0.0.3
    lab_wait 45 '.groups["60"].assignment.key_change >= 1' lab_ctl r1 @10.0.0.3 show || die "no table"
    lab_wait 5 '[.groups["60"].assignment.buckets[] | select(. == "10.0.0.101")] | length == 256' lab_ctl r1 @10.0.0.1 show || die share
    lab_wait 5 '.groups["60"].routers == ["10.0.0.1","10.0.0.2","10.0.0.3"]' lab_ctl r1 @10.0.0.1 show || die view
    role_is a1 30 ACTIVE
    # After the second table, all have acknowledged.
    appliance_is a1 30 '.oper == "ACTIVE, DESIGNATED" and (.debug | test("pend. acks +: 0"))'
    appliance_is a1 1 '[.router[] | select(.state == "TWO-WAY connected" and .fwd_method == "GRE" and .ret_method == "GRE" and
        .assign_method == "HASH" and .appliance["10.0.0.101"].load_dist == 100)] | length == 3'
    [ "$(grep -c 'add tunnel .*: done' "$LAB/a1-tunneld.out")" = 3 ] || die "the tunnels"
    end a1
    [ "$(grep -c 'delete tunnel .*: done' "$LAB/a1-tunneld.out")" = 3 ] || die "tunnels are left"
}

case_nexus_mask_l2_md5() {
    local words=(10.0.0.1 10.0.0.2 compatibility=nexus password=squeak)
    lab_router r1 10.0.0.1 -- --form nexus --forward l2 --return l2 --password squeak
    lab_router r2 10.0.0.2 -- --form nexus --forward l2 --return l2 --password squeak
    appliance a2 10.0.0.102 "${words[@]}" weight=30
    appliance a1 10.0.0.101 "${words[@]}" weight=10
    router_is r1 60 '$g.assignment.kind == "mask" and ([$g.appliances[] | [.address, .values]] == [["10.0.0.101", 2], ["10.0.0.102", 6]])'
    router_is r2 15 '[$g.assignment.masks[0].values[].match // $g.assignment.masks[0].values[].src_ip] == [0,1,2,3,4,5,6,7]'
    role_is a1 15 ACTIVE
    appliance_is a1 15 "$(loads 10.0.0.101) == [25, 25] and $(loads 10.0.0.102) == [75, 75]"
    appliance_is a2 15 '.oper == "ACTIVE"'
    # Another password here: each refuses the other.
    lab_ctl r1 password squeal >/dev/null
    lab_wait_line 15 'refused: wrong digest' "$LAB/r1.log" || die "r1 takes the wrong digest"
    change a1 "${words[@]::3}" weight=10
    lab_wait_line 15 'refused: not signed' "$LAB/r2.log" || die "r2 takes no digest"
    end a1 a2
}

case_multicast() {
    lab_router r1 10.0.0.1 -- --group 224.0.1.9
    lab_router r2 10.0.0.2 -- --group 224.0.1.9
    appliance a2 10.0.0.102 224.0.1.9 assign_method=hash
    appliance a1 10.0.0.101 224.0.1.9 assign_method=hash
    router_is r1 60 "$(shares 10.0.0.101 128)"
    router_is r2 15 "$(shares 10.0.0.102 128)"
    role_is a2 15 ACTIVE
    appliance_is a2 15 "$(loads 10.0.0.102) == [50, 50]"
    # Both hear what is sent to one: it is asked alone.
    lab_ctl r1 query 10.0.0.102 >/dev/null
    lab_wait_log 5 a1 'removal query is not for us' || die "a1 heard no query"
    end a2 a1
}

case_other_methods() {
    lab_router r1 10.0.0.1 -- --forward gre --assign mask
    lab_router r2 10.0.0.2 -- --forward gre,l2
    appliance a1 10.0.0.101 10.0.0.1 10.0.0.2 encap=l2
    lab_wait_log 20 a1 'incompatible capabilities \(router id 10\.0\.0\.1\) : local: \(fwd encap: L2 ' || die "r1 accepted"
    appliance_is a1 20 "$ids == [\"10.0.0.2\"]"
    # The table waits for r1 as little as the group does: nobody reports it.
    router_is r2 40 '$g.assignment.kind == "mask"'
    end a1
}

case_shutdown() {
    lab_router r1 10.0.0.1
    appliance a2 10.0.0.102 10.0.0.1 assign_method=hash
    appliance a1 10.0.0.101 10.0.0.1 assign_method=hash
    router_is r1 60 "$(shares 10.0.0.101 128)"
    role_is a2 15 ACTIVE
    lab_configure a2 || die "del"
    router_is r1 5 '.counters.rx_shutdown == 1 and ([$g.appliances[].address] == ["10.0.0.101"])'
    # The place of one that has left is shared among the others, whose own stays where it was.
    router_is r1 40 "$(shares 10.0.0.101 256)"
    lab_stop a1 wccpd || die "a1 ended with $?"
    router_is r1 2 '.counters.rx_shutdown == 2 and $g.appliances == []'
    end a1 a2
}

case_weight() {
    local words=(10.0.0.1 assign_method=hash)
    lab_router r1 10.0.0.1
    appliance a2 10.0.0.102 "${words[@]}"
    appliance a1 10.0.0.101 "${words[@]}"
    router_is r1 60 "$(shares 10.0.0.102 128)"
    change a2 "${words[@]}" weight=300
    router_is r1 25 "$(shares 10.0.0.102 192)"
    # All its weight gone, it keeps nothing and is no longer active.
    change a2 "${words[@]}" weight=0
    router_is r1 25 "$(shares 10.0.0.102 0)"
    role_is a2 15 BACKUP
    appliance_is a2 5 '.oper == "BACKUP"'
    end a1 a2
}

case_silence() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    appliance a1 10.0.0.101 10.0.0.1 10.0.0.2
    role_is a1 60 ACTIVE
    appliance_is a1 5 "$ids == [\"10.0.0.1\", \"10.0.0.2\"]"
    lab_ctl r2 stop >/dev/null
    appliance_is a1 50 "$ids == [\"10.0.0.1\"] and .oper == \"ACTIVE, DESIGNATED\""
    lab_ctl r1 stop >/dev/null
    role_is a1 50 BACKUP
    appliance_is a1 5 '.router == null and .oper == "INIT"'
    lab_wait_event 15 a1 '^alarm raised: eth0:grp:60 .*adjacency down' || die "no alarm"
    lab_ctl r1 resume >/dev/null
    lab_ctl r2 resume >/dev/null
    role_is a1 60 ACTIVE
    lab_wait_event 15 a1 '^alarm cleared: eth0:grp:60 .*adjacency down' || die "the alarm stands"
    end a1
}

case_faults() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2 -- --join first
    appliance a1 10.0.0.101 10.0.0.1 10.0.0.2
    role_is a1 60 ACTIVE
    # Nothing that r2 sends wrongly takes the group out of ACTIVE. The query makes it answer at once.
    local fault text expected=()
    while read -r fault text; do
        lab_mark a1
        lab_ctl r2 fault "$fault" >/dev/null || die "$fault"
        lab_ctl r2 query 10.0.0.101 >/dev/null || die "query"
        lab_wait_log 14 a1 "$text" || die "$fault: no line"
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
    appliance_is a1 1 '.debug | test("rx err authen. mismatch   : 1\\n")'
    end a1 -- "${expected[@]}"
}

case_removal_query() {
    lab_router r1 10.0.0.1 -- --query-after 4 --drop-after 20
    appliance a1 10.0.0.101 10.0.0.1
    # Here-I-Am comes every 10 seconds and the router asks after 4: it lives by its answers, three to each query.
    router_is r1 60 '.counters.tx_removal_query >= 3 and ($g.appliances | length) == 1 and .counters.left == null'
    role_is a1 30 ACTIVE
    lab_ctl r1 query 10.0.0.101 >/dev/null
    lab_sleep 4
    [ "$(tac "$LAB/r1.log" | grep -m1 -B9 removal-query | grep -c '"what":"here-i-am"')" -ge 3 ] || die "not three answers"
    end a1
}

case_cable() {
    lab_router r1 10.0.0.1
    appliance a1 10.0.0.101 10.0.0.1 assign_method=hash
    role_is a1 60 ACTIVE
    lab_link a1 down
    role_is a1 10 BACKUP
    appliance_is a1 5 '.oper == "INIT" and .router == null'
    lab_link a1 up
    role_is a1 60 ACTIVE
    lab_in a1 ip address del 10.0.0.101/24 dev eth0
    role_is a1 10 BACKUP
    appliance_is a1 5 '.oper == "INIT"'
    lab_in a1 ip address add 10.0.0.111/24 dev eth0
    lab_in a1 ip route add default via 10.0.0.254
    router_is r1 60 "$(shares 10.0.0.111 256)"
    role_is a1 15 ACTIVE
    end a1
}

"case_$3"
