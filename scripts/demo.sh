#!/bin/bash
# demo.sh [--capture FILE] [--plain] [--speed N] [--no-build]
# Two routers and two appliances in namespaces of their own: they find each other, elect a designated appliance, share
# 256 hash buckets by weight, then the values of a mask; an operator changes a weight; the designated appliance dies,
# and the other takes over. On a terminal `mgmtctl show --watch` of the appliance that survives stays on the screen,
# below what is awaited and for how long; without one there is a line for each step. Takes some two minutes, installs
# and builds what is missing, leaves nothing running.
#   --capture FILE   keep the packets, for tshark or wireshark
#   --plain          lines, on a terminal as well
#   --speed N        all protocol times N times as fast
#   --no-build       take the programs from $WCCP_BIN
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
capture='' plain='' build=yes
arguments=("$@")
while [ $# -gt 0 ]; do
    case $1 in
    --capture) capture=$(readlink -f "${2?a file}") || exit 2; shift 2 ;;
    --plain) plain=yes; shift ;;
    --speed)
        [[ ${2?a number} =~ ^[1-9][0-9]*(\.[0-9]+)?$ ]] || { echo "demo: a speed of $2?" >&2; exit 2; }
        export LAB_SPEED=$2; shift 2 ;;
    --no-build) build=''; shift ;;
    *) sed -n '2,11s/^# \{0,1\}//p' "$0"; exit 2 ;;
    esac
done
own_rows=6
exec {screen}>&1
measure() { # sets `rows` and `columns` of the terminal
    read -r rows columns < <(stty size <&"$screen" 2>/dev/null)
}
measure
[ "${TERM-dumb}" != dumb ] && [ "${rows:-0}" -ge $((own_rows + 12)) ] && [ "${columns:-0}" -ge 60 ] || plain=yes

if [ "${LAB_INSIDE-}" != 1 ] && [ -n "$build" ]; then
    # shellcheck disable=SC2086
    "$top/scripts/install-deps.sh" build lab ${capture:+capture} || exit 1
    echo "building (build/release)"
    mkdir -p "$top/build"
    log=$top/build/demo-build.log
    (cd "$top" && cmake --preset release && cmake --build --preset release -j "$(nproc)" \
        --target wccp_router mgmtd mgmtctl tunneld wccpd fast_clock) >"$log" 2>&1 || { tail -n 30 "$log"; exit 1; }
fi
: "${WCCP_BIN:=$top/build/release/bin}"
export WCCP_BIN
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"

# The outer side has the terminal: whatever ends the demo, it waits until nobody inside can write any more (each of
# them holds the pipe), gives the screen back, and then shows what was told meanwhile.
give_back() {
    local nothing
    trap '' INT TERM HUP
    exec 2>/dev/null {everybody}>&- # no word of the shell's about what was killed
    read -r -t 5 nothing <&"$everybody_gone"
    printf '\033[0m\033[?25h\033[?1049l'
    cat <&"$told"
}
if [ -z "$plain" ] && [ "${LAB_INSIDE-}" != 1 ]; then
    scratch=$(mktemp -d) || exit 1
    mkfifo "$scratch/pipe" || exit 1
    exec {both}<>"$scratch/pipe" {everybody_gone}<"$scratch/pipe" {everybody}>"$scratch/pipe"
    exec {tell}>"$scratch/told" {told}<"$scratch/told"
    exec {both}>&-
    rm -r "$scratch"
    export tell
    trap give_back EXIT
    trap 'exit 130' INT
    trap 'exit 143' TERM HUP
    trap '' TSTP # there is nothing to come back to
    printf '\033[?1049h\033[?25l\033[H\033[J'
fi
lab_enter "$0" "${arguments[@]}"
[ -n "$plain" ] || exec 2>&"$tell"

# ---- who takes part

declare -A address=([r1]=10.0.0.1 [r2]=10.0.0.2 [a1]=10.0.0.101 [a2]=10.0.0.102)
survivor=a2
everyone="routers r1 ${address[r1]} r2 ${address[r2]}, appliances a1 ${address[a1]} a2 ${address[a2]}"

# ---- the output: lines with the time of the protocol's clock

