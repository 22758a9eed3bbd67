#!/bin/bash
# Long connections through two appliances, with a request per second on each. An appliance joins, weights change, programs
# are killed, an appliance leaves: no connection breaks, except those of a proxy that is killed itself.
#   scenario_flows.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
#   scenario_flows.sh DIRECTORY_OF_THE_PROGRAMS --one CASE     prints a table of the connections that broke at each event
#   LAB_FLOWS     number of connections (default 200)
#   LAB_PROTECTION   protection time in seconds; 0: no protection. If it is set, broken connections don't fail the case
#   LAB_EVENTS    the events, in this order (default: those of the case)
set -u
: "${LAB_SPEED:=4}" "${LAB_FLOWS:=200}"
export LAB_SPEED LAB_FLOWS
# shellcheck source=../lab/cases.sh
source "$(dirname "${BASH_SOURCE[0]}")/../lab/cases.sh"
lab_cases "$@"

flows=$LAB/flows.out # events of the client
group=() section='' intercept='' last_answers=8

# --- The network: a1 and a2 share the group; the programs of a3 are not running yet

start_flows() { # METHOD [NAME=VALUE]... : of the group
    local node n
    lab_router r1 10.0.0.1 -- --redirect c1=51 --forward "$1" --return "$1"
    lab_client c1 r1
    lab_server s1 r1
    group=(51 10.0.0.1 "${@:2}")
    [ -z "${LAB_PROTECTION-}" ] || section=$(printf '[/qv/tunneld/protection/config]\ntime = %s\n' "$LAB_PROTECTION")
    intercept=$(lab_intercept 51 ports=80 interval=1 rise=1)
    for n in 1 2 3; do
        lab_appliance a$n 10.0.0.10$n
        lab_gateway a$n 10.0.0.1
        lab_proxy a$n
    done
    run_appliance a1
    run_appliance a2
    wait_ready 51 a1 a2
    nsenter -t "${LAB_INIT[c1]}" --net "$WCCP_BIN/wccp_router" fetch --from 10.1.0.128 --sources 112 10.2.0.2 \
        --long "$LAB_FLOWS" --life $last_answers --timeout 10 >"$flows" &
    LAB_PID[c1/client]=$! client=$!
    lab_wait 20 ". == $LAB_FLOWS" eval 'grep -c opened "$flows"' || die "not all connections were opened"
    jq -es 'map(.proxy) | unique == ["a1", "a2"]' "$flows" >/dev/null || die "connections do not use both proxies"
}
print_configuration() { # [NAME=VALUE]...
    printf '%s\n' "$(lab_group "${group[@]}" "$@")" "$intercept" "$section"
}
run_appliance() { # NODE
    lab_write_config "$1" "$(print_configuration weight=100)"
    lab_supervise "$1"
}

# --- Events; each starts from the state that the one before has left

# Prints a JQ for router_is: the fraction of the table that an appliance has.
share_of() { # ADDRESS
    echo "([\$g.assignment.buckets[]?, \$g.assignment.masks[]?.values[].owner] | (map(select(. == \"$1\")) | length) / length)"
}
event_join() {
    run_appliance a3
    wait_ready 51 a1 a2 a3
}
event_weight() {
    configure a2 "$(print_configuration weight=400)"
    router_is r1 30 51 "$(share_of 10.0.0.102) > 0.6"
}
event_tunneld_killed() {
    kill_supervised a1 tunneld
    tunneld_is a1 20 intercept '.["51"].active'
}
# wccpd of the designated appliance is killed: the wccpd that replaces it should compute the same table.
event_wccpd_killed() {
    local before
    before=$(lab_ctl r1 show | jq -c '.groups["51"].assignment | [.buckets, .masks]')
    kill_supervised a1 wccpd
    lab_wait_event 60 a1 '^role of group 51: ACTIVE' || die "wccpd of a1 is not active again"
    wait_ready 51 a1 a2 a3
    [ "$(lab_ctl r1 show | jq -c '.groups["51"].assignment | [.buckets, .masks]')" = "$before" ] ||
        echo "note: the table changed after wccpd of a1 was killed"
}
kill_supervised() { # NODE NAME : and waits until it is started again
    LAB_KILLED[$1]+="|uds-client-$2-[0-9]+\$"
    : >"$LAB/$1-mgmtd.out"
    lab_in "$1" pkill -KILL -x "$2" || die "cannot kill $2"
    lab_wait_event 20 "$1" "^process $2: started" || die "$2 of $1 was not started again"
}
event_proxy_killed() {
    lab_stop a2 proxy KILL 2>/dev/null
    tunneld_is a2 10 intercept '.["51"].proxy == "down"'
    lab_proxy a2
    tunneld_is a2 10 intercept '.["51"].proxy == "up"'
}
event_drain_stop() {
    kill -USR1 $client # connections end one after the other, and new ones are short
    # Without protection the drain runs into its timeout: the proxy keeps connections open that broke unnoticed.
    local for=120
    [ "${LAB_PROTECTION-}" != 0 ] || for=30
    lab_in a3 "$WCCP_BIN/mgmtctl" drain 51 for $for wait || [ $for = 30 ] || die "drain exited with $?"
    lab_stop a3 mgmtd || die "mgmtd of a3 exited with $?"
    router_is r1 30 51 '$g.appliances | length == 2'
}

