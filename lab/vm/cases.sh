#!/bin/bash
# cases.sh [CASE...]: inside the virtual machine: the cases of traffic through the kernel's data plane, then those of
# scenario.sh one at a time, since they measure. The last one reboots the machine, and this is then run again.
export LAB_PLANE=kernel
programs=$PWD/build/release/bin
failed=0
cases() { # SCRIPT CASE...
    ran=yes
    "$1" "$programs" "${@:2}" || failed=1
    sync
}
wanted() { # CASE... : those that this run is for
    local one
    for one; do [ ${#asked[@]} = 0 ] || [[ " ${asked[*]} " = *" $one "* ]] || continue; echo "$one"; done
}
asked=("$@")

if [ -n "$VM_REBOOTED" ]; then
    read -r failed <state/failed
    cases lab/vm/scenario.sh after_reboot
    exit "$failed"
fi
mapfile -t traffic < <(sed -n 's/^case_\([a-z0-9_]*\)() {.*/\1/p' tests/scenario_traffic.sh)
mapfile -t traffic < <(wanted "${traffic[@]}")
[ ${#traffic[@]} = 0 ] || cases tests/scenario_traffic.sh "${traffic[@]}"
export LAB_SIDE_BY_SIDE=1
mapfile -t own < <(wanted throughput wccpd_killed many)
[ ${#own[@]} = 0 ] || cases lab/vm/scenario.sh "${own[@]}"
if [ -n "$(wanted reboot)" ]; then
    ran=yes
    if lab/vm/scenario.sh "$programs" before_reboot; then
        echo $failed >state/failed
        : >state/reboot
    else
        failed=1
    fi
fi
[ -n "${ran-}" ] || { echo "vm: no such case"; failed=2; }
exit "$failed"