began_us=${EPOCHREALTIME/[.,]/}
speed_milli=$(awk "BEGIN { printf \"%d\", $LAB_SPEED * 1000 }")
clock() { # sets `now`, seconds of the protocol since the beginning
    now=$(((${EPOCHREALTIME/[.,]/} - began_us) * speed_milli / 1000000000))
}
say() {
    local now line
    clock
    printf -v line '%d:%02d %s\n' $((now / 60)) $((now % 60)) "$*"
    if [ -n "$plain" ]; then printf '%s' "$line"; else printf '%s' "$line" >&"$tell"; fi
}

step='' awaited='' expected=0 step_began=0
tell_step() {
    step=$1 expected=0
    say "$step"
    [ -n "$plain" ] || draw
}
typed=('' '') # two lines of what was typed last

# The words that an operator would type, in one of the appliances.
operate() { # APPLIANCE WORDS OF mgmtctl...
    local command answer node=$1 rest; shift
    command="$node# mgmtctl $*"
    say "  $command"
    rest=${command:${columns:=80}-1}
    typed=("${command:0:columns-1}" "    $rest")
    [ -n "$plain" ] || draw
    answer=$(lab_in "$node" "$WCCP_BIN/mgmtctl" "$@") || lab_die "$node refuses: $*"
    say "  $answer"
    [ -n "$rest" ] || typed[1]="    $answer"
}

# ---- what is seen: of the routers' side by asking them, of the appliances' by mgmtctl

