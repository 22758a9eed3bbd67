#!/bin/bash
# topology.sh: a small network of namespaces: a bridge, and on it any number of routers and appliances.
#
# As a library, at the top of a script that was started as a file:
#     source lab/topology.sh
#     lab_enter "$0" "$@"                     # from here on the script runs inside; nothing outlives it
#     lab_router r1 10.0.0.1 -- --form nexus  # wccp_router on that address, its control socket and its log
#     lab_appliance a1 10.0.0.101             # namespaces and a log daemon; no program yet
#     lab_appliance_start a1 "$(lab_group 51 10.0.0.1 weight=7)"      # mgmtd, tunneld and wccpd, each ready
#     lab_wait_role 30 a1 51 ACTIVE
#     lab_wait 30 '.groups["51"].assignment.kind == "hash"' lab_ctl r1 show
#     lab_configure a1 "$(lab_group 51 10.0.0.1 weight=9)"            # all of the configuration anew
#     lab_end a1                              # stopped in order; nothing is left
#     lab_clean_log a1 'a line at error level that is explained'
# As a command:
#     topology.sh [--routers N] [--appliances N] [COMMAND...]    a network to try things in; a shell without COMMAND
#
# Of an appliance, its programs and what they tell (NODE is a name such as a1):
#     lab_appliance NODE ADDRESS...           namespaces; `lab_kill NODE` is the loss of its power
#     lab_group ID [ROUTER]... [NAME=VALUE]...    prints a group's section; interface eth0 unless told
#     lab_appliance_start NODE [TEXT]...      with that configuration: any lines of mgmtd's file (docs/mgmtd.md)
#     lab_configure NODE [TEXT]...            writes it anew, whole, and waits until mgmtd has taken it (1: refused)
#     lab_mgmtd_start NODE, lab_wccpd_start NODE    one of them again, until it is ready
#     lab_supervise NODE                      mgmtd that starts tunneld and wccpd, after lab_write_config NODE [TEXT]...
#     lab_manage NODE WORDS...                mgmtctl --json WORDS inside the appliance
#     lab_state NODE [GROUP]                  the groups by number, or one of them: the monitoring nodes as one JSON object
#     lab_events NODE                         the lines of mgmtd since its start: sessions, commits, alarms, roles
#     lab_role NODE GROUP                     the role that was last reported: ACTIVE, BACKUP, UNKNOWN
#     lab_wait_role SECONDS NODE GROUP ROLE
#     lab_wait_event SECONDS NODE EXPRESSION  a line of mgmtd's
#     lab_wait_log SECONDS NODE EXPRESSION    a line of the log (grep -E); what stood there before lab_mark NODE
#     lab_mark NODE                           doesn't count
#     lab_log NODE                            the log since lab_mark
#     lab_start NODE NAME PROGRAM..., lab_stop NODE NAME [SIGNAL], lab_alive NODE NAME, lab_pid NODE NAME
#                                             one program: NAME is mgmtd, tunneld or wccpd
#     lab_wait_exit SECONDS NODE NAME         waits until it ends by itself; its status, or 124
#     lab_end NODE...                         SIGTERM to wccpd, tunneld and mgmtd in turn, each ends with 0 (or has
#                                             ended before), and no process, segment, socket or interface is left
#     lab_clean_log NODE [EXPRESSION...]      no line at error level or worse but those, no finding of a sanitizer
#
# Traffic: a router that was started with `--redirect c1=51` redirects what comes in from c1.
#     lab_client NODE ROUTER [NET]            a namespace behind the router: NET.2, and NET.128 to NET.255 to fetch from
#                                             (NET is the first three numbers, default 10.1.0)
#     lab_server NODE ROUTER [NET]            the same at NET.2 (default 10.2.0), with web servers on ports 80 and 8080
#     lab_gateway NODE ADDRESS                the default route of a node
#     lab_fetch CLIENT [OPTIONS...]           `wccp_router fetch` from the client's addresses to the server 10.2.0.2
#     lab_proxy NODE [PORT] [keep]            haproxy in an appliance, on port 3129, answering with "X-Proxy: NODE"; with
#                                             `keep` it connects from the client's address. Stop it with lab_stop NODE proxy
#     lab_intercept GROUP [NAME=VALUE]...     prints the section of an intercept, to port 3129 unless told
#
# How it holds together: lab_enter runs the script again as the first process of its own process, mount and network
# namespaces (and of a user namespace, when started by an ordinary user). Every other namespace is held by a process
# below that one, no name is bound and no file is made outside, so that whatever ends the script, be it kill -9 of
# any of its processes, ends all of it: the kernel clears away the rest. Files of the lab (logs, sockets) live in
# $LAB, a tmpfs in the private mount namespace; copy out what is to be kept.
#
#   WCCP_BIN    where the programs are (default: build/release/bin)
#   LAB_KEEP    a directory to which logs are copied when the script ends by itself
#   LAB_SPEED   how many of its seconds the protocol gets into one (default 1); wccpd, tunneld and wccp_router run by
#               that clock (lab/fast_clock.cpp), mgmtd and mgmtctl, whose limits are about work, by the wall's.
#               SECONDS of all functions here are the wall's, but for lab_sleep, which sleeps for the protocol's.
#   LAB_TUNNELD     options of tunneld that lab_appliance_start gives; "none" starts none
#   LAB_PLANE       its data plane (default table, which carries nothing); empty: whatever the kernel can do
#   LAB_LOG_LEVEL   of wccpd, in the configuration that lab_appliance_start writes (default info)

