#!/bin/bash
# demo.sh [--capture FILE] [--plain] [--speed N] [--no-build]
# A client, a server, a router that redirects, and two appliances with a proxy each, in namespaces of their own: one
# joins, and downloads run through it; the other joins, the designated one shares 256 hash buckets by weight, and pages
# that the client fetches come through the proxies in these shares, while the downloads go on. Then the proxy of one is
# killed, and starts again; then the whole appliance dies. The fetches go on. On a terminal `mgmtctl show --watch` of the
# appliance that survives stays on the screen, below what is awaited, for how long, and by whom the last pages came;
# without one there is a line for each step. Takes some 75 seconds, installs and builds what is missing, leaves nothing
# running.
#   --capture FILE   keep the packets of the protocol and of redirected flows, for tshark or wireshark
#   --plain          lines, on a terminal as well
#   --speed N        all protocol times N times as fast (default 2)
#   --no-build       take the programs from $WCCP_BIN
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
capture='' plain='' build=yes
arguments=("$@")
: "${LAB_SPEED:=2}"
export LAB_SPEED LAB_PLANE=
while [ $# -gt 0 ]; do
    case $1 in
    --capture) capture=$(readlink -f "${2?a file}") || exit 2; shift 2 ;;
    --plain) plain=yes; shift ;;
    --speed)
        [[ ${2?a number} =~ ^[1-9][0-9]*(\.[0-9]+)?$ ]] || { echo "demo: a speed of $2?" >&2; exit 2; }
        export LAB_SPEED=$2; shift 2 ;;
    --no-build) build=''; shift ;;
    *) sed -n '2,13s/^# \{0,1\}//p' "$0"; exit 2 ;;
    esac
done
own_rows=7
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

declare -A address=([r1]=10.0.0.1 [a1]=10.0.0.101 [a2]=10.0.0.102) weight=([a1]=60 [a2]=100)
survivor=a2
everyone="client c1, server s1, router r1 ${address[r1]}, appliances a1 ${address[a1]} a2 ${address[a2]}"

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

