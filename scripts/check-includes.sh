#!/bin/bash
# check-includes.sh: no room includes a higher one. One row for each room: the rooms that its files may include.
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
# Alarms leave the engine as management events.
alarms='^engine/wccp_alarm[a-z_]*\.(cpp|h):'
status=0
for room in "${!may[@]}"; do
    found=$(git grep -nE '^ *# *include "' -- "$room/*.cpp" "$room/*.h" | grep -vE "\"(${may[$room]// /|})/" |
        { if [ "$room" = engine ]; then grep -vE "$alarms.*\"mgmt/"; else cat; fi; } || true)
    [ -z "$found" ] || { printf '%s\n' "$found"; status=1; }
done
[ $status = 0 ] || echo "check-includes.sh: these includes leave their room upwards" >&2
exit $status
