#!/bin/bash
# Several appliances share a group: weights, joining, leaving, and which of them computes the table.
#   scenario_appliances.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
set -u
: "${LAB_SPEED:=8}"
export LAB_SPEED
# shellcheck source=../lab/cases.sh
source "$(dirname "$0")/../lab/cases.sh"
lab_cases "$@"

print_group() { # WEIGHT
    lab_group 51 10.0.0.1 10.0.0.2 assign_method=hash hash_dst_ip=true "weight=$1"
}

wait_table() { # ROUTER SECONDS LAST_OCTET:BUCKETS... : until the router adopts a table with these shares
    local text
    text=$(printf ',"10.0.0.%s":%s' $(tr : ' ' <<<"${*:3}"))
    lab_wait_line "$2" "\"result\":\"adopted\",\"shares\":\{${text:1}\}" "$LAB/$1.log" || die "no table ${*:3} at $1"
}

# Five weights that divide 256 evenly; then the largest is reduced, and two appliances leave.
case_five() {
    local weights=(10 20 30 40 60) n
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    for n in 1 2 3 4 5; do start_appliance a$n 10.0.0.10$n "$(print_group ${weights[n - 1]})"; done
    for n in 1 2 3 4 5; do router_is r1 40 51 "$(shares 10.0.0.10$n $((weights[n - 1] * 8 / 5)))"; done
    router_is r2 5 51 "$(shares 10.0.0.105 96)"
    group_is a1 5 51 '.oper == "ACTIVE, DESIGNATED" and .num_appliances == 5'
    group_is a5 15 51 '.oper == "ACTIVE" and .router["1"].appliance["10.0.0.105"].load_dist == 37'

    # The weights are now 120 in total: the last buckets are 256 times the partial sums, divided by 120 and rounded down.
    configure a5 "$(print_group 20)"
    wait_table r1 15 101:21 102:43 103:64 104:85 105:43
    wait_table r2 5 101:21 102:43 103:64 104:85 105:43
    # One sends a shutdown message, the other just disappears. Only the buckets of the one that left move.
    lab_end a4 || die "end of a4"
    wait_table r1 10 101:31 102:64 103:96 105:65
    lab_kill a5
    wait_table r2 20 101:42 102:86 103:128
    router_is r1 10 51 "$(shares 10.0.0.103 128)"
    finish a1 a2 a3
    lab_clean_log a4 || die "log of a4"
}

# The appliance with the lowest address computes the table. When it dies the next one takes over until it is back.
case_takeover() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    start_appliance a1 10.0.0.101 "$(print_group 100)"
    start_appliance a2 10.0.0.102 "$(print_group 100)"
    router_is r1 30 51 "\$g.assignment.key == \"10.0.0.101\" and ($(shares 10.0.0.102 128))"
    group_is a1 10 51 '.oper == "ACTIVE, DESIGNATED"'
    group_is a2 10 51 '.oper == "ACTIVE"'
    lab_kill a1
    router_is r2 20 51 "\$g.assignment.key == \"10.0.0.102\" and ($(shares 10.0.0.102 256))"
    group_is a2 10 51 '.oper == "ACTIVE, DESIGNATED" and .router["1"].appliance["10.0.0.102"].load_dist == 100'
    start_appliance a1 10.0.0.101 "$(print_group 100)"
    router_is r2 30 51 "\$g.assignment.key == \"10.0.0.101\" and ($(shares 10.0.0.101 128))"
    group_is a2 10 51 '.oper == "ACTIVE"'
    # When the designated appliance sends a shutdown message, the other takes over without waiting for a timeout.
    lab_end a1 || die "end of a1"
    router_is r1 12 51 "\$g.assignment.key == \"10.0.0.102\" and ($(shares 10.0.0.102 256))"
    finish a2
}

lab_case
