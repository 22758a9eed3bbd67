#!/bin/bash
# The demo runs to its end without a terminal, by the faster clock, and tshark finds nothing wrong in the packets that it
# kept. On a terminal it shows the live picture; interrupted, it gives the terminal back and leaves no process.
#   scenario_capture.sh DIRECTORY_OF_THE_PROGRAMS
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin}
export LAB_SPEED=${LAB_SPEED:-8}
command -v tshark >/dev/null && command -v tcpdump >/dev/null || { echo "no tshark or no tcpdump"; exit 77; }
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
file=$scratch/demo.pcap
failed=0
fail() { echo "FAILED: $*"; failed=1; }

"$top/scripts/demo.sh" --no-build --plain --capture "$file" </dev/null >"$scratch/out" 2>&1 || fail "the demo ended with $?"
cat "$scratch/out"
for line in '  group 51: a2 is ACTIVE; hash: a1 96, a2 160; asked 38%, 63%; has 37%, 62%' \
    '  c1: of 120 pages a1 45 (38%)  a2 75 (63%)  server alone 0 (0%)  none 0' '  r1: a1 .* (3[78]%), a2 .* (6[23]%); weights 60 and 100' \
    '  c1: of 16 downloads 16 complete, 0 broken; by a2 16; a1 passed [1-9]' \
    '  c1: of 120 pages a1 0 (0%)  a2 75 (63%)  server alone 45 (38%)  none 0' \
    '  c1: of 120 pages a1 0 (0%)  a2 120 (100%)  server alone 0 (0%)  none 0' '51  ACTIVE, designated  up .*  weight 100'; do
    grep -q "$line" "$scratch/out" || fail "the demo does not say: $line"
done

shark() { tshark -r "$file" "$@" 2>/dev/null; }
count() { shark -Y "$1" | wc -l; }
expect() { # WHAT FILTER LEAST MOST
    local n
    n=$(count "$2")
    [ "$n" -ge "$3" ] && [ "$n" -le "$4" ] || fail "$1: $n packets, wanted $3 to $4"
}
expect "WCCP" "udp.port == 2048 && wccp" 25 500
expect "redirected" "gre.proto == 0x883e" 1000 100000
expect "not WCCP, of what went to or from its port" "udp.port == 2048 && !wccp" 0 0
bad=$(shark -Y '_ws.malformed || _ws.expert.severity == error || _ws.expert.group == "Malformed"' -T fields -e frame.number -e _ws.expert.message)
[ -z "$bad" ] || fail "tshark finds fault with: $bad"
expect "Here-I-Am" "wccp.message == 10" 10 200
expect "I-See-You" "wccp.message == 11" 10 200
expect "Redirect-Assign" "wccp.message == 12" 2 50 # the first table of each
expect "Removal Query" "wccp.message == 13" 1 4

# The snapshot is below the demo's seven rows; ^C comes when it does.
mark=demo-$$-$RANDOM
coproc typist { until grep -aq 'wccpd Ready' "$scratch/screen" 2>/dev/null; do sleep 0.2; done; sleep 0.5; printf '\003'; sleep 5; }
DEMO_MARK=$mark TERM=xterm timeout 60 script -qfec "stty rows 24 columns 80; exec '$top/scripts/demo.sh' --no-build" "$scratch/screen" \
    <&"${typist[0]}" >/dev/null; status=$?
[ $status = 130 ] || fail "the interrupted demo ended with $status"
grep -aq $'^\033\\[?1049h' "$scratch/screen" && grep -aq $'\033\\[8Hwccpd Ready\|\033\\[8H\033\\[1mwccpd Ready' "$scratch/screen" &&
    grep -aq -- '--- a2# mgmtctl show --watch ---' "$scratch/screen" || fail "no live picture: $(cat -v "$scratch/screen")"
tr -d '\r' <"$scratch/screen" | awk -v 'RS=\033[[][?]1049l' 'END { exit !(NR == 2 && /^0:0[0-9] Start of client/ && !/\033/) }' ||
    fail "the terminal is not given back: $(tail -n 20 "$scratch/screen" | cat -v)"
left=$(grep -lzx "DEMO_MARK=$mark" /proc/[0-9]*/environ 2>/dev/null)
[ -z "$left" ] || fail "the interrupted demo leaves $left"
exit $failed
