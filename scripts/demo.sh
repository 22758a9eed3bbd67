#!/bin/bash
# demo.sh [--capture FILE] [--plain] [--no-build]
# Two routers and two appliances in namespaces of their own: they find each other, elect a designated appliance, share
# 256 hash buckets by weight, then the values of a mask; the designated appliance dies, and the other takes over.
# Shows what is awaited and for how long, and the owner of each bucket as a coloured strip; without a terminal it
# prints a line for each step. Takes some two minutes, installs and builds what is missing, leaves nothing running.
#   --capture FILE   keep the packets, for tshark or wireshark
#   --no-build       take the programs from $WCCP_BIN
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
capture='' plain='' build=yes
arguments=("$@")
while [ $# -gt 0 ]; do
    case $1 in
    --capture) capture=$(readlink -f "${2?a file}") || exit 2; shift 2 ;;
    --plain) plain=yes; shift ;;
    --no-build) build=''; shift ;;
    *) sed -n '2,8s/^# \{0,1\}//p' "$0"; exit 2 ;;
    esac
done
[ -t 1 ] && [ "${TERM-dumb}" != dumb ] || plain=yes

if [ "${LAB_INSIDE-}" != 1 ] && [ -n "$build" ]; then
    # shellcheck disable=SC2086
    "$top/scripts/install-deps.sh" build lab ${capture:+capture} || exit 1
    echo "building (build/release)"
    mkdir -p "$top/build"
    log=$top/build/demo-build.log
    (cd "$top" && cmake --preset release && cmake --build --preset release -j "$(nproc)" --target wccp_router mgmtd mgmtctl tunneld wccpd) \
        >"$log" 2>&1 || { tail -n 30 "$log"; exit 1; }
fi
: "${WCCP_BIN:=$top/build/release/bin}"
export WCCP_BIN
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_farewell() { [ -n "$plain" ] || printf '\033[?25h\033[?7h\033[0m'; }
lab_enter "$0" "${arguments[@]}"

# ---- who takes part

declare -A address=([r1]=10.0.0.1 [r2]=10.0.0.2 [a1]=10.0.0.101 [a2]=10.0.0.102) weight=([a1]=60 [a2]=100)
declare -A letter=([10.0.0.101]=A [10.0.0.102]=B) colour=([10.0.0.101]=4 [10.0.0.102]=3 [-]=0)
appliances=(a2 a1)
declare -A groups_of # the configuration of each appliance

group_add() { # ID ASSIGNMENT
    local a
    for a in "${appliances[@]}"; do
        # A hears of B with its own second I-See-You when B speaks first; otherwise ten seconds later.
        [ "$a" != a1 ] || lab_sleep 1.2
        groups_of[$a]+=$(lab_group "$1" 10.0.0.1 10.0.0.2 "weight=${weight[$a]}" "assign_method=$2" mask_dst_ip=0x3f)$'\n'
        lab_configure "$a" "${groups_of[$a]}" || lab_die "$a refuses group $1"
    done
}

# ---- what is seen

declare -A owners_of members_of brief_of
look() { # at everything, once
    local id a state designated
    for id in 51 52; do
        owners_of[$id]=$(lab_ctl r1 owners $id)
        members_of[$id]=$(lab_ctl r1 members $id; echo; lab_ctl r2 members $id)
    done
    for a in "${appliances[@]}"; do
        while read -r id state designated; do brief_of[$a/$id]="$state $designated"; done < <(lab_manage "$a" show |
            jq -r '.groups[] | "\(.id) \(.state) \(if .designated then "designated" else "" end)"')
    done
}

