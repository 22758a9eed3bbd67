#!/bin/bash
# demo.sh [--capture FILE] [--plain] [--speed N] [--no-build]
# A client, a server, a router that redirects, and two appliances with a proxy each, in namespaces of their own. One
# appliance joins, and downloads run through it. The other joins, and the designated one distributes 256 hash buckets by
# weight: pages that the client fetches come through both proxies in these proportions, while the downloads continue.
# Then a proxy is killed and started again; then its whole appliance dies. The fetches continue. On a terminal the demo
# shows what it waits for, who has answered the last fetches, and below that `mgmtctl show --watch` of the appliance
# that survives. Without a terminal it prints a line for each step. Takes some 75 seconds, installs and builds what is
# missing, and leaves nothing running.
#   --capture FILE   write the packets of the protocol and of redirected flows to FILE, for tshark or wireshark
#   --plain          print lines on a terminal as well
#   --speed N        run the protocol N times as fast as real time (default 2)
#   --no-build       use the programs in $WCCP_BIN
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
        [[ ${2?a number} =~ ^[1-9][0-9]*(\.[0-9]+)?$ ]] || { echo "demo: --speed $2: not a positive number" >&2; exit 2; }
        export LAB_SPEED=$2; shift 2 ;;
    --no-build) build=''; shift ;;
    *) sed -n '2,13s/^# \{0,1\}//p' "$0"; exit 2 ;;
    esac
done
own_rows=7
exec {screen}>&1
measure_terminal() { # sets `rows` and `columns`
    read -r rows columns < <(stty size <&"$screen" 2>/dev/null)
}
measure_terminal
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

# The process outside the namespaces owns the terminal. When the demo ends, for whatever reason, it waits until no process
# inside can write any more (all of them hold the pipe open), restores the screen, and then prints the collected lines.
restore_terminal() {
    local nothing
    trap '' INT TERM HUP
    exec 2>/dev/null {alive}>&- # suppresses the shell's messages about killed processes
    read -r -t 5 nothing <&"$all_ended"
    printf '\033[0m\033[?25h\033[?1049l'
    cat <&"$collected"
}
if [ -z "$plain" ] && [ "${LAB_INSIDE-}" != 1 ]; then
    scratch=$(mktemp -d) || exit 1
    mkfifo "$scratch/pipe" || exit 1
    exec {both}<>"$scratch/pipe" {all_ended}<"$scratch/pipe" {alive}>"$scratch/pipe"
    exec {lines_fd}>"$scratch/lines" {collected}<"$scratch/lines"
    exec {both}>&-
    rm -r "$scratch"
    export lines_fd
    trap restore_terminal EXIT
    trap 'exit 130' INT
    trap 'exit 143' TERM HUP
    trap '' TSTP # the screen could not be restored
    printf '\033[?1049h\033[?25l\033[H\033[J'
fi
lab_enter "$0" "${arguments[@]}"
[ -n "$plain" ] || exec 2>&"$lines_fd"

# --- The nodes

declare -A address=([r1]=10.0.0.1 [a1]=10.0.0.101 [a2]=10.0.0.102) weight=([a1]=60 [a2]=100)
survivor=a2
everyone="client c1, server s1, router r1 ${address[r1]}, appliances a1 ${address[a1]} a2 ${address[a2]}"

# --- Output: lines with the time of the protocol's clock

began_us=${EPOCHREALTIME/[.,]/}
speed_milli=$(awk "BEGIN { printf \"%d\", $LAB_SPEED * 1000 }")
read_clock() { # sets `now`: seconds since the start, in the time of the protocol
    now=$(((${EPOCHREALTIME/[.,]/} - began_us) * speed_milli / 1000000000))
}
print_line() {
    local now line
    read_clock
    printf -v line '%d:%02d %s\n' $((now / 60)) $((now % 60)) "$*"
    if [ -n "$plain" ]; then printf '%s' "$line"; else printf '%s' "$line" >&"$lines_fd"; fi
}

step='' awaited='' expected=0 step_began=0
begin_step() { # TEXT
    step=$1 expected=0
    print_line "$step"
    [ -n "$plain" ] || draw
}
typed=('' '') # the last command, in two lines

# Runs mgmtctl in an appliance, as an operator would.
run_mgmtctl() { # APPLIANCE WORDS...
    local command answer node=$1 rest; shift
    command="$node# mgmtctl $*"
    print_line "  $command"
    rest=${command:${columns:=80}-1}
    typed=("${command:0:columns-1}" "    $rest")
    [ -n "$plain" ] || draw
    answer=$(lab_in "$node" "$WCCP_BIN/mgmtctl" "$@") || lab_die "mgmtctl $* failed in $node"
    print_line "  $answer"
    [ -n "$rest" ] || typed[1]="    $answer"
}