# --- Results

# Prints a JSON object for each event: the connections that were open when it began and those that broke, by proxy.
print_summary() {
    jq -cs --slurpfile events "$LAB/events" '
        def count_each: group_by(.) | map({key: .[0], value: length}) | from_entries;
        map(select(.what != "result")) as $all | $events | to_entries[] |
        .value.asked as $from | ($events[.key + 1].asked // 1e12) as $to |
        {event: .value.event,
         open: ($all | map(select(.asked < $from)) | reduce .[] as $one ({}; .[$one.connection | tostring] = $one) |
            map(select(.what == "opened").proxy) | count_each)} +
        ($all | map(select(.asked >= $from and .asked < $to)) |
            {broken: (map(select(.what == "broken").proxy) | count_each), why: (map(select(.what == "broken").why) | count_each),
             unopened: (map(select(.what == "unopened")) | length)})' "$flows"
}
print_table() {
    printf '%-16s %6s %8s  %s\n' event open broken of
    jq -r '[.event, (.open | add // 0), (.broken | add // 0), ([.broken, .why, {unopened: .unopened}] | map(tojson) | join(" "))] | @tsv' "$LAB/summary" |
        while IFS=$'\t' read -r event open broken of; do printf '%-16s %6d %8d  %s\n' "$event" "$open" "$broken" "$of"; done
    tail -n 1 "$flows"
}
run_events() { # EVENT...
    local event
    # shellcheck disable=SC2086
    [ -z "${LAB_EVENTS-}" ] || set -- $LAB_EVENTS
    for event; do
        # A connection that breaks by a request from now on is counted for this event.
        echo "{\"asked\": $EPOCHREALTIME, \"event\": \"$event\"}" >>"$LAB/events"
        "event_$event"
        sleep 3
        lab_alive c1 client || die "the client has exited"
    done
    kill -TERM $client
    wait $client
    print_summary >"$LAB/summary"
    print_table
    # No connection broke, except all those of the killed proxy.
    [ -n "${LAB_PROTECTION-}" ] || jq -es 'all(.[]; .unopened == 0 and
        .broken == (if .event == "proxy_killed" then .open | {a2} else {} end))' "$LAB/summary" >/dev/null || die "connections broke"
}

# --- Cases

all_events=(join weight tunneld_killed wccpd_killed proxy_killed drain_stop)
case_gre_hash() {
    LAB_PLANE=user
    start_flows gre hash_src_port=true
    run_events "${all_events[@]}"
}
case_l2_mask() {
    LAB_PLANE=''
    start_flows l2 assign_method=mask mask_src_ip=0x1f mask_dst_ip=0 mask_src_port=0x1
    run_events "${all_events[@]}"
}
# Connections do break without protection.
case_unprotected() {
    LAB_PROTECTION=0
    LAB_PLANE=user
    start_flows gre hash_src_port=true
    run_events join
    jq -es '.[0].broken | add > 20' "$LAB/summary" >/dev/null || die "too few connections broke"
}

lab_case
