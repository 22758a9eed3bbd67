#!/bin/bash
# topology.sh: a small network of namespaces: a bridge, and on it any number of routers and appliances.
#
# As a library, at the top of a script that was started as a file:
#     source lab/topology.sh
#     lab_enter "$0" "$@"                     # from here on the script runs inside; nothing outlives it
#     lab_router r1 10.0.0.1 -- --form nexus  # wccp_router on that address, its control socket and its log
#     lab_appliance a1 10.0.0.101             # namespaces and a log daemon; no program yet
#     lab_start a1 host wccp_engine_host a.conf
#     lab_wait 30 '.groups["51"].assignment.kind == "hash"' lab_ctl r1 show
# As a command:
#     topology.sh [--routers N] [--appliances N] [COMMAND...]    a network to try things in; a shell without COMMAND
#
# How it holds together: lab_enter runs the script again as the first process of its own process, mount and network
# namespaces (and of a user namespace, when started by an ordinary user). Every other namespace is held by a process
# below that one, no name is bound and no file is made outside, so that whatever ends the script, be it kill -9 of
# any of its processes, ends all of it: the kernel clears away the rest. Files of the lab (logs, sockets) live in
# $LAB, a tmpfs in the private mount namespace; copy out what is to be kept.
#
#   WCCP_BIN    where the programs are (default: build/release/bin)
#   LAB_KEEP    a directory to which logs are copied when the script ends by itself

LAB_HOME=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
LAB_TOP=$(dirname "$LAB_HOME")
: "${WCCP_BIN:=$LAB_TOP/build/release/bin}"
declare -A LAB_INIT LAB_PID # first process of an appliance; programs as NODE/NAME

lab_die() { echo "lab: $*" >&2; exit 1; }

# ---- the outer side

lab_enter() { # SCRIPT ARGUMENTS...
    if [ "${LAB_INSIDE-}" = 1 ]; then lab_set_up; return; fi
    local script user=()
    script=$(readlink -f "$1"); shift
    [ "$(id -u)" = 0 ] || user=(--user --map-root-user)
    # The holder dies with this shell (pdeathsig), and everything with the holder (--kill-child). Started in the
    # background, because a shell runs its traps only then; job control gives neither terminal nor signals away.
    LAB_INSIDE=1 setpriv --pdeathsig KILL bash -c '[ $PPID = "$0" ] && exec "$@"' $$ \
        env --default-signal=INT,QUIT unshare "${user[@]}" --mount --net --pid --fork --kill-child \
        --propagation private bash "$script" "$@" <&0 &
    local holder=$! status
    # shellcheck disable=SC2064
    trap "kill -KILL $holder 2>/dev/null; lab_farewell; exit 130" INT
    # shellcheck disable=SC2064
    trap "kill -KILL $holder 2>/dev/null; lab_farewell; exit 143" TERM HUP
    wait $holder; status=$?
    trap - INT TERM HUP
    lab_farewell
    exit $status
}
# Scripts that change the terminal define this anew, before lab_enter.
lab_farewell() { :; }

# ---- the inner side

