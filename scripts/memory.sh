#!/bin/bash
# memory.sh PID: the memory of a process by room, in kB: resident and locked. All memory of the daemon is locked, so
# each mapped page counts.
set -eu
awk '
    /^[0-9a-f]+-[0-9a-f]+ / {
        name = $6
        if (name ~ /^\[heap\]/) room = "heap"
        else if (name ~ /^\[stack/) room = "stacks"
        else if (name ~ /^\/SYSV/) room = "shared blocks"
        else if (name ~ /\/bin\/|\/sbin\//) room = perms_write($2) ? "tables" : "program"
        else if (name ~ /\.so/) room = "libraries"
        else if (name == "") room = "stacks and anonymous"
        else room = "other"
    }
    /^Rss:/ { rss[room] += $2; total += $2 }
    /^Locked:/ { locked[room] += $2; all += $2 }
    function perms_write(perms) { return perms ~ /w/ }
    END {
        for (room in rss) printf "%-22s resident %7d kB  locked %7d kB\n", room, rss[room], locked[room] | "sort"
        close("sort")
        printf "%-22s resident %7d kB  locked %7d kB\n", "all", total, all
    }' "/proc/$1/smaps"