LAB_HOME=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
LAB_TOP=$(dirname "$LAB_HOME")
: "${WCCP_BIN:=$LAB_TOP/build/release/bin}"
: "${LAB_SPEED:=1}" "${LAB_LOG_LEVEL:=info}" "${LAB_PLANE=table}"
LAB_CONFIG=/etc/opt/rvl/mgmtd.conf # inside an appliance
declare -A LAB_INIT LAB_PID        # first process of an appliance; programs as NODE/NAME
declare -A LAB_MARKED LAB_FOUND    # lines of the log that don't count; what an appliance held before its programs
declare -A LAB_KILLED              # sockets that programs had no chance to remove, as an expression
declare -A LAB_BARE                # nodes that have a network namespace alone: routers, clients, servers
declare -A LAB_NET                 # the net of a client or server

lab_die() { echo "lab: $*" >&2; exit 1; }

# ---- the outer side

lab_enter() { # SCRIPT ARGUMENTS...
    if [ "${LAB_INSIDE-}" = 1 ]; then lab_set_up; return; fi
    local script user=()
    script=$(readlink -f "$1"); shift
    [ "$(id -u)" = 0 ] || user=(--user --map-root-user)
    # The holder dies with this shell (pdeathsig), and everything with the holder (--kill-child). Started in the
    # background, because a shell runs its traps only then; job control gives neither terminal nor signals away.
    LAB_INSIDE=1 setpriv --pdeathsig KILL bash -c '[ $PPID = "$0" ] && LAB_HOLDER=$$ exec "$@"' $$ \
        env --default-signal=INT,QUIT unshare "${user[@]}" --mount --net --pid --fork --kill-child \
        --propagation private bash "$script" "$@" <&0 &
    local holder=$! status
    # shellcheck disable=SC2064
    trap "kill -KILL $holder 2>/dev/null; exit 130" INT
    # shellcheck disable=SC2064
    trap "kill -KILL $holder 2>/dev/null; exit 143" TERM HUP
    wait $holder; status=$?
    trap - INT TERM HUP
    exit $status
}

# ---- the inner side