lab_set_up() {
    mount -t proc proc /proc || lab_die "no /proc of our own"
    local aside
    for aside in /media /srv /mnt /opt; do
        [ -d $aside ] || continue
        case "$LAB_TOP/ $WCCP_BIN/ $PWD/ ${LAB_KEEP-}/" in $aside/* | *" $aside/"*) ;; *) break ;; esac
    done
    mount -t tmpfs tmpfs $aside || lab_die "no file system of our own"
    LAB=$aside/lab
    mkdir $LAB
    trap 'lab_collect' EXIT
    trap 'exit 130' INT
    trap 'exit 143' TERM HUP
    ip link set lo up
    ip link add lan type bridge mcast_snooping 0 forward_delay 0
    echo 1 >/proc/sys/net/ipv6/conf/all/disable_ipv6 2>/dev/null
    echo 1 >/proc/sys/net/ipv6/conf/default/disable_ipv6 2>/dev/null
    ip address add 10.0.0.254/24 dev lan
    ip link set lan up
}

lab_collect() {
    local status=$?
    [ -n "${LAB_KEEP-}" ] && [ -d "$LAB_KEEP" ] && cp "$LAB"/*.log "$LAB"/*.out "$LAB_KEEP"/ 2>/dev/null
    return $status
}

# Waits until a process has namespaces of its own of that kind.
lab_wait_namespace() { # PID KIND
    local own i
    own=$(readlink "/proc/$$/ns/$2")
    for i in $(seq 200); do
        [ -e "/proc/$1/ns/$2" ] && [ "$(readlink "/proc/$1/ns/$2")" != "$own" ] && return
        sleep 0.02
    done
    lab_die "process $1 has no $2 namespace"
}

# Gives the network namespace of a process an eth0 on the bridge.
lab_plug() { # NODE PID ADDRESS...
    local node=$1 pid=$2 address; shift 2
    ip link add "v-$node" type veth peer name eth0 netns "$pid" || lab_die "no veth for $node"
    ip link set "v-$node" master lan up
    nsenter -t "$pid" --net ip link set lo up
    for address; do nsenter -t "$pid" --net ip address add "$address/24" dev eth0; done
    nsenter -t "$pid" --net ip link set eth0 up
    nsenter -t "$pid" --net ip route add default via 10.0.0.254 2>/dev/null
    return 0
}

# A namespace with wccp_router in it, on one or more addresses.
lab_router() { # NAME ADDRESS... [-- OPTIONS OF wccp_router]
    local node=$1 addresses=() which=(); shift
    while [ $# -gt 0 ] && [ "$1" != -- ]; do addresses+=("$1"); which+=(--router "$1"); shift; done
    [ $# -gt 0 ] && shift
    unshare --net sleep infinity </dev/null &
    LAB_INIT[$node]=$!
    lab_wait_namespace "${LAB_INIT[$node]}" net
    lab_plug "$node" "${LAB_INIT[$node]}" "${addresses[@]}"
    lab_route_start "$node" "${which[@]}" "$@"
}
lab_route_start() { # NAME OPTIONS... : (again) after lab_stop NAME router
    local node=$1; shift
    nsenter -t "${LAB_INIT[$node]}" --net "$WCCP_BIN/wccp_router" --control "$LAB/$node.ctl" --json "$@" \
        </dev/null >>"$LAB/$node.log" 2>&1 &
    LAB_PID[$node/router]=$!
    local i
    for i in $(seq 100); do
        [ -S "$LAB/$node.ctl" ] && return
        kill -0 $! 2>/dev/null || break
        sleep 0.05
    done
    cat "$LAB/$node.log" >&2
    lab_die "router $node did not start"
}

# Namespaces of an appliance, with a log daemon as their first process: when it dies, all in there dies with it.
lab_appliance() { # NAME ADDRESS...
    local node=$1 outer i; shift
    "$LAB_HOME/in-appliance" "$WCCP_BIN/wccp_router" logd - </dev/null >"$LAB/$node.log" 2>"$LAB/$node.out" &
    outer=$!
    for i in $(seq 200); do
        LAB_INIT[$node]=$(cat "/proc/$outer/task/$outer/children" 2>/dev/null)
        LAB_INIT[$node]=${LAB_INIT[$node]%% *}
        # ready when the log daemon has taken the place of the shell that set it up
        [ -n "${LAB_INIT[$node]}" ] && [ "$(cat "/proc/${LAB_INIT[$node]}/comm" 2>/dev/null)" = wccp_router ] &&
            [ -S "/proc/${LAB_INIT[$node]}/root/dev/log" ] && break
        kill -0 $outer 2>/dev/null || { cat "$LAB/$node.out" >&2; lab_die "appliance $node did not start"; }
        sleep 0.02
    done
    cp "$LAB_TOP"/packaging/*.conf "/proc/${LAB_INIT[$node]}/root/etc/opt/rvl/" || lab_die "no platform files for $node"
    lab_plug "$node" "${LAB_INIT[$node]}" "$@"
}

# Runs a command inside a node: an appliance with all its namespaces, a router with its network.
lab_in() { # NAME COMMAND...
    local node=$1 all=(); shift
    [ -n "${LAB_INIT[$node]-}" ] || lab_die "there is no $node"
    # The root as well: the whole lab may run inside a chroot.
    [ -n "${LAB_PID[$node/router]-}" ] || all=(--mount --root --ipc --pid)
    (cd / && exec nsenter -t "${LAB_INIT[$node]}" --net "${all[@]}" "$@")
}

# Starts a program inside an appliance; a bare name is one of ours. Its output goes to $LAB/NODE-NAME.out.
lab_start() { # NODE NAME PROGRAM ARGUMENTS...
    local node=$1 name=$2 program=$3; shift 3
    [ -n "${LAB_INIT[$node]-}" ] || lab_die "there is no $node"
    case $program in */*) ;; *) program=$WCCP_BIN/$program ;; esac
    (cd / && exec nsenter -t "${LAB_INIT[$node]}" --net --mount --root --ipc --pid "$program" "$@") \
        </dev/null >>"$LAB/$node-$name.out" 2>&1 &
    LAB_PID[$node/$name]=$!
}

