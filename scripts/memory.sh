#!/bin/bash
# memory.sh PID: the memory of a process by room, in kB: resident and locked. All memory of the daemon is locked, so
# each mapped page counts, also one that other processes have mapped as well.
#
# Rooms: the program and its libraries, with their constants and the libraries' own variables; stacks, that of the
# main thread and those of the others, which are anonymous mappings right after a guard page; heap, also where
# malloc took mappings of its own; shared blocks; tables, which are the program's own variables.
set -eu
awk '
    function room_of(name, perms, from) {
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
        room = room_of($6, $2, place[1])
        last = room; end = place[2]
    }
    /^Rss:/ { kb = $2; resident[room] += kb; all += kb }
    /^VmFlags:/ && / lo( |$)/ { locked[room] += kb; all_locked += kb }
    END {
        for (room in resident)
            if (resident[room]) printf "%-22s resident %7d kB  locked %7d kB\n", room, resident[room], locked[room] | "sort"
        close("sort")
        printf "%-22s resident %7d kB  locked %7d kB\n", "all", all, all_locked
    }' "/proc/$1/smaps"