lab_set_up() {
    # A holder that was killed just after its fork could not yet arrange that this shell dies with it. /proc still
    # shows the processes outside.
    grep -qs '^State:[[:space:]]*[^ZX]' "/proc/$LAB_HOLDER/status" || exit 1
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
    lab_bare "$node"
    lab_plug "$node" "${LAB_INIT[$node]}" "${addresses[@]}"
    lab_route_start "$node" "${which[@]}" "$@"
    lab_redirect "$node"
}
# A network namespace, held by a process.
lab_bare() { # NODE
    unshare --net sleep infinity </dev/null &
    LAB_INIT[$1]=$! LAB_BARE[$1]=yes
    lab_wait_namespace "${LAB_INIT[$1]}" net
}
# What comes in by interface X goes into the router's device to-X. What the router writes back there has come in by
# to-X, and takes the main table.
lab_redirect() { # ROUTER
    # shellcheck disable=SC2016
    lab_in "$1" bash -c '
        number=100
        for device in $(ip -o link show type tun | grep -o "to-[^:@ ]*"); do
            number=$((number + 1))
            ip rule add iif "${device#to-}" preference $number lookup $number
            ip route add default dev "$device" table $number
            echo 0 >/proc/sys/net/ipv4/conf/$device/rp_filter
        done
        [ $number -gt 100 ] || exit 0
        echo 0 >/proc/sys/net/ipv4/conf/all/send_redirects
        echo 0 >/proc/sys/net/ipv4/conf/default/send_redirects
        echo 0 >/proc/sys/net/ipv4/conf/eth0/send_redirects
        echo 0 >/proc/sys/net/ipv4/conf/all/rp_filter
        echo 0 >/proc/sys/net/ipv4/conf/default/rp_filter
        echo 0 >/proc/sys/net/ipv4/conf/eth0/rp_filter
        echo 1 >/proc/sys/net/ipv4/ip_forward' || lab_die "router $1 does not forward"
}
# A node behind a router, by an interface that has the node's name there.
lab_behind() { # NODE ROUTER NET
    local node=$1 router=$2 net=$3
    lab_bare "$node"
    LAB_NET[$node]=$net
    ip link add eth0 netns "${LAB_INIT[$node]}" type veth peer name "$node" netns "${LAB_INIT[$router]}" ||
        lab_die "no veth for $node"
    lab_in "$router" ip address add "$net.1/24" dev "$node"
    lab_in "$router" ip link set "$node" up
    lab_in "$node" ip link set lo up
    lab_in "$node" ip address add "$net.2/24" dev eth0
    lab_in "$node" ip link set eth0 up
    lab_in "$node" ip route add local "$net.128/25" dev lo
    lab_gateway "$node" "$net.1"
}
lab_gateway() { # NODE ADDRESS
    lab_in "$1" ip route replace default via "$2" || lab_die "no route of $1"
}
lab_client() { # NODE ROUTER [NET]
    lab_behind "$1" "$2" "${3-10.1.0}"
}
lab_server() { # NODE ROUTER [NET]
    lab_behind "$1" "$2" "${3-10.2.0}"
    nsenter -t "${LAB_INIT[$1]}" --net "$WCCP_BIN/wccp_router" web --port 80 --port 8080 </dev/null >"$LAB/$1.out" 2>&1 &
    LAB_PID[$1/web]=$!
    local i
    for ((i = 0; i < 100; i++)); do
        [ "$(lab_in "$1" cat /proc/net/tcp | grep -cE ' 0+:(0050|1F90) 0+:0+ 0A')" != 2 ] || return 0
        sleep 0.05
    done
    lab_die "the web server of $1 does not start"
}
lab_fetch() { # CLIENT [OPTIONS...]
    lab_in "$1" "$WCCP_BIN/wccp_router" fetch --from "${LAB_NET[$1]}.128" 10.2.0.2 "${@:2}"
}
lab_proxy() { # NODE [PORT] [keep]
    local port=${2:-3129} i
    lab_start "$1" proxy "$(command -v env)" "LAB_NODE=$1" "LAB_PORT=$port" \
        "LAB_SOURCE=0.0.0.0${3:+ usesrc clientip}" "$(PATH=$PATH:/usr/sbin command -v haproxy)" -db -f "$LAB_HOME/haproxy.cfg"
    for ((i = 0; i < 200; i++)); do
        ! lab_in "$1" cat /proc/net/tcp | grep -q "$(printf ' 0*:%04X 0*:0* 0A' "$port")" || return 0
        lab_alive "$1" proxy || break
        sleep 0.05
    done
    cat "$LAB/$1-proxy.out" >&2
    lab_die "the proxy of $1 does not start"
}
lab_route_start() { # NAME OPTIONS... : (again) after lab_stop NAME router
    local node=$1; shift
    lab_clock
    nsenter -t "${LAB_INIT[$node]}" --net "${LAB_CLOCK[@]}" "$WCCP_BIN/wccp_router" --control "$LAB/$node.ctl" --json "$@" \
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
    [ -n "${LAB_BARE[$node]-}" ] || all=(--mount --root --ipc --pid --wdns=/)
    (cd / && exec nsenter -t "${LAB_INIT[$node]}" --net "${all[@]}" "$@")
}

