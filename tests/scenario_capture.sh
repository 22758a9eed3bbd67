#!/bin/bash
# The demo runs to its end without a terminal, by the faster clock, and tshark finds nothing wrong in the packets that it kept.
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

shark() { tshark -r "$file" "$@" 2>/dev/null; }
count() { shark -Y "$1" | wc -l; }
expect() { # WHAT FILTER LEAST MOST
    local n
    n=$(count "$2")
    [ "$n" -ge "$3" ] && [ "$n" -le "$4" ] || fail "$1: $n packets, wanted $3 to $4"
}
expect "WCCP" wccp 60 1000
expect "not WCCP, of what went to or from its port" "udp.port == 2048 && !wccp" 0 0
bad=$(shark -Y '_ws.malformed || _ws.expert.severity == error || _ws.expert.group == "Malformed"' -T fields -e frame.number -e _ws.expert.message)
[ -z "$bad" ] || fail "tshark finds fault with: $bad"
expect "Here-I-Am" "wccp.message == 10" 20 400
expect "I-See-You" "wccp.message == 11" 20 400
# To two routers: A's first table twice, its second and both of B's at least once.
expect "Redirect-Assign" "wccp.message == 12" 10 100
expect "Removal Query" "wccp.message == 13" 2 8
exit $failed
