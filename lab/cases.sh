#!/bin/bash
# cases.sh: a scenario of several cases, each a lab of its own, some of them side by side.
#
#     source lab/cases.sh
#     lab_cases "$@"          # DIRECTORY_OF_THE_PROGRAMS [CASE...]; the caller goes on inside the lab of one case
#     case_one() { ...; }     # functions that begin with case_ are the cases
#     case_two() { ...; }
#     lab_case                # runs the one that this lab is for
#
#   LAB_SIDE_BY_SIDE   how many cases run at a time (default: three for each processor)

# shellcheck source=topology.sh
source "$(dirname "${BASH_SOURCE[0]}")/topology.sh"

lab_cases() {
    export WCCP_BIN=${1:-$LAB_TOP/build/release/bin}
    if [ "${LAB_INSIDE-}" != 1 ] && [ "${2-}" != --one ]; then
        command -v jq >/dev/null || { echo "no jq"; exit 77; }
        local cases out case i failed=0 limit=${LAB_SIDE_BY_SIDE:-$((3 * $(nproc)))}
        mapfile -t cases < <(sed -n 's/^case_\([a-z0-9_]*\)() {.*/\1/p' "$0")
        [ $# -lt 2 ] || cases=("${@:2}")
        out=$(mktemp -d)
        # shellcheck disable=SC2064
        trap "rm -rf '$out'" EXIT
        local running=()
        for i in "${!cases[@]}"; do
            while [ "$(jobs -pr | wc -l)" -ge "$limit" ]; do sleep 0.1; done
            (began=$SECONDS; "$0" "$WCCP_BIN" --one "${cases[$i]}" >"$out/$i" 2>&1 </dev/null; status=$?
                echo $((SECONDS - began)) >"$out/$i.seconds"; exit $status) &
            running+=($!)
        done
        for i in "${!cases[@]}"; do
            wait "${running[$i]}" || { failed=1; echo "FAILED  ${cases[$i]}"; sed 's/^/        /' "$out/$i"; continue; }
            echo "ok      ${cases[$i]}  $(cat "$out/$i.seconds") s"
        done
        exit $failed
    fi
    LAB_CASE=$3
    lab_enter "$0" "$@"
}
lab_case() { "case_$LAB_CASE"; }

# ---- what cases share

die() {
    echo "$*" >&2
    tail -n "${LAB_TAIL-12}" "$LAB"/*.log "$LAB"/*.out >&2
    exit 1
}
# An appliance with its programs and a configuration.
appliance() { # NAME ADDRESS [TEXT]...
    lab_appliance "$1" "$2"
    lab_appliance_start "$1" "${@:3}"
}
# What a router says of a group: the expression sees it as $g.
router_is() { # NAME SECONDS GROUP JQ
    lab_wait "$2" ".groups[\"$3\"] as \$g | $4" lab_ctl "$1" show || die "router $1"
}
# The same, when the router simulates several.
router_at_is() { # NAME ADDRESS SECONDS GROUP JQ
    lab_wait "$3" ".groups[\"$4\"] as \$g | $5" lab_ctl "$1" "@$2" show || die "router $1 at $2"
}
shares() { # ADDRESS BUCKETS : a JQ for router_is
    echo "([\$g.assignment.buckets[]? | select(. == \"$1\")] | length) == $2"
}
role() { # APPLIANCE SECONDS GROUP ROLE
    lab_wait_role "$2" "$1" "$3" "$4" || die "role of group $3 in $1"
}
says() { # APPLIANCE SECONDS LINE (extended regular expression)
    lab_wait_log "$2" "$1" "$3" || die "log of $1"
}
# What the appliance itself says of a group, as nested objects: .oper, .router["1"].state
group_is() { # APPLIANCE SECONDS GROUP JQ
    lab_wait "$2" "$4" lab_state "$1" "$3" || die "group $3 of $1"
}
# An appliance with a proxy; KEEP as lab_proxy has it.
proxied() { # NODE ADDRESS KEEP [TEXT]...
    lab_appliance "$1" "$2"
    lab_gateway "$1" 10.0.0.1
    # shellcheck disable=SC2086
    lab_proxy "$1" 3129 $3
    lab_appliance_start "$1" "${@:4}"
}
# The appliances own all of the group's table, and their proxies are up.
ready() { # GROUP APPLIANCE...
    local group=$1 node; shift
    router_is r1 60 "$group" "([\$g.assignment.buckets[]?, \$g.assignment.masks[]?.values[].owner] | unique | length == $# and all(.[]; .))"
    for node; do state_is "$node" 20 intercept 'length > 0 and all(.[]; .proxy == "up" and .active)'; done
}
# Nodes of tunneld below /qv/tunneld/KIND/state, as nested objects.
state() { # NODE KIND
    lab_manage "$1" walk "/qv/tunneld/$2/state" 2>/dev/null | jq -c '
        (arrays // []) |
        (reduce (.[].name | split("/") | range(1; length) as $depth | .[:$depth] | join("/")) as $above ({}; .[$above] = true)) as $parents |
        map(select($parents[.name] | not)) |
        reduce .[] as $node ({}; setpath($node.name | split("/")[5:]; $node.value))'
}
state_is() { # NODE SECONDS KIND JQ
    lab_wait "$2" "$4" state "$1" "$3" || die "$3 of $1"
}
configure() { # APPLIANCE [TEXT]...
    lab_configure "$@" || die "configuration of $1"
}
# The end of a case: every appliance ends in order, and nothing was said at error level that isn't explained.
finish() { # APPLIANCE... [-- EXPLAINED...]
    local nodes=() node
    while [ $# -gt 0 ] && [ "$1" != -- ]; do nodes+=("$1"); shift; done
    [ $# -eq 0 ] || shift
    lab_end "${nodes[@]}" || die "the end"
    for node in "${nodes[@]}"; do lab_clean_log "$node" "$@" || die "not clean"; done
}
