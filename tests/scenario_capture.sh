#!/bin/bash
# The demo runs to its end without a terminal, and tshark finds nothing wrong in the packets that it has written. On a
# terminal it shows `mgmtctl show --watch`; when it is interrupted, it restores the terminal and leaves no process.
#   scenario_capture.sh DIRECTORY_OF_THE_PROGRAMS
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin} LAB_SPEED=${LAB_SPEED:-8}
command -v tshark >/dev/null && command -v tcpdump >/dev/null || { echo "tshark or tcpdump is not installed"; exit 77; }
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
file=$scratch/demo.pcap
failed=0
fail() { echo "FAILED: $*"; failed=1; }

"$top/scripts/demo.sh" --no-build --plain --capture "$file" </dev/null >"$scratch/out" 2>&1 || fail "the demo exited with $?"
cat "$scratch/out"
for line in '  group 51: a2 is ACTIVE; hash: a1 96, a2 160; asked 38%, 63%; has 37%, 62%' \
    '  c1: of 120 pages a1 45 (38%)  a2 75 (63%)  server alone 0 (0%)  none 0' '  r1: a1 .* (3[78]%), a2 .* (6[23]%); weights 60 and 100' \
    '  c1: of 16 downloads 16 complete, 0 broken; by a2 16; a1 passed [1-9]' \
    '  c1: of 120 pages a1 0 (0%)  a2 75 (63%)  server alone 45 (38%)  none 0' \
    '  c1: of 120 pages a1 0 (0%)  a2 120 (100%)  server alone 0 (0%)  none 0' '51  ACTIVE, designated  up .*  weight 100'; do
    grep -q "$line" "$scratch/out" || fail "the demo did not print: $line"
done

run_tshark() { tshark -r "$file" "$@" 2>/dev/null; }
expect_packets() { # WHAT FILTER LEAST MOST
    local n
    n=$(run_tshark -Y "$2" | wc -l)
    [ "$n" -ge "$3" ] && [ "$n" -le "$4" ] || fail "$1: $n packets, expected $3 to $4"
}
expect_packets "WCCP" "udp.port == 2048 && wccp" 25 500
expect_packets "redirected" "gre.proto == 0x883e" 1000 100000
expect_packets "to or from the port of WCCP, but not WCCP" "udp.port == 2048 && !wccp" 0 0
bad=$(run_tshark -Y '_ws.malformed || _ws.expert.severity == error || _ws.expert.group == "Malformed"' -T fields -e frame.number -e _ws.expert.message)
[ -z "$bad" ] || fail "tshark reports: $bad"
expect_packets "Here-I-Am" "wccp.message == 10" 10 200
expect_packets "I-See-You" "wccp.message == 11" 10 200
expect_packets "Redirect-Assign" "wccp.message == 12" 2 50 # the first table of each
expect_packets "Removal Query" "wccp.message == 13" 1 4

# `mgmtctl show` is drawn below the demo's seven rows. ^C is typed as soon as it appears.
mark=demo-$$-$RANDOM
coproc typist { until grep -aq 'wccpd Ready' "$scratch/screen" 2>/dev/null; do sleep 0.2; done; sleep 0.5; printf '\003'; sleep 5; }
DEMO_MARK=$mark TERM=xterm timeout 60 script -qfec "stty rows 24 columns 80; exec '$top/scripts/demo.sh' --no-build" "$scratch/screen" \
    <&"${typist[0]}" >/dev/null; status=$?
[ $status = 130 ] || fail "the interrupted demo exited with $status"
grep -aq $'^\033\\[?1049h' "$scratch/screen" && grep -aq $'\033\\[8Hwccpd Ready\|\033\\[8H\033\\[1mwccpd Ready' "$scratch/screen" &&
    grep -aq -- '--- a2# mgmtctl show --watch ---' "$scratch/screen" || fail "no live display: $(cat -v "$scratch/screen")"
tr -d '\r' <"$scratch/screen" | awk -v 'RS=\033[[][?]1049l' 'END { exit !(NR == 2 && /^0:0[0-9] Start of client/ && !/\033/) }' ||
    fail "the terminal was not restored: $(tail -n 20 "$scratch/screen" | cat -v)"
left=$(grep -lzx "DEMO_MARK=$mark" /proc/[0-9]*/environ 2>/dev/null)
[ -z "$left" ] || fail "the interrupted demo left running: $left"
exit $failed