# The process that a program runs in, as seen from here.
lab_pid() { # NODE NAME
    local pid=${LAB_PID[$1/$2]-}
    [ -n "$pid" ] || lab_die "there is no $2 in $1"
    if [ "$2" = router ]; then echo "$pid"; else cat "/proc/$pid/task/$pid/children" 2>/dev/null; fi
}
lab_alive() { # NODE NAME
    kill -0 "${LAB_PID[$1/$2]}" 2>/dev/null
}
# Sends a signal to a program (TERM), and waits for it to end; the result is its status, or 124 after 15 seconds.
lab_stop() { # NODE NAME [SIGNAL]
    local pid=${LAB_PID[$1/$2]} inner i
    inner=$(lab_pid "$1" "$2")
    # shellcheck disable=SC2086
    [ -n "$inner" ] && kill -s "${3-TERM}" $inner
    for i in $(seq 300); do
        kill -0 "$pid" 2>/dev/null || { wait "$pid"; return; }
        sleep 0.05
    done
    return 124
}
# The whole node at once, as if its power had gone.
lab_kill() { # NODE
    local key pids=("${LAB_INIT[$1]}")
    for key in "${!LAB_PID[@]}"; do
        [ "${key%/*}" = "$1" ] || continue
        pids+=("${LAB_PID[$key]}")
        unset "LAB_PID[$key]"
    done
    { kill -KILL "${pids[@]}"; wait "${pids[@]}"; } 2>/dev/null
    ip link del "v-$1" 2>/dev/null
    unset "LAB_INIT[$1]"
}
lab_link() { # NODE up|down : the cable of a node
    ip link set "v-$1" "$2"
}

lab_ctl() { # ROUTER COMMAND... : one command to a router
    local node=$1; shift
    "$WCCP_BIN/wccp_router" ctl "$LAB/$node.ctl" "$@"
}

# Runs the command until its output, JSON, makes the jq expression true: 0, or 1 when the seconds are over (and the
# last output is shown).
lab_wait() { # SECONDS EXPRESSION COMMAND...
    local limit=$1 expression=$2 began=$SECONDS last; shift 2
    while :; do
        last=$("$@" 2>&1) && jq -e "$expression" <<<"$last" >/dev/null 2>&1 && return 0
        [ $((SECONDS - began)) -lt "$limit" ] || break
        sleep 0.2
    done
    echo "lab: after $limit s still not: $expression" >&2
    [ "${#last}" -lt 4000 ] && echo "$last" >&2
    return 1
}
# The same for a line of text in a file (an extended regular expression).
lab_wait_line() { # SECONDS EXPRESSION FILE
    local began=$SECONDS
    until grep -Eq -- "$2" "$3" 2>/dev/null; do
        [ $((SECONDS - began)) -lt "$1" ] || { echo "lab: after $1 s no line in $3: $2" >&2; return 1; }
        sleep 0.2
    done
}

# Writes what passes the bridge to a file until the lab ends or lab_capture_end. tcpdump wants to change its user and
# groups, which a user namespace of an ordinary user refuses: dumpcap, which comes with tshark, does it there.
lab_capture() { # FILE
    local with=(tcpdump -i lan --immediate-mode -U -Z root -w "$1" udp port 2048) said='listening on'
    if [ "$(cat /proc/self/setgroups)" = deny ]; then
        with=(dumpcap -q -P -i lan -f 'udp port 2048' -w "$1") said='Capturing on'
    fi
    "${with[@]}" </dev/null >"$LAB/capture.out" 2>&1 &
    LAB_CAPTURE=$!
    lab_wait_line 20 "$said" "$LAB/capture.out" || { cat "$LAB/capture.out" >&2; return 1; }
}
lab_capture_end() {
    sleep 1.2
    kill -INT "$LAB_CAPTURE"; wait "$LAB_CAPTURE"
}

# ---- as a command

if [ "${BASH_SOURCE[0]}" = "$0" ]; then
    lab_enter "$0" "$@"
    routers=2 appliances=2
    while [ $# -gt 0 ]; do
        case $1 in
        --routers) routers=$2; shift 2 ;;
        --appliances) appliances=$2; shift 2 ;;
        --) shift; break ;;
        -*) echo "usage: topology.sh [--routers N] [--appliances N] [COMMAND...]" >&2; exit 2 ;;
        *) break ;;
        esac
    done
    for n in $(seq "$routers"); do lab_router "r$n" "10.0.0.$n"; done
    for n in $(seq "$appliances"); do lab_appliance "a$n" "10.0.0.$((100 + n))"; done
    export LAB WCCP_BIN LAB_HOME LAB_TOP
    nodes=$(declare -p LAB_INIT LAB_PID)
    export nodes
    if [ $# -gt 0 ]; then "$@"; exit; fi
    echo "routers: r1..r$routers at 10.0.0.1.. ; appliances: a1..a$appliances at 10.0.0.101.. ; files in $LAB"
    echo "lab_in a1 COMMAND, lab_ctl r1 show, lab_start a1 NAME PROGRAM, lab_stop a1 NAME, lab_capture FILE; exit ends all"
    bash --rcfile <(echo "source '$LAB_HOME/topology.sh'; PS1='lab\\$ '; ${nodes//declare/declare -g}") -i
fi
