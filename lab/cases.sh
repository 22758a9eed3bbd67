#!/bin/bash
# cases.sh: for scenarios that consist of several cases. Each case is a lab of its own, and several run at a time.
#
#     source lab/cases.sh
#     lab_cases "$@"          # DIRECTORY_OF_THE_PROGRAMS [CASE...]; returns only inside the lab of one case
#     case_one() { ...; }     # functions whose names begin with case_ are the cases
#     case_two() { ...; }
#     lab_case                # runs the case that this lab is for
#
#   LAB_SIDE_BY_SIDE   how many cases run at a time (default: two for each processor)

# shellcheck source=topology.sh
source "$(dirname "${BASH_SOURCE[0]}")/topology.sh"

lab_cases() {
    WCCP_BIN=$(readlink -f "${1:-$LAB_TOP/build/release/bin}")
    export WCCP_BIN
    if [ "${LAB_INSIDE-}" != 1 ] && [ "${2-}" != --one ]; then
        command -v jq >/dev/null || { echo "jq is not installed"; exit 77; }
        local cases out case i failed=0 limit=${LAB_SIDE_BY_SIDE:-$((2 * $(nproc)))}
        mapfile -t cases < <(sed -n 's/^case_\([a-z0-9_]*\)() {.*/\1/p' "$0")
        [ $# -lt 2 ] || cases=("${@:2}")
        out=$(mktemp -d)
        # shellcheck disable=SC2064
        trap "rm -rf '$out'" EXIT
        local running=()
        for i in "${!cases[@]}"; do
            [ "$i" -lt "$limit" ] || wait -n
            (began=$SECONDS; "$0" "$WCCP_BIN" --one "${cases[$i]}" >"$out/$i" 2>&1 </dev/null &&
                echo $((SECONDS - began)) >"$out/$i.seconds") &
            running+=($!)
        done
        for i in "${!cases[@]}"; do
            wait "${running[$i]}" 2>/dev/null # "wait -n" may have collected it
            [ -e "$out/$i.seconds" ] || { failed=1; echo "FAILED  ${cases[$i]}"; sed 's/^/        /' "$out/$i"; continue; }
            echo "ok      ${cases[$i]}  $(<"$out/$i.seconds") s"
        done
        exit $failed
    fi
    LAB_CASE=$3
    lab_enter "$0" "$@"
}
lab_case() { "case_$LAB_CASE"; }

# --- Functions for cases. Those that wait or check end the case when they fail

die() {
    echo "$*" >&2
    tail -n "${LAB_TAIL-12}" "$LAB"/*.log "$LAB"/*.out >&2
    exit 1
}
start_appliance() { # NAME ADDRESS [TEXT]... : TEXT is its configuration
    lab_appliance "$1" "$2"
    lab_appliance_start "$1" "${@:3}"
}
start_proxied() { # NAME ADDRESS KEEP [TEXT]... : an appliance with a proxy; KEEP is "keep" or empty, as in lab_proxy
    lab_appliance "$1" "$2"
    lab_gateway "$1" 10.0.0.1
    # shellcheck disable=SC2086
    lab_proxy "$1" 3129 $3
    lab_appliance_start "$1" "${@:4}"
}
configure() { # APPLIANCE [TEXT]...
    lab_configure "$@" || die "configuration of $1"
}
# The state of a router; JQ refers to the group as $g.
router_is() { # NAME SECONDS GROUP JQ
    lab_wait "$2" ".groups[\"$3\"] as \$g | $4" lab_ctl "$1" show || die "router $1"
}
router_at_is() { # NAME ADDRESS SECONDS GROUP JQ : one of several routers in a node
    lab_wait "$3" ".groups[\"$4\"] as \$g | $5" lab_ctl "$1" "@$2" show || die "router $1 at $2"
}
shares() { # ADDRESS BUCKETS : prints a JQ for router_is
    echo "([\$g.assignment.buckets[]? | select(. == \"$1\")] | length) == $2"
}
# The state of a group in the appliance, as lab_state prints it: .oper, .router["1"].state
group_is() { # APPLIANCE SECONDS GROUP JQ
    lab_wait "$2" "$4" lab_state "$1" "$3" || die "group $3 of $1"
}
tunneld_is() { # APPLIANCE SECONDS KIND JQ : as lab_tunneld_state prints it
    lab_wait "$2" "$4" lab_tunneld_state "$1" "$3" || die "$3 of $1"
}
explains() { # APPLIANCE SECONDS GROUP CODE [WORDS] : explain has this reason, with WORDS in its cause; GROUP null: of no group
    lab_wait "$2" "any(.reasons[]; .group == $3 and .reason == \"$4\" and .first_ms != null and (.cause | contains(\"${5-}\")))" \
        eval "lab_manage $1 explain || [ \$? = 1 ]" || die "explain of $1 has no $4"
}
wait_role() { # APPLIANCE SECONDS GROUP ROLE
    lab_wait_role "$2" "$1" "$3" "$4" || die "role of group $3 in $1"
}
wait_log() { # APPLIANCE SECONDS EXPRESSION
    lab_wait_log "$2" "$1" "$3" || die "log of $1"
}
# Waits until these appliances own the group's whole table and their proxies are up.
wait_ready() { # GROUP APPLIANCE...
    local group=$1 node; shift
    router_is r1 60 "$group" "([\$g.assignment.buckets[]?, \$g.assignment.masks[]?.values[].owner] | unique | length == $# and all(.[]; .))"
    for node; do tunneld_is "$node" 20 intercept 'length > 0 and all(.[]; .proxy == "up" and .active)'; done
}
# Ends the programs of the appliances, and checks that nothing is left and that no unexpected error was logged.
finish() { # APPLIANCE... [-- EXPECTED...]
    local nodes=() node
    while [ $# -gt 0 ] && [ "$1" != -- ]; do nodes+=("$1"); shift; done
    [ $# -eq 0 ] || shift
    lab_end "${nodes[@]}" || die "end of ${nodes[*]}"
    for node in "${nodes[@]}"; do lab_clean_log "$node" "$@" || die "log of $node"; done
}
