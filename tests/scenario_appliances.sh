#!/bin/bash
# Several appliances share a group: weights, coming, going, and who makes the table.
#   scenario_appliances.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
set -u
: "${LAB_SPEED:=8}"
export LAB_SPEED
# shellcheck source=../lab/cases.sh
source "$(dirname "$0")/../lab/cases.sh"
lab_cases "$@"

hash_group() { # WEIGHT
    lab_group 51 10.0.0.1 10.0.0.2 assign_method=hash hash_dst_ip=true "weight=$1"
}

adopted() { # ROUTER SECONDS LAST_OCTET:BUCKETS... : a table came with these shares
    local text
    text=$(printf ',"10.0.0.%s":%s' $(tr : ' ' <<<"${*:3}"))
    lab_wait_line "$2" "\"result\":\"adopted\",\"shares\":\{${text:1}\}" "$LAB/$1.log" || die "no table ${*:3} at $1"
}

# Five weights that divide 256; then the largest is taken back, and two leave.
case_five() {
    local weights=(10 20 30 40 60) n
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    for n in 1 2 3 4 5; do appliance a$n 10.0.0.10$n "$(hash_group ${weights[n - 1]})"; done
    for n in 1 2 3 4 5; do router_is r1 40 51 "$(shares 10.0.0.10$n $((weights[n - 1] * 8 / 5)))"; done
    router_is r2 5 51 "$(shares 10.0.0.105 96)"
    group_is a1 5 51 '.oper == "ACTIVE, DESIGNATED" and .num_appliances == 5'
    group_is a5 15 51 '.oper == "ACTIVE" and .router["1"].appliance["10.0.0.105"].load_dist == 37'

    # 120 in all: the runs end at 256 times the sums of 10, 20, 30, 40 and 20 by 120, rounded down.
    configure a5 "$(hash_group 20)"
    adopted r1 15 101:21 102:43 103:64 104:85 105:43
    adopted r2 5 101:21 102:43 103:64 104:85 105:43
    # One leaves in order, one without a word: its run alone is shared out, the others stay where they are.
    lab_end a4 || die "the end of a4"
    adopted r1 10 101:31 102:64 103:96 105:65
    lab_kill a5
    adopted r2 20 101:42 102:86 103:128
    router_is r1 10 51 "$(shares 10.0.0.103 128)"
    finish a1 a2 a3
    lab_clean_log a4 || die "a4"
}

# By values of a mask: with 32 of them, the weights are met as nearly as values allow.
case_five_by_mask() {
    local n
    lab_router r1 10.0.0.1 -- --form nexus --assign mask
    for n in 1 2 3 4 5; do
        appliance a$n 10.0.0.10$n "$(lab_group 51 10.0.0.1 compatibility=nexus mask_dst_ip=0 mask_src_ip=0x1f weight=$((n * 10)))"
    done
    router_is r1 40 51 '[$g.appliances[].values] == [2, 4, 6, 9, 11]'
    group_is a1 10 51 '.router["1"].assign_method == "MASK"'
    finish a1 a2 a3 a4 a5
}

# The lowest address makes the table; the next one takes over, and gives it back.
case_takeover() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    appliance a1 10.0.0.101 "$(hash_group 100)"
    appliance a2 10.0.0.102 "$(hash_group 100)"
    router_is r1 30 51 "\$g.assignment.key == \"10.0.0.101\" and ($(shares 10.0.0.102 128))"
    group_is a1 10 51 '.oper == "ACTIVE, DESIGNATED"'
    group_is a2 10 51 '.oper == "ACTIVE"'
    lab_kill a1
    router_is r2 20 51 "\$g.assignment.key == \"10.0.0.102\" and ($(shares 10.0.0.102 256))"
    group_is a2 10 51 '.oper == "ACTIVE, DESIGNATED" and .router["1"].appliance["10.0.0.102"].load_dist == 100'
    appliance a1 10.0.0.101 "$(hash_group 100)"
    router_is r2 30 51 "\$g.assignment.key == \"10.0.0.101\" and ($(shares 10.0.0.101 128))"
    group_is a2 10 51 '.oper == "ACTIVE"'
    # The designated one goes in order: the other takes over without the wait for its silence.
    lab_end a1 || die "the end of a1"
    router_is r1 12 51 "\$g.assignment.key == \"10.0.0.102\" and ($(shares 10.0.0.102 256))"
    finish a2
}

lab_case