# --- State: that of the router by its control socket, that of the appliances by mgmtctl

members='' seen='{}' pages='' fetched='{}'
read_state() {
    members=$(lab_ctl r1 members 51)
    seen=$(lab_manage $survivor show)
    fetch_pages 32 0.4
}
# Fetches a page from each of this many addresses of the client; `pages` becomes a line that shows who answered.
fetch_pages() { # COUNT TIMEOUT
    fetched=$(lab_fetch c1 --count "$1" --sources "$1" --parallel "$1" --timeout "$2")
    pages=$(jq -r '(.fetched + .failed) as $all | def part: "\(.) (\(100 * . / $all | round)%)";
        "of \($all) pages a1 \(.proxies.a1 // 0 | part)  a2 \(.proxies.a2 // 0 | part)  server alone \(.proxies[""] // 0 | part)  none \(.failed | part)"' \
        <<<"$fetched")
}
# Fetches pages from 120 addresses of the client and prints who answered.
browse() {
    fetch_pages 120 1
    print_line "  c1: $pages"
}
# The downloads last until some ten seconds, in the time of the protocol, after a1 has joined.
downloads=16
begin_downloads() {
    local rate=100000
    nsenter -t "${LAB_INIT[c1]}" --net "$WCCP_BIN/wccp_router" fetch --from 10.1.0.128 10.2.0.2 --sources $downloads \
        --count $downloads --parallel $downloads --rate $rate --size "$((rate * 1000 * 36 / speed_milli + rate * 3))" \
        </dev/null >"$LAB/downloads" 2>>"$LAB/c1.out" &
    LAB_PID[c1/downloads]=$!
    print_line "  c1: $downloads downloads begin, $((rate / 1000)) kB/s each"
}
downloads_are_over() { ! lab_alive c1 downloads; }
print_downloads() {
    local passed
    passed=$(lab_manage a1 get /qv/tunneld/protection/state/passed | jq -r '[.. | .value? // empty][0]')
    print_line "  c1: of $downloads downloads $(jq -r '"\(.fetched) complete, \(.failed) broken; by a2 \(.proxies.a2 // 0)"' "$LAB/downloads"); a1 passed $passed packets of them to a2"
    [ "$(jq .failed "$LAB/downloads")" = 0 ] || lab_die "downloads broke: $(cat "$LAB/downloads")"
}
print_group() { # GROUP
    # shellcheck disable=SC2016
    print_line "  $(jq -r --argjson id "$1" --arg node $survivor '
        {"10.0.0.101": "a1", "10.0.0.102": "a2"} as $names |
        .groups[] | select(.id == $id) |
        "group \($id): \($node) is \(.state)\(if .designated then ", designated" else "" end)" +
        ([.tables[] | "; \(.kind): " + (reduce .buckets[] as $run ({};
            .[$names[$run.appliance // ""] // "nobody"] += $run.last - $run.first + 1) |
            to_entries | map("\(.key) \(.value)") | join(", "))] | join("")) +
        "; " + (.appliances | "asked " + (map("\(.asked_percent)%") | join(", ")) + "; has " + (map("\(.share_percent)%") | join(", ")))' <<<"$seen")"
}

# Draws the rows above `mgmtctl show` with a single write, because mgmtctl, another process, draws as well.
draw() {
    local now text row gone bar='' i cells=20 lines styles=(0 1 0 32 36 36 2)
    [ -z "${NO_COLOR-}" ] || styles=(0 0 0 0 0 0 0)
    read_clock
    measure_terminal
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

switch_show() { # on | off : `mgmtctl show --watch`
    [ -z "$plain" ] || return 0
    if [ "$1" = on ]; then
        (cd / && exec nsenter -t "${LAB_INIT[$survivor]}" --net --mount --root --ipc --pid \
            "$WCCP_BIN/mgmtctl" show --watch --below $own_rows) </dev/null 2>>"$LAB/show.out" &
        LAB_PID[$survivor/show]=$!
    else
        lab_stop $survivor show || lab_die "mgmtctl show exited with $?"
    fi
}

await() { # LIMIT EXPECTED WHAT CONDITION... : in seconds of the protocol's time
    local limit=$1 now wall=$SECONDS; expected=$2 awaited=$3; shift 3
    read_clock
    step_began=$now
    print_line "  waiting for $awaited: about $expected s"
    while :; do
        read_state
        [ -n "$plain" ] || draw
        if "$@"; then break; fi
        # The extra 10 seconds are for the work of the programs, which the faster clock does not speed up.
        if [ $(((SECONDS - wall - 10) * speed_milli / 1000)) -ge "$limit" ]; then
            echo "demo: timeout of $limit s while waiting for $awaited" >&2
            printf '%s\n' "$members" "$fetched" "$seen" >&2
            tail -n 5 "$LAB"/*.log "$LAB"/*.out >&2
            exit 1
        fi
        sleep 0.4
    done
    read_clock
    print_line "  after $((now - step_began)) s"
    expected=0
}

# --- Conditions

members_are() { # COUNT
    [ "$(grep -c . <<<"$members")" = "$1" ]
}
member_is_queried() { grep -q ' 1$' <<<"$members" || members_are 1; }
group_is() { # JQ : in the state that the surviving appliance reports
    jq -e ".groups[] | select(.id == 51) | $1" <<<"$seen" >/dev/null 2>&1
}
pages_are() { # JQ : over the result of the last fetch_pages
    jq -e "$1" <<<"$fetched" >/dev/null
}
# Every bucket of the one table has an owner, and the appliances have these shares.
shares='(.tables | length == 1 and all(.[].buckets[]; .appliance)) and (.appliances | map(.share_percent))'

# --- The steps

begin_step "Start of $everyone"
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
switch_show on
browse
join() { # APPLIANCE
    run_mgmtctl "$1" group add 51 interface eth0 router ${address[r1]} weight "${weight[$1]}" assign hash
    run_mgmtctl "$1" intercept add 51 port 80 to 3129 interval 2 fall 2 rise 1
}
begin_step 'Here-I-Am, I-See-You: the router accepts an appliance that has echoed its receive id'
join a2
await 30 11 'a2 at the router' members_are 1
await 40 17 'the first hash table' group_is "$shares == [100]"
await 10 1 'pages from the proxy of a2' pages_are '.proxies | keys == ["a2"]'
browse
begin_step 'Downloads begin, through the proxy of a2; a1 joins'
begin_downloads
join a1
await 30 11 'both appliances at the router' members_are 2
begin_step 'a1 has the lowest address: it is elected, and computes the table'
await 40 17 'a table for both' group_is "$shares == [37, 62]"
print_group 51
await 10 1 'pages from both proxies' pages_are '.proxies | .a1 > 0 and .a2 > 0 and (has("") | not)'
typed=('' '')
lab_ctl r1 traffic reset >"$LAB/traffic"
browse
lab_ctl r1 traffic >"$LAB/traffic"
print_line "  r1: $(jq -r '{"10.0.0.101": "a1", "10.0.0.102": "a2"} as $names | .appliances | (map(.flows) | add) as $all | to_entries | map("\($names[.key]) \(.value.flows) flows (\(100 * .value.flows / $all | round)%)") | join(", ")' "$LAB/traffic"); weights ${weight[a1]} and ${weight[a2]}"
await 40 10 'the end of the downloads' downloads_are_over
print_downloads

begin_step 'The proxy of a1 is killed: a1 gives its flows back, and they go to the server'
lab_stop a1 proxy KILL 2>/dev/null
browse
await 20 4 'the health check of a1' eval "lab_in a1 $WCCP_BIN/mgmtctl --json intercept show 51 | jq -e '[.. | .proxy? // empty] == [\"down\"]' >/dev/null"
browse
begin_step 'The proxy of a1 starts again'
lab_proxy a1
await 20 2 'pages from both proxies' pages_are '.proxies | .a1 > 0 and .a2 > 0 and (has("") | not)'
browse

begin_step 'a1 dies; the router redirects to it for 25 s more, then sends a Removal Query'
lab_kill a1
await 45 25 'a Removal Query of the router' member_is_queried
browse
begin_step 'No answer: the router drops a1, and sends its flows to the server'
await 20 5 'the end of its membership' members_are 1
browse
begin_step 'a2 learns of it by the next I-See-You, is elected, and computes a table'
await 60 27 'the first hash table of a2' group_is ".designated and ($shares == [100])"
print_group 51
await 10 1 'all pages from a2' pages_are '.failed == 0 and (.proxies | keys == ["a2"])'
browse
switch_show off
[ -z "$capture" ] || { lab_capture_end; chmod a+r "$capture"; print_line "packets: $capture"; }
print_line "$survivor# mgmtctl show"
if [ -n "$plain" ]; then exec {lines_fd}>&1; fi
if [ -n "$plain${NO_COLOR-}" ]; then colour=''; else colour=--colour; fi
# shellcheck disable=SC2086
lab_in $survivor "$WCCP_BIN/mgmtctl" show $colour >&"$lines_fd" || lab_die "mgmtctl show failed"
lab_end $survivor || lab_die "$survivor did not shut down cleanly"
exit 0
