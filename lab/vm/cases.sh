#!/bin/bash
# cases.sh [CASE...]: inside the virtual machine: cases of scenario.sh and tests/scenario_traffic.sh; without a word,
# those that a test run has time for. `life` reboots the machine at its end, and this is then run again.
: "${LAB_PLANE:=kernel}" "${LAB_SIDE_BY_SIDE:=2}"
export LAB_PLANE LAB_SIDE_BY_SIDE
[ $# -gt 0 ] || set -- life l2_mask l2_returned_by_gre
failed=0
if [ -n "$VM_REBOOTED" ]; then
    read -r failed <state/failed
    set -- after_reboot
fi
lab/vm/scenario.sh "$PWD/build/release/bin" "$@" || failed=1
echo "$failed" >state/failed
exit "$failed"