# Two buckets in a cell, two lines of 64 cells; or one value in two cells.
draw_strip() { # OWNER...
    local n=0 per_line=64 left right line=''
    if [ $# -le 64 ]; then
        for left; do line+="\033[48;5;${colour[$left]:-1}m "; n=$((n + 1)); done
        printf "  $line\033[0m\033[K\n"
        return
    fi
    while [ $# -gt 1 ]; do
        left=$1 right=$2; shift 2
        line+="\033[38;5;${colour[$left]:-1};48;5;${colour[$right]:-1}m▌"
        n=$((n + 1))
        if [ $((n % per_line)) = 0 ]; then printf "  $line\033[0m\033[K\n"; line=''; fi
    done
}
# "A 96, B 160" in the order of the table
draw_runs() { # OWNER...
    local last='' n=0 text='' owner
    for owner in "$@" ''; do
        if [ "$owner" != "$last" ]; then
            [ -n "$last" ] && text+="${text:+, }${letter[$last]:-nobody} $n"
            last=$owner n=0
        fi
        n=$((n + 1))
    done
    echo "$text"
}

step='' awaited='' expected=0 step_began=0 drawn=0
clock() { printf '%d:%02d' $((SECONDS / 60)) $((SECONDS % 60)); }

picture() {
    local id a words kind key change owners text
    {
        printf '\033[1mwccpd: two routers, two appliances\033[0m   %s\033[K\n\033[K\n' "$(clock)"
        printf '  routers     r1 10.0.0.1   r2 10.0.0.2\033[K\n'
        for a in a1 a2; do
            text="gone"
            [ -n "${LAB_INIT[$a]-}" ] && text=${brief_of[$a/51]-} && text=${text%% *} && [[ ${brief_of[$a/51]-} = *designated* ]] && text+=", designated"
            printf "  appliance   \033[48;5;${colour[${address[$a]}]}m %s \033[0m %s  weight %-3s  %s\033[K\n" "${letter[${address[$a]}]}" \
                "${address[$a]}" "${weight[$a]}" "$text"
        done
        for id in 51 52; do
            read -r kind key change owners <<<"${owners_of[$id]}"
            printf '\033[K\n'
            # shellcheck disable=SC2086
            if [ "$kind" = hash ] || [ "$kind" = mask ]; then
                set -- $owners
                printf "  group $id   by $kind: $(draw_runs "$@")   (table $change of ${letter[$key]:-$key})\033[K\n"
                draw_strip "$@"
                [ $# -gt 64 ] || printf '\033[K\n' # two lines, whatever the table
            else
                printf "  group $id   no table\033[K\n\033[K\n\033[K\n"
            fi
        done
        printf '\033[K\n  \033[1m%s\033[0m\033[K\n  %s\033[K\n' "$step" "$(waiting)"
    } >"$LAB/picture"
    [ $drawn = 0 ] || printf '\033[%dA' "$drawn"
    cat "$LAB/picture"
    drawn=$(wc -l <"$LAB/picture")
}
waiting() {
    local gone=$((SECONDS - step_began)) bar='' i
    for ((i = 0; i < 30; i++)); do
        if [ $((i * expected)) -lt $((gone * 30)) ]; then bar+='#'; else bar+='.'; fi
    done
    echo "$bar  $gone s of about $expected: $awaited"
}

await() { # LIMIT EXPECTED WHAT CONDITION...
    local limit=$1 last=''; expected=$2 awaited=$3 step_began=$SECONDS; shift 3
    [ -z "$plain" ] || echo "$(clock) $step: waiting for $awaited, about $expected s"
    while :; do
        look
        [ -n "$plain" ] || picture
        if "$@"; then break; fi
        if [ $((SECONDS - step_began)) -ge "$limit" ]; then
            echo "demo: after $limit s still no $awaited" >&2
            printf '%s\n' "${owners_of[@]}" "${members_of[@]}" "${brief_of[@]}" >&2
            tail -n 5 "$LAB"/*.log "$LAB"/*.out >&2
            exit 1
        fi
        sleep 0.3
    done
    [ -z "$plain" ] || echo "$(clock)   after $((SECONDS - step_began)) s"
}
show_table() { # ID
    local kind key change owners
    [ -n "$plain" ] || return 0
    read -r kind key change owners <<<"${owners_of[$1]}"
    # shellcheck disable=SC2086
    echo "$(clock)   group $1 by $kind, table $change of ${letter[$key]:-$key}: $(draw_runs $owners)"
}

# ---- conditions

members_are() { # GROUP COUNT : at both routers together
    [ "$(grep -c . <<<"${members_of[$1]}")" = "$2" ]
}
table_of() { # GROUP ADDRESS : every slot has an owner, by a table of that appliance
    local kind key change owners
    read -r kind key change owners <<<"${owners_of[$1]}"
    [ "$key" = "$2" ] && [[ " $owners " != *' - '* ]]
}
asked() { [[ ${members_of[51]} = *' 1'$'\n'* ]] || [[ ${members_of[51]} = *' 1' ]] || members_are 51 2; }
designated() { [[ ${brief_of[$1/51]-} = *designated* ]] && [[ ${brief_of[$1/52]-} = *designated* ]]; } # APPLIANCE

# ---- the story

# no cursor, and no second line of what is too long for the terminal
[ -n "$plain" ] || printf '\033[?25l\033[?7l'
SECONDS=0
step='two routers and two appliances start'
[ -z "$capture" ] || lab_capture "$capture" || exit 1
lab_router r1 10.0.0.1
lab_router r2 10.0.0.2
for a in a1 a2; do
    lab_appliance $a "${address[$a]}"
    lab_appliance_start $a
done
group_add 51 hash
step='Here-I-Am, I-See-You: an appliance is in once it has echoed what a router sent'
await 30 11 'four memberships (two appliances at two routers)' members_are 51 4
step='A has the lowest address: it is elected, and makes the table'
await 40 17 'the first hash table' table_of 51 10.0.0.101
show_table 51

group_add 52 mask
step='a second group by mask: Here-I-Am, I-See-You'
await 30 11 'four memberships' members_are 52 4
step='A is elected here too, and shares out the values of the mask'
await 40 17 'the first mask table' table_of 52 10.0.0.101
show_table 52

lab_kill a1
appliances=(a2)
unset 'brief_of[a1/51]' 'brief_of[a1/52]'
step='A dies without a word; the routers go on sending it traffic'
await 45 25 'a Removal Query from the routers (25 s of silence)' asked
step='no answer: the routers drop A'
await 20 5 'the end of its memberships' members_are 51 2
show_table 51
step='B hears of it with its next I-See-You'
await 30 10 'the election of B' designated a2
step='B is elected, and makes a table of its own'
await 40 17 'the first table of B' table_of 51 10.0.0.102
await 40 1 'the mask table of B' table_of 52 10.0.0.102
show_table 51
show_table 52
[ -z "$capture" ] || { lab_capture_end; chmod a+r "$capture"; echo "packets: $capture"; }
lab_end a2 || lab_die "the appliance did not end in order"
if [ -n "$plain" ]; then echo "$(clock) done"; fi
exit 0
