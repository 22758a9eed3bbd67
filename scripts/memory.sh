#!/bin/bash
# memory.sh PID: resident and locked memory of a process by use, in kB. wccpd locks all of its memory; therefore each
# mapped page counts, even if it is shared with other processes.
#
# Uses: the program and its libraries, with constants and the libraries' variables; stacks (those of threads are anonymous
# mappings after a guard page); heap, including separate mappings of malloc; shared blocks; tables, which are the program's
# own variables.
set -eu
awk '
    function use_of(name, perms, from) {
        if (name ~ /^\[heap\]/) return "heap"
        if (name ~ /^\[stack/) return "stacks"
        if (name ~ /^\[/) return "kernel pages"
        if (name ~ /^\/SYSV/) return "shared blocks"
        if (name ~ /\.so/) return "libraries"
        if (name != "") return perms ~ /w/ ? "tables" : "program"
        if (perms ~ /^---/) return "guards"
        if (from == end && last ~ /^(tables|program)$/) return "tables"
        if (from == end && last == "libraries") return "libraries"
        return from == end && last == "guards" ? "stacks" : "heap"
    }
    /^[0-9a-f]+-[0-9a-f]+ / {
        split($1, place, "-")
        use = use_of($6, $2, place[1])
        last = use; end = place[2]
    }
    /^Rss:/ { kb = $2; resident[use] += kb; all += kb }
    /^VmFlags:/ && / lo( |$)/ { locked[use] += kb; all_locked += kb }
    END {
        for (use in resident)
            if (resident[use]) printf "%-22s resident %7d kB  locked %7d kB\n", use, resident[use], locked[use] | "sort"
        close("sort")
        printf "%-22s resident %7d kB  locked %7d kB\n", "all", all, all_locked
    }' "/proc/$1/smaps"