# What a program is started with to run by the clock of the protocol: LAB_CLOCK.
lab_clock() {
    local library
    LAB_CLOCK=()
    [ "$LAB_SPEED" != 1 ] || return 0
    library=$(dirname "$WCCP_BIN")/lib/libfast_clock.so
    [ -e "$library" ] || lab_die "no $library"
    LAB_CLOCK=(env "LD_PRELOAD=$library" "FAST_CLOCK=$LAB_SPEED"
        "ASAN_OPTIONS=${ASAN_OPTIONS:+$ASAN_OPTIONS:}verify_asan_link_order=0")
}
lab_sleep() { # SECONDS of the protocol
    sleep "$(awk "BEGIN { print $1 / $LAB_SPEED }")"
}

# Starts a program inside an appliance; a bare name is one of ours. Its output goes to $LAB/NODE-NAME.out.
lab_start() { # NODE NAME PROGRAM ARGUMENTS...
    local node=$1 name=$2 program=$3; shift 3
    [ -n "${LAB_INIT[$node]-}" ] || lab_die "there is no $node"
    case $program in
    */*) LAB_CLOCK=() ;;
    mgmtd | mgmtctl) program=$WCCP_BIN/$program; LAB_CLOCK=() ;;
    *) program=$WCCP_BIN/$program; lab_clock ;;
    esac
    (cd / && exec nsenter -t "${LAB_INIT[$node]}" --net --mount --root --ipc --pid --wdns=/ "${LAB_CLOCK[@]}" "$program" "$@") \
        </dev/null >>"$LAB/$node-$name.out" 2>&1 &
    LAB_PID[$node/$name]=$!
}

# The process that a program runs in, as seen from here.
lab_pid() { # NODE NAME
    local pid=${LAB_PID[$1/$2]-}
    [ -n "$pid" ] || lab_die "there is no $2 in $1"
    if [ "$2" != router ]; then pid=$(cat "/proc/$pid/task/$pid/children" 2>/dev/null); fi
    echo "${pid%% *}"
}
lab_alive() { # NODE NAME
    kill -0 "${LAB_PID[$1/$2]}" 2>/dev/null
}
# Sends a signal to a program (TERM), and waits for it to end; the result is its status, or 124 after 15 seconds.
lab_stop() { # NODE NAME [SIGNAL]
    local pid=${LAB_PID[$1/$2]} inner i
    inner=$(lab_pid "$1" "$2")
    if [ -n "$inner" ]; then
        [ "${3-}" != KILL ] || lab_expect_sockets "$1" "$2" "$inner"
        kill -s "${3-TERM}" "$inner"
        kill -s CONT "$pid" 2>/dev/null # nsenter stops itself with a program that was stopped
    fi
    for i in $(seq 300); do
        kill -0 "$pid" 2>/dev/null || { wait "$pid"; return; }
        sleep 0.05
    done
    return 124
}
# After kill -STOP of lab_pid. nsenter has stopped itself with the program, and continues it when it is continued. A
# SIGCONT that came later, while the program ends under the leak checker, would take back the checker's SIGSTOP.
lab_continue() { # NODE NAME
    kill -s CONT "${LAB_PID[$1/$2]}"
    lab_wait_line 5 '^State:[[:space:]]*[^T]' "/proc/$(lab_pid "$1" "$2")/status"
}
lab_expect_sockets() { # NODE NAME PID
    local own
    own=$(awk '/^NSpid:/ { print $NF }' "/proc/$3/status")
    LAB_KILLED[$1]+="|uds-client-$2-$own\$"
    [ "$2" != mgmtd ] || LAB_KILLED[$1]+='|uds-provider-mgmtd$'
}
# Waits for a program to end without being told to: its status, or 124.
lab_wait_exit() { # SECONDS NODE NAME
    local i
    for ((i = 0; i < $1 * 20; i++)); do
        lab_alive "$2" "$3" || { wait "${LAB_PID[$2/$3]}"; return; }
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

# ---- the programs of an appliance

lab_group() { # ID [ROUTER]... [NAME=VALUE]...
    local word n=0
    printf '[/qv/wccpd/wccp/srv_grp/config/%s]\n' "$1"; shift
    [[ " $*" = *' interface='* ]] || echo 'interface = eth0'
    for word; do
        case $word in *=*) echo "${word%%=*} = ${word#*=}" ;; *) n=$((n + 1)); echo "router/$n/ipaddr = $word" ;; esac
    done
}

lab_intercept() { # GROUP [NAME=VALUE]...
    local word
    printf '[/qv/tunneld/intercept/config/%s]\n' "$1"; shift
    [[ " $*" = *' to='* ]] || echo 'to = 3129'
    for word; do echo "${word%%=*} = ${word#*=}"; done
}

lab_write_config() { # NODE [TEXT]...
    local file=/proc/${LAB_INIT[$1]}/root$LAB_CONFIG
    shift
    printf '%s\n' '[/logging/syslog/process/wccpd]' "log_level = $LAB_LOG_LEVEL" "$@" >"$file.new" &&
        mv "$file.new" "$file"
}

lab_appliance_start() { # NODE [TEXT]...
    local node=$1
    lab_write_config "$@" || lab_die "no configuration for $node"
    LAB_FOUND[$node]=$(lab_remains "$node")
    lab_mgmtd_start "$node"
    # shellcheck disable=SC2086
    [ "${LAB_TUNNELD-}" = none ] || lab_tunneld_start "$node" ${LAB_TUNNELD-}
    lab_wccpd_start "$node"
}
lab_tunneld_start() { # NODE OPTIONS...
    # shellcheck disable=SC2086
    lab_start "$1" tunneld tunneld ${LAB_PLANE:+--plane $LAB_PLANE} "${@:2}"
}
# mgmtd, whose patience is by the wall's clock, with programs under it that run by the protocol's, in the configuration
# that lab_write_config has written.
lab_supervise() { # NODE
    local program directory=/proc/${LAB_INIT[$1]}/root/run/wccpd options=
    [ -n "${LAB_FOUND[$1]+known}" ] || LAB_FOUND[$1]=$(lab_remains "$1")
    lab_clock
    mkdir -p "$directory"
    for program in wccpd tunneld; do
        [ $program = wccpd ] || options=${LAB_PLANE:+--plane $LAB_PLANE}
        printf '#!/bin/sh\nexec %s %s %s "$@"\n' "${LAB_CLOCK[*]}" "$WCCP_BIN/$program" "$options" >"$directory/$program"
        chmod +x "$directory/$program"
    done
    : >"$LAB/$1-mgmtd.out"
    lab_start "$1" mgmtd mgmtd --config "$LAB_CONFIG" --supervise --wccpd /run/wccpd/wccpd --tunneld /run/wccpd/tunneld
    lab_wait_event 20 "$1" '^mgmtd ready' || lab_show_and_die "$1" "mgmtd of $1 does not start"
}
lab_mgmtd_start() { # NODE
    : >"$LAB/$1-mgmtd.out"
    local killed=${LAB_KILLED[$1]-}
    LAB_KILLED[$1]=${killed//'|uds-provider-mgmtd$'/}
    lab_start "$1" mgmtd mgmtd --config $LAB_CONFIG
    lab_wait_event 20 "$1" '^mgmtd ready' || lab_show_and_die "$1" "mgmtd of $1 does not start"
}
lab_wccpd_start() { # NODE
    local before
    before=$(grep -c 'wccpd_init: encap entries:' "$LAB/$1.log")
    lab_start "$1" wccpd wccpd
    local i
    for ((i = 0; i < 600; i++)); do
        [ "$(grep -c 'wccpd_init: encap entries:' "$LAB/$1.log")" -gt "$before" ] && return
        lab_alive "$1" wccpd || break
        sleep 0.05
    done
    lab_show_and_die "$1" "wccpd of $1 does not start"
}
lab_show() { # NODE : what it has said last
    tail -n 40 "$LAB/$1.log" "$LAB/$1"-*.out >&2
}
lab_show_and_die() { # NODE TEXT
    lab_show "$1"
    lab_die "$2"
}

lab_configure() { # NODE [TEXT]...
    local before now i
    before=$(lab_events "$1" | wc -l)
    lab_write_config "$@" || return
    kill -HUP "$(lab_pid "$1" mgmtd)"
    for ((i = 0; i < 200; i++)); do
        now=$(lab_events "$1" | tail -n +$((before + 1)))
        [[ $now != *'configuration read again: '* ]] || return 0
        [[ $now != *$LAB_CONFIG:* ]] || break
        sleep 0.05
    done
    echo "lab: the configuration of $1 is refused: $now" >&2
    return 1
}

lab_events() { # NODE
    cat "$LAB/$1-mgmtd.out"
}
lab_role() { # NODE GROUP
    lab_events "$1" | sed -n "s/^role of group $2: //p" | tail -n 1
}
lab_wait_role() { # SECONDS NODE GROUP ROLE
    local began=$SECONDS
    until [ "$(lab_role "$2" "$3")" = "$4" ]; do
        [ $((SECONDS - began)) -lt "$1" ] ||
            { echo "lab: after $1 s the role of group $3 in $2 is '$(lab_role "$2" "$3")', not $4" >&2; return 1; }
        sleep 0.1
    done
}
lab_wait_event() { # SECONDS NODE EXPRESSION
    lab_wait_line "$1" "$3" "$LAB/$2-mgmtd.out"
}

lab_mark() { # NODE
    LAB_MARKED[$1]=$(wc -l <"$LAB/$1.log")
}
lab_log() { # NODE
    tail -n +$((${LAB_MARKED[$1]-0} + 1)) "$LAB/$1.log"
}
lab_wait_log() { # SECONDS NODE EXPRESSION
    local began=$SECONDS
    until lab_log "$2" | grep -Eq -- "$3"; do
        [ $((SECONDS - began)) -lt "$1" ] || { echo "lab: after $1 s no line in the log of $2: $3" >&2; return 1; }
        sleep 0.1
    done
}

lab_manage() { # NODE WORDS...
    lab_in "$1" "$WCCP_BIN/mgmtctl" --json "${@:2}"
}

# {"51": {"oper": "ACTIVE, DESIGNATED", "router": {"1": {"state": ..., "appliance": {"10.0.0.101": {"load_dist": 100}}}},
# "appliance": {"1": {"ipaddr": ..., "weight": ...}}, ...}}: nodes by the parts of their names.
lab_state() { # NODE [GROUP]
    lab_manage "$1" walk "/qv/wccpd/wccp/srv_grp/state${2:+/$2}" 2>/dev/null | jq -c --arg group "${2-}" '
        (arrays // []) |
        (reduce (.[].name | split("/") | range(1; length) as $depth | .[:$depth] | join("/")) as $above ({}; .[$above] = true)) as $parents |
        map(select($parents[.name] | not)) |
        reduce .[] as $node ({}; setpath($node.name | split("/")[6:]; $node.value)) |
        if $group == "" then . else .[$group] | objects // {} end'
}

# What would be left behind in an appliance: processes, shared memory and semaphores, sockets, interfaces, files. The
# registry of shared memory with its semaphore and the tunnel mailbox stay by design, with nobody attached, and so does
# the pid file.
lab_remains() { # NODE
    lab_in "$1" bash -c '
        for own in /proc/[0-9]*; do
            [ "${own#/proc/}" = 1 ] || [ "${own#/proc/}" = $$ ] || tr "\0" " " <$own/cmdline 2>/dev/null | sed "s/^/process /;s/\$/\n/"
        done
        awk "FNR > 1 && ! (\$7 == 0 && (\$1 == -1091567891 || \$1 == 1464025933)) { print \"segment\", \$1, \"attached\", \$7 }" /proc/sysvipc/shm
        tail -n +2 -q /proc/sysvipc/sem /proc/sysvipc/msg | grep -v "^-1091567891 " | sed "s/^/semaphore or queue /"
        grep -hE "^ *[0-9]+: [0-9A-F]+:0800" /proc/net/udp /proc/net/raw | sed "s/^/socket /"
        sed 1d /proc/net/unix | grep -o "/.*" | grep -v "^/dev/log\$" | sed "s/^/socket /"
        sed "1,2d;s/:.*//;s/^ */interface /" /proc/net/dev
        ip -o link show group 2048 | sed "s/^[0-9]*: /interface of group 2048 /;s/:.*//"
        ip rule show | grep "proto 204" | sed "s/^/ip rule /"
        ip route show table all | awk "match(\$0, / table [0-9]+/) && substr(\$0, RSTART + 7, RLENGTH - 7) >= 204800 { print \"route\", \$0 }"
        nft list tables 2>/dev/null | grep tunneld | sed "s/^/nft /"
        ls -d /tmp/gcl-socks/* 2>/dev/null | sed "s/^/file /"'
}

lab_end() { # NODE...
    local node name status now
    for node; do
        for name in wccpd tunneld mgmtd; do
            [ -n "${LAB_PID[$node/$name]-}" ] || continue
            lab_alive "$node" $name || continue
            lab_stop "$node" $name; status=$?
            [ $status = 0 ] || { echo "lab: $name of $node ended with $status" >&2; lab_show "$node"; return 1; }
        done
        now=$(lab_remains "$node" | grep -vE "^\$${LAB_KILLED[$node]-}")
        [ "$now" = "${LAB_FOUND[$node]-}" ] ||
            { echo "lab: not the same is left in $node:"; diff <(echo "${LAB_FOUND[$node]-}") <(echo "$now"); return 1; } >&2
    done
}

# A line of the log begins with facility and level: eight times the one and the other.
lab_clean_log() { # NODE [EXPRESSION...]
    local node=$1 allowed bad; shift
    allowed=$(IFS='|'; echo "$*")
    bad=$(grep -E '^<([0-9]*[02468])?[0-9]>' "$LAB/$node.log" | awk -F'[<>]' '$2 % 8 <= 3' | grep -vE -- "${allowed:-^$}")
    bad+=$(grep -hE 'Sanitizer|runtime error:' "$LAB/$node"-*.out)
    [ -z "$bad" ] || { printf 'lab: %s says:\n%s\n' "$node" "$bad" >&2; return 1; }
}

# Writes what passes the bridge to a file until the lab ends or lab_capture_end. tcpdump wants to change its user and
# groups, which a user namespace of an ordinary user refuses: dumpcap, which comes with tshark, does it there.
lab_capture() { # FILE
    local with=(tcpdump -i lan --immediate-mode -U -Z root -w "$1" udp port 2048 or ip proto 47) said='listening on'
    if [ "$(cat /proc/self/setgroups)" = deny ]; then
        with=(dumpcap -q -P -i lan -f 'udp port 2048 or ip proto 47' -w "$1") said='Capturing on'
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
    nodes=$(declare -p LAB_INIT LAB_PID LAB_MARKED LAB_FOUND LAB_KILLED LAB_BARE LAB_NET)
    export nodes
    if [ $# -gt 0 ]; then "$@"; exit; fi
    echo "routers: r1..r$routers at 10.0.0.1.. ; appliances: a1..a$appliances at 10.0.0.101.. ; files in $LAB"
    echo "lab_in a1 COMMAND, lab_ctl r1 show, lab_appliance_start a1 \"\$(lab_group 51 10.0.0.1)\", lab_events a1, lab_end a1, lab_capture FILE; exit ends all"
    bash --rcfile <(echo "source '$LAB_HOME/topology.sh'; PS1='lab\\$ '; ${nodes//declare/declare -g}") -i
fi
