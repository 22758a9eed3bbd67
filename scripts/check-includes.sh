#!/bin/bash
# check-includes.sh: checks that no room (top-level directory) includes a higher one. Each row lists the rooms that the
# files of a room may include.
set -eu
cd "$(dirname "$0")/.."
declare -A may=(
    [runtime]="runtime"
    [mgmt]="runtime mgmt"
    [platform]="runtime platform"
    [engine]="runtime platform engine"
    [daemon]="runtime platform mgmt engine daemon"
    [peers]="runtime mgmt platform peers"
    [lab]="runtime mgmt platform peers lab"
)
# The exception: alarms leave the engine as management events.
alarms='^engine/wccp_alarm[a-z_]*\.(cpp|h):'
status=0
for room in "${!may[@]}"; do
    found=$(git grep -nE '^ *# *include "' -- "$room/*.cpp" "$room/*.h" | grep -vE "\"(${may[$room]// /|})/" |
        { if [ "$room" = engine ]; then grep -vE "$alarms.*\"mgmt/"; else cat; fi; } || true)
    [ -z "$found" ] || { printf '%s\n' "$found"; status=1; }
done
[ $status = 0 ] || echo "check-includes.sh: these rooms may not include each other" >&2
exit $status