declare -A members_of
seen='{}'
look() {
    local id
    for id in 51 52; do
        members_of[$id]=$(lab_ctl r1 members $id; echo; lab_ctl r2 members $id)
    done
    seen=$(lab_manage $survivor show)
}
fact() { # GROUP : in a line
    # shellcheck disable=SC2016
    say "  $(jq -r --argjson id "$1" --arg node $survivor '
        {"10.0.0.101": "a1", "10.0.0.102": "a2"} as $names |
        .groups[] | select(.id == $id) |
        "group \($id): \($node) is \(.state)\(if .designated then ", designated" else "" end)" +
        ([.tables[] | "; \(.kind): " + (reduce .buckets[] as $run ({};
            .[$names[$run.appliance // ""] // "nobody"] += $run.last - $run.first + 1) |
            to_entries | map("\(.key) \(.value)") | join(", "))] | join("")) +
        "; " + (.appliances | "asked " + (map("\(.asked_percent)%") | join(", ")) + "; has " + (map("\(.share_percent)%") | join(", ")))' <<<"$seen")"
}

# The rows above the live picture, in one piece, since that is drawn by another process.
draw() {
    local now text row gone bar='' i cells=20 lines styles=(0 1 0 36 36 2)
    clock
    measure
    gone=$((now - step_began))
    for ((i = 0; i < cells; i++)); do
        if [ $((i * expected)) -lt $((gone * cells)) ]; then bar+='#'; else bar+='.'; fi
    done
    if [ "$expected" -gt 0 ]; then bar+=" $gone s of about $expected: $awaited"; else bar=''; fi
    printf -v text '%d:%02d  %s' $((now / 60)) $((now % 60)) "$everyone"
    printf -v row '%*s' "$columns" ''
    row="--- $survivor# mgmtctl show --watch ${row// /-}"
    lines=("$text" "$step" "$bar" "${typed[0]}" "${typed[1]}" "$row")
    text=''
    for ((i = 0; i < own_rows; i++)); do
        text+=$'\033['$((i + 1))$'H\033['"${styles[i]}m${lines[i]:0:columns-1}"$'\033[0m\033[K'
    done
    printf '%s' "$text"
}

live() { # begins | ends : the picture below
    [ -z "$plain" ] || return 0
    if [ "$1" = begins ]; then
        (cd / && exec nsenter -t "${LAB_INIT[$survivor]}" --net --mount --root --ipc --pid \
            "$WCCP_BIN/mgmtctl" show --watch --below $own_rows) </dev/null 2>>"$LAB/show.out" &
        LAB_PID[$survivor/show]=$!
    else
        lab_stop $survivor show || lab_die "the live picture ended with $?"
    fi
}

await() { # LIMIT EXPECTED WHAT CONDITION... : seconds of the protocol
    local limit=$1 now wall=$SECONDS; expected=$2 awaited=$3; shift 3
    clock
    step_began=$now
    say "  waiting for $awaited: about $expected s"
    while :; do
        look
        [ -n "$plain" ] || draw
        if "$@"; then break; fi
        # The programs themselves are no faster by the faster clock.
        if [ $(((SECONDS - wall - 10) * speed_milli / 1000)) -ge "$limit" ]; then
            echo "demo: after $limit s still no $awaited" >&2
            printf '%s\n' "${members_of[@]}" "$seen" >&2
            tail -n 5 "$LAB"/*.log "$LAB"/*.out >&2
            exit 1
        fi
        sleep 0.4
    done
    clock
    say "  after $((now - step_began)) s"
    expected=0
}

# ---- conditions

members_are() { # GROUP COUNT : at both routers together
    [ "$(grep -c . <<<"${members_of[$1]}")" = "$2" ]
}
asked() { [[ ${members_of[51]} = *' 1'$'\n'* ]] || [[ ${members_of[51]} = *' 1' ]] || members_are 51 2; }
group_is() { # GROUP JQ : what the survivor tells of it
    jq -e --argjson id "$1" ".groups[] | select(.id == \$id) | $2" <<<"$seen" >/dev/null 2>&1
}
# Every bucket of a group's one table has an owner, and the appliances have these shares.
shares='(.tables | length == 1 and all(.[].buckets[]; .appliance)) and (.appliances | map(.share_percent))'

# ---- the story

tell_step "Start of $everyone"
[ -z "$capture" ] || lab_capture "$capture" || exit 1
lab_router r1 ${address[r1]}
lab_router r2 ${address[r2]}
for a in a1 a2; do
    lab_appliance $a "${address[$a]}"
    lab_appliance_start $a
done
live begins
routers="router ${address[r1]} router ${address[r2]}"
tell_step 'Here-I-Am, I-See-You: an appliance is in once it has echoed what a router sent'
# shellcheck disable=SC2086
operate a2 group add 51 interface eth0 $routers weight 100 assign hash
lab_sleep 1.2 # a1 hears of a2 with its own second I-See-You when a2 speaks first; otherwise ten seconds later
# shellcheck disable=SC2086
operate a1 group add 51 interface eth0 $routers weight 60 assign hash
await 30 11 'both appliances at both routers' members_are 51 4
tell_step 'a1 has the lowest address: it is elected, and makes the table'
await 40 17 'the first hash table' group_is 51 "$shares == [37, 62]"
fact 51

tell_step 'A second group by mask: Here-I-Am, I-See-You'
# shellcheck disable=SC2086
operate a2 group add 52 interface eth0 $routers assign mask mask-dst-ip 0x3f
lab_sleep 1.2
# shellcheck disable=SC2086
operate a1 group add 52 interface eth0 $routers assign mask mask-dst-ip 0x3f
await 30 11 'both appliances at both routers' members_are 52 4
tell_step 'a1 is elected here too; meanwhile the operator gives a2 more of group 51'
operate a2 group set 51 weight 180
await 40 17 'the first mask table' group_is 52 "$shares == [50, 50]"
fact 52
tell_step 'a1 hears of the weight with an I-See-You, and makes a new table of group 51'
await 40 2 'the hash table by the new weights' group_is 51 "$shares == [25, 75]"
fact 51

tell_step 'a1 dies without a word; the routers send it traffic for 25 s more, then ask'
typed=('' '')
lab_kill a1
await 45 25 'a Removal Query of the routers' asked
tell_step 'No answer: the routers drop a1'
await 20 5 'the end of its memberships' members_are 51 2
fact 51
tell_step 'a2 hears of it with its next I-See-You'
await 30 10 'the election of a2' eval 'group_is 51 .designated && group_is 52 .designated'
tell_step 'a2 is elected, and makes tables of its own'
await 40 17 'the first hash table of a2' group_is 51 "$shares == [100]"
await 40 1 'the mask table of a2' group_is 52 "$shares == [100]"
fact 51
fact 52
live ends
[ -z "$capture" ] || { lab_capture_end; chmod a+r "$capture"; say "packets: $capture"; }
say "$survivor# mgmtctl show"
if [ -n "$plain" ]; then exec {tell}>&1; colour=''; else colour=--colour; fi
# shellcheck disable=SC2086
lab_in $survivor "$WCCP_BIN/mgmtctl" show $colour >&"$tell" || lab_die "no picture"
lab_end $survivor || lab_die "the appliance did not end in order"
exit 0