members='' seen='{}' pages='' fetched='{}'
look() {
    members=$(lab_ctl r1 members 51)
    seen=$(lab_manage $survivor show)
    fetch_pages 32 0.4
}
# Pages for so many addresses of the client; who has answered.
fetch_pages() { # COUNT TIMEOUT
    fetched=$(lab_fetch c1 --count "$1" --sources "$1" --parallel "$1" --timeout "$2")
    pages=$(jq -r '(.fetched + .failed) as $all | def part: "\(.) (\(100 * . / $all | round)%)";
        "of \($all) pages a1 \(.proxies.a1 // 0 | part)  a2 \(.proxies.a2 // 0 | part)  server alone \(.proxies[""] // 0 | part)  none \(.failed | part)"' \
        <<<"$fetched")
}
# In a line, what 120 addresses of the client get.
browse() {
    fetch_pages 120 1
    say "  c1: $pages"
}
# They last while a1 joins, and some ten seconds of the protocol longer.
downloads=16
begin_downloads() {
    local rate=100000
    nsenter -t "${LAB_INIT[c1]}" --net "$WCCP_BIN/wccp_router" fetch --from 10.1.0.128 10.2.0.2 --sources $downloads \
        --count $downloads --parallel $downloads --rate $rate --size "$((rate * 1000 * 36 / speed_milli + rate * 3))" \
        </dev/null >"$LAB/downloads" 2>>"$LAB/c1.out" &
    LAB_PID[c1/downloads]=$!
    say "  c1: $downloads downloads begin, $((rate / 1000)) kB/s each"
}
downloads_are_over() { ! lab_alive c1 downloads; }
tell_downloads() {
    local passed
    passed=$(lab_manage a1 get /qv/tunneld/protection/state/passed | jq -r '[.. | .value? // empty][0]')
    say "  c1: of $downloads downloads $(jq -r '"\(.fetched) complete, \(.failed) broken; by a2 \(.proxies.a2 // 0)"' "$LAB/downloads"); a1 passed $passed packets of them to a2"
    [ "$(jq .failed "$LAB/downloads")" = 0 ] || lab_die "downloads broke: $(cat "$LAB/downloads")"
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
    local now text row gone bar='' i cells=20 lines styles=(0 1 0 32 36 36 2)
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
    lines=("$text" "$step" "$bar" "${pages:+c1: }$pages" "${typed[0]}" "${typed[1]}" "$row")
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
            printf '%s\n' "$members" "$fetched" "$seen" >&2
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

members_are() { # COUNT
    [ "$(grep -c . <<<"$members")" = "$1" ]
}
asked() { grep -q ' 1$' <<<"$members" || members_are 1; }
group_is() { # JQ : what the survivor says of it
    jq -e ".groups[] | select(.id == 51) | $1" <<<"$seen" >/dev/null 2>&1
}
pages_are() { # JQ : of those of the last look
    jq -e "$1" <<<"$fetched" >/dev/null
}
# Every bucket of the one table has an owner, and the appliances have these shares.
shares='(.tables | length == 1 and all(.[].buckets[]; .appliance)) and (.appliances | map(.share_percent))'

# ---- the story

tell_step "Start of $everyone"
lab_router r1 ${address[r1]} -- --redirect c1=51 --forward gre --return gre
lab_client c1 r1
lab_server s1 r1
[ -z "$capture" ] || lab_capture "$capture" || exit 1
for a in a1 a2; do
    lab_appliance $a "${address[$a]}"
    lab_gateway $a ${address[r1]}
    lab_proxy $a
    lab_appliance_start $a
done
live begins
browse
join() { # APPLIANCE
    operate "$1" group add 51 interface eth0 router ${address[r1]} weight "${weight[$1]}" assign hash
    operate "$1" intercept add 51 port 80 to 3129 interval 2 fall 2 rise 1
}
tell_step 'Here-I-Am, I-See-You: an appliance is in once it has echoed what the router sent'
join a2
await 30 11 'a2 at the router' members_are 1
await 40 17 'the first hash table' group_is "$shares == [100]"
await 10 1 'pages from the proxy of a2' pages_are '.proxies | keys == ["a2"]'
browse
tell_step 'Downloads begin, through the only proxy; a1 joins'
begin_downloads
join a1
await 30 11 'both appliances at the router' members_are 2
tell_step 'a1 has the lowest address: it is elected, and makes the table'
await 40 17 'a table for both' group_is "$shares == [37, 62]"
fact 51
await 10 1 'pages from both proxies' pages_are '.proxies | .a1 > 0 and .a2 > 0 and (has("") | not)'
typed=('' '')
lab_ctl r1 traffic reset >"$LAB/traffic"
browse
lab_ctl r1 traffic >"$LAB/traffic"
say "  r1: $(jq -r '{"10.0.0.101": "a1", "10.0.0.102": "a2"} as $names | .appliances | (map(.flows) | add) as $all | to_entries | map("\($names[.key]) \(.value.flows) flows (\(100 * .value.flows / $all | round)%)") | join(", ")' "$LAB/traffic"); weights ${weight[a1]} and ${weight[a2]}"
await 40 10 'the end of the downloads' downloads_are_over
tell_downloads

tell_step 'The proxy of a1 is killed: a1 gives its flows back, and they go to the server'
lab_stop a1 proxy KILL 2>/dev/null # no word of the shell's
browse
await 20 4 'the health check of a1' eval "lab_in a1 $WCCP_BIN/mgmtctl --json intercept show 51 | jq -e '[.. | .proxy? // empty] == [\"down\"]' >/dev/null"
browse
tell_step 'It starts again'
lab_proxy a1
await 20 2 'pages from both proxies' pages_are '.proxies | .a1 > 0 and .a2 > 0 and (has("") | not)'
browse

tell_step 'a1 dies without a word; the router sends it its share for 25 s more, then asks'
lab_kill a1
await 45 25 'a Removal Query of the router' asked
browse
tell_step 'No answer: the router drops a1, and routes what it had'
await 20 5 'the end of its membership' members_are 1
browse
tell_step 'a2 hears of it with its next I-See-You, is elected, and makes a table'
await 60 27 'the first hash table of a2' group_is ".designated and ($shares == [100])"
fact 51
await 10 1 'all pages from a2' pages_are '.failed == 0 and (.proxies | keys == ["a2"])'
browse
live ends
[ -z "$capture" ] || { lab_capture_end; chmod a+r "$capture"; say "packets: $capture"; }
say "$survivor# mgmtctl show"
if [ -n "$plain" ]; then exec {tell}>&1; colour=''; else colour=--colour; fi
# shellcheck disable=SC2086
lab_in $survivor "$WCCP_BIN/mgmtctl" show $colour >&"$tell" || lab_die "no picture"
lab_end $survivor || lab_die "the appliance did not end in order"
exit 0
