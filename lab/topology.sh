#!/bin/bash
# topology.sh: a network of namespaces with simulated routers and complete appliances on one bridge.
#
# As a library, at the top of a script that was started as a file:
#     source lab/topology.sh
#     lab_enter "$0" "$@"                     # from here on the script runs inside; nothing outlives it
#     lab_router r1 10.0.0.1 -- --format nexus  # wccp_router on that address, with a control socket and a log
#     lab_appliance a1 10.0.0.101             # namespaces and a log daemon; no program yet
#     lab_appliance_start a1 "$(lab_group 51 10.0.0.1 weight=7)"      # starts mgmtd, tunneld and wccpd
#     lab_wait_role 30 a1 51 ACTIVE
#     lab_wait 30 '.groups["51"].assignment.kind == "hash"' lab_ctl r1 show
#     lab_configure a1 "$(lab_group 51 10.0.0.1 weight=9)"            # replaces the whole configuration
#     lab_end a1                              # stops the programs and checks that nothing is left
#     lab_clean_log a1 'an error that is expected'
# As a command:
#     topology.sh [--routers N] [--appliances N] [COMMAND...]    runs COMMAND, or a shell, in such a network
#
# Appliances and their programs (NODE is a name such as a1; EXPRESSION is for grep -E):
#     lab_appliance NODE ADDRESS...           creates its namespaces
#     lab_kill NODE                           ends everything in it at once, like a loss of power
#     lab_group ID [ROUTER]... [NAME=VALUE]...    prints the section of a group, on interface eth0 by default
#     lab_intercept GROUP [NAME=VALUE]...     prints the section of an intercept, to port 3129 by default
#     lab_appliance_start NODE [TEXT]...      starts the programs; TEXT is lines of mgmtd's file (docs/mgmtd.md)
#     lab_configure NODE [TEXT]...            replaces the file and waits until mgmtd has read it (1: refused)
#     lab_mgmtd_start NODE, lab_wccpd_start NODE    starts one of them again and waits until it is ready
#     lab_supervise NODE                      starts mgmtd, which starts tunneld and wccpd, with the configuration from
#                                             lab_write_config NODE [TEXT]...
#     lab_manage NODE WORDS...                mgmtctl --json WORDS inside the appliance
#     lab_state NODE [GROUP]                  the monitoring nodes of all groups by number, or of one, as a JSON object
#     lab_tunneld_state NODE KIND             the same of tunneld: KIND is intercept, plane or tunnel
#     lab_events NODE                         the output of mgmtd since its start: sessions, commits, alarms, roles
#     lab_role NODE GROUP                     the role that was reported last: ACTIVE, BACKUP, UNKNOWN
#     lab_wait_role SECONDS NODE GROUP ROLE
#     lab_wait_event SECONDS NODE EXPRESSION  waits for a line in the output of mgmtd
#     lab_wait_log SECONDS NODE EXPRESSION    waits for a line in the log, after the last lab_mark NODE
#     lab_log NODE                            the log since lab_mark
#     lab_start NODE NAME PROGRAM..., lab_stop NODE NAME [SIGNAL], lab_alive NODE NAME, lab_pid NODE NAME
#                                             one program; NAME is mgmtd, tunneld, wccpd or any other
#     lab_wait_exit SECONDS NODE NAME         waits until it exits by itself; the result is its status, or 124
#     lab_end NODE...                         sends SIGTERM to wccpd, tunneld and mgmtd in turn. Fails if one of them
#                                             exits with an error, or leaves a process, segment, socket or interface
#     lab_clean_log NODE [EXPRESSION...]      fails on a log line of level error or worse that matches no EXPRESSION,
#                                             and on a finding of a sanitizer
#
# Traffic: a router that is started with `--redirect c1=51` redirects packets that come in from c1.
#     lab_client NODE ROUTER [NET]            a namespace behind the router, with NET.2, and NET.128 to NET.255 to fetch
#                                             from (NET is the first three numbers, default 10.1.0)
#     lab_server NODE ROUTER [NET]            the same at NET.2 (default 10.2.0), with web servers on ports 80 and 8080
#     lab_gateway NODE ADDRESS                sets the default route of a node
#     lab_fetch CLIENT [OPTIONS...]           `wccp_router fetch` from the client's addresses to the server 10.2.0.2
#     lab_proxy NODE [PORT] [keep]            starts haproxy in an appliance, on port 3129 by default; it answers with
#                                             "X-Proxy: NODE", and with `keep` connects from the client's address.
#                                             Stop it with lab_stop NODE proxy
#
# lab_enter runs the script again as the first process of new process, mount and network namespaces (and of a user
# namespace if an ordinary user started it). Every other namespace is held by a process below that one, and nothing is
# created outside. Therefore whatever ends the script, even kill -9 of any of its processes, ends all of it, and the
# kernel cleans up. Logs and sockets are in $LAB, a tmpfs in the private mount namespace; copy out what is to be kept.
#
#   WCCP_BIN    directory of the programs (default: build/release/bin)
#   LAB_KEEP    a directory to which the logs are copied when the script ends by itself
#   LAB_SPEED   how much faster than real time the protocol runs (default 1): the clock of wccpd, tunneld and
#               wccp_router (lab/fast_clock.cpp). mgmtd and mgmtctl, whose time limits concern work and not the protocol,
#               keep real time. SECONDS of all functions are real seconds, except for lab_sleep.
#   LAB_PATIENCE    by how much the SECONDS of functions that wait are multiplied (default 1), for a slow or busy machine.
#                   Times that a test itself measures do not change.
#   LAB_TUNNELD     options that lab_appliance_start passes to tunneld; "none": do not start it
#   LAB_PLANE       its data plane (default table, which carries no packets); empty: the best that the kernel supports
#   LAB_LOG_LEVEL   log level of wccpd in the configuration that lab_write_config writes (default info)

LAB_HOME=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
LAB_TOP=$(dirname "$LAB_HOME")
: "${WCCP_BIN:=$LAB_TOP/build/release/bin}"
: "${LAB_SPEED:=1}" "${LAB_PATIENCE:=1}" "${LAB_LOG_LEVEL:=info}" "${LAB_PLANE=table}"
LAB_CONFIG=/etc/opt/rvl/mgmtd.conf # inside an appliance
declare -A LAB_INIT LAB_PID        # first process of a node; programs by NODE/NAME
declare -A LAB_MARKED LAB_FOUND    # log lines before lab_mark; output of lab_remains before the programs started
declare -A LAB_KILLED              # sockets that killed programs could not remove, as an expression
declare -A LAB_BARE                # nodes with a network namespace only: routers, clients, servers
declare -A LAB_NET                 # the network of a client or server

lab_die() { echo "lab: $*" >&2; exit 1; }

# --- Outside the namespaces

lab_enter() { # SCRIPT ARGUMENTS...
    if [ "${LAB_INSIDE-}" = 1 ]; then lab_set_up; return; fi
    local script user=()
    script=$(readlink -f "$1"); shift
    [ "$(id -u)" = 0 ] || user=(--user --map-root-user)
    # The holder dies with this shell (pdeathsig), and everything else with the holder (--kill-child). It runs in the
    # background because a shell runs its traps only while it waits.
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

# --- Inside: the network

lab_set_up() {
    # If the holder was killed right after its fork, this shell was not yet set up to die with it. /proc still shows the
    # processes outside.
    grep -qs '^State:[[:space:]]*[^ZX[:space:]]' "/proc/$LAB_HOLDER/status" || exit 1
    mount -t proc proc /proc || lab_die "cannot mount /proc"
    local aside
    for aside in /media /srv /mnt /opt; do
        [ -d $aside ] || continue
        case "$LAB_TOP/ $WCCP_BIN/ $PWD/ ${LAB_KEEP-}/" in $aside/* | *" $aside/"*) ;; *) break ;; esac
    done
    mount -t tmpfs tmpfs $aside || lab_die "cannot mount a file system on $aside"
    LAB=$aside/lab
    mkdir $LAB
    mkfifo $LAB/pause
    trap 'lab_collect' EXIT
    trap 'exit 130' INT
    trap 'exit 143' TERM HUP
    ip -batch - <<'END' || lab_die "no bridge"
link set lo up
link add lan type bridge mcast_snooping 0 forward_delay 0
address add 10.0.0.254/24 dev lan
link set lan up
END
    echo 1 >/proc/sys/net/ipv6/conf/all/disable_ipv6 2>/dev/null
    echo 1 >/proc/sys/net/ipv6/conf/default/disable_ipv6 2>/dev/null
}

# Waits like sleep, but without a process: with many labs at a time, waiting ones cost the others little.
lab_pause() { # SECONDS
    read -rt "$1" <>"$LAB/pause" || true
}

lab_collect() {
    local status=$?
    [ -n "${LAB_KEEP-}" ] && [ -d "$LAB_KEEP" ] && cp "$LAB"/*.log "$LAB"/*.out "$LAB_KEEP"/ 2>/dev/null
    return $status
}

# Waits until a process has left our namespace of that kind.
lab_wait_namespace() { # PID KIND
    local i
    for ((i = 0; i < 200; i++)); do
        [ -e "/proc/$1/ns/$2" ] && ! [ "/proc/$1/ns/$2" -ef "/proc/$$/ns/$2" ] && return
        lab_pause 0.02
    done
    lab_die "process $1 has no $2 namespace"
}

# Adds an eth0, connected to the bridge, to the network namespace of a process.
lab_plug() { # NODE PID ADDRESS...
    local node=$1 pid=$2 address; shift 2
    ip -batch - <<<"link add v-$node type veth peer name eth0 netns $pid"$'\n'"link set v-$node master lan up" ||
        lab_die "no veth for $node"
    {
        echo 'link set lo up'
        for address; do echo "address add $address/24 dev eth0"; done
        echo 'link set eth0 up'
        [[ " $*" != *' 10.0.0.'* ]] || echo 'route add default via 10.0.0.254'
    } | nsenter -t "$pid" --net ip -batch - || lab_die "cannot set up eth0 of $node"
}

# Creates a namespace with a wccp_router that simulates a router on each address.
lab_router() { # NAME ADDRESS... [-- OPTIONS OF wccp_router]
    local node=$1 addresses=() which=(); shift
    while [ $# -gt 0 ] && [ "$1" != -- ]; do addresses+=("$1"); which+=(--router "$1"); shift; done
    [ $# -gt 0 ] && shift
    lab_bare "$node"
    lab_plug "$node" "${LAB_INIT[$node]}" "${addresses[@]}"
    lab_route_start "$node" "${which[@]}" "$@"
    [[ " $* " != *' --redirect '* ]] || lab_redirect "$node"
}
# Creates a network namespace, held by a process.
lab_bare() { # NODE
    unshare --net sleep infinity </dev/null &
    LAB_INIT[$1]=$! LAB_BARE[$1]=yes
    lab_wait_namespace "${LAB_INIT[$1]}" net
}
# Routes packets that arrive on interface X into the router's device to-X. Packets that the router writes back into to-X
# arrive on that device, and therefore follow the main table.
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
        echo 1 >/proc/sys/net/ipv4/ip_forward' || lab_die "cannot set up forwarding in router $1"
}
# Creates a node behind a router; the router's interface has the node's name.
lab_behind() { # NODE ROUTER NET
    local node=$1 router=$2 net=$3
    lab_bare "$node"
    LAB_NET[$node]=$net
    ip link add eth0 netns "${LAB_INIT[$node]}" type veth peer name "$node" netns "${LAB_INIT[$router]}" ||
        lab_die "no veth for $node"
    lab_in "$router" ip -batch - <<<"address add $net.1/24 dev $node"$'\n'"link set $node up" || lab_die "cannot set up $node of $router"
    lab_in "$node" ip -batch - <<END || lab_die "cannot set up eth0 of $node"
link set lo up
address add $net.2/24 dev eth0
link set eth0 up
route add local $net.128/25 dev lo
route add default via $net.1
END
}
lab_gateway() { # NODE ADDRESS
    lab_in "$1" ip route replace default via "$2" || lab_die "cannot set the default route of $1"
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
        [ "$(grep -cE ' 0+:(0050|1F90) 0+:0+ 0A' "/proc/${LAB_INIT[$1]}/net/tcp")" != 2 ] || return 0
        lab_pause 0.05
    done
    lab_die "the web server of $1 did not start"
}
lab_fetch() { # CLIENT [OPTIONS...]
    lab_in "$1" "$WCCP_BIN/wccp_router" fetch --from "${LAB_NET[$1]}.128" 10.2.0.2 "${@:2}"
}
lab_proxy() { # NODE [PORT] [keep]
    local port=${2:-3129} hex i
    printf -v hex %04X "$port"
    lab_start "$1" proxy "$(command -v env)" "LAB_NODE=$1" "LAB_PORT=$port" \
        "LAB_SOURCE=0.0.0.0${3:+ usesrc clientip}" "$(PATH=$PATH:/usr/sbin command -v haproxy)" -db -f "$LAB_HOME/haproxy.cfg"
    for ((i = 0; i < 200; i++)); do
        ! grep -q " 0*:$hex 0*:0* 0A" "/proc/${LAB_INIT[$1]}/net/tcp" || return 0
        lab_alive "$1" proxy || break
        lab_pause 0.05
    done
    cat "$LAB/$1-proxy.out" >&2
    lab_die "the proxy of $1 did not start"
}
lab_route_start() { # NAME OPTIONS... : also after lab_stop NAME router
    local node=$1; shift
    lab_clock
    nsenter -t "${LAB_INIT[$node]}" --net "${LAB_CLOCK[@]}" "$WCCP_BIN/wccp_router" --control "$LAB/$node.ctl" --json "$@" \
        </dev/null >>"$LAB/$node.log" 2>&1 &
    LAB_PID[$node/router]=$!
    local i
    for ((i = 0; i < 100; i++)); do
        [ -S "$LAB/$node.ctl" ] && return
        kill -0 $! 2>/dev/null || break
        lab_pause 0.05
    done
    cat "$LAB/$node.log" >&2
    lab_die "router $node did not start"
}

# Sets LAB_CHILD to the first child of a process, or to nothing.
lab_find_child() { # PID
    LAB_CHILD=
    { read -r LAB_CHILD _ <"/proc/$1/task/$1/children"; } 2>/dev/null || true
}
# Creates the namespaces of an appliance, with a log daemon as their first process: when it dies, all of them end.
lab_appliance() { # NAME ADDRESS...
    local node=$1 outer i comm; shift
    "$LAB_HOME/in-appliance" "$WCCP_BIN/wccp_router" logd - </dev/null >"$LAB/$node.log" 2>"$LAB/$node.out" &
    outer=$!
    for ((i = 0; i < 200; i++)); do
        lab_find_child $outer
        LAB_INIT[$node]=$LAB_CHILD
        # Ready when the log daemon has replaced the shell that set up the namespaces.
        comm=
        [ -z "$LAB_CHILD" ] || read -r comm 2>/dev/null <"/proc/$LAB_CHILD/comm"
        [ "$comm" = wccp_router ] && [ -S "/proc/${LAB_INIT[$node]}/root/dev/log" ] && break
        kill -0 $outer 2>/dev/null || { cat "$LAB/$node.out" >&2; lab_die "appliance $node did not start"; }
        lab_pause 0.02
    done
    cp "$LAB_TOP"/packaging/*.conf "/proc/${LAB_INIT[$node]}/root/etc/opt/rvl/" || lab_die "cannot copy the platform files to $node"
    lab_plug "$node" "${LAB_INIT[$node]}" "$@"
}

# Runs a command in all namespaces of an appliance, or in the network namespace of another node.
lab_in() { # NAME COMMAND...
    local node=$1 all=(); shift
    [ -n "${LAB_INIT[$node]-}" ] || lab_die "there is no $node"
    # --root, because the whole lab may run inside a chroot.
    [ -n "${LAB_BARE[$node]-}" ] || all=(--mount --root --ipc --pid --wdns=/)
    nsenter -t "${LAB_INIT[$node]}" --net "${all[@]}" "$@"
}

# Sets LAB_CLOCK to the command prefix that makes a program run by the clock of the protocol.
lab_clock() {
    local library
    LAB_CLOCK=()
    [ "$LAB_SPEED" != 1 ] || return 0
    library=${WCCP_BIN%/*}/lib/libfast_clock.so
    [ -e "$library" ] || lab_die "no $library"
    LAB_CLOCK=(env "LD_PRELOAD=$library" "FAST_CLOCK=$LAB_SPEED"
        "ASAN_OPTIONS=${ASAN_OPTIONS:+$ASAN_OPTIONS:}verify_asan_link_order=0")
}
lab_sleep() { # SECONDS : in the time of the protocol
    lab_pause "$(awk "BEGIN { print $1 / $LAB_SPEED }")"
}

# Starts a program inside an appliance; a name without a slash is one of ours. Its output goes to $LAB/NODE-NAME.out.
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

# Prints the process id of a program in our process namespace.
lab_pid() { # NODE NAME
    local pid=${LAB_PID[$1/$2]-}
    [ -n "$pid" ] || lab_die "there is no $2 in $1"
    if [ "$2" != router ]; then lab_find_child "$pid"; pid=$LAB_CHILD; fi
    echo "$pid"
}
lab_alive() { # NODE NAME
    kill -0 "${LAB_PID[$1/$2]}" 2>/dev/null
}
# Sends a signal (TERM by default) to a program and waits until it exits; the result is its status, or 124 after 15
# seconds.
lab_stop() { # NODE NAME [SIGNAL]
    local pid=${LAB_PID[$1/$2]} inner i
    lab_find_child "$pid"; inner=$LAB_CHILD
    [ "$2" != router ] || inner=$pid
    if [ -n "$inner" ]; then
        [ "${3-}" != KILL ] || lab_expect_sockets "$1" "$2" "$inner"
        kill -s "${3-TERM}" "$inner"
        kill -s CONT "$pid" 2>/dev/null # nsenter stops itself when its program is stopped
    fi
    for ((i = 0; i < 300; i++)); do
        kill -0 "$pid" 2>/dev/null || { wait "$pid"; return; }
        lab_pause 0.05
    done
    return 124
}
# Continues a program after kill -STOP of lab_pid. nsenter has stopped itself with the program, and passes SIGCONT on.
# The wait is needed because a SIGCONT that arrives when the program exits would undo the leak checker's SIGSTOP.
lab_continue() { # NODE NAME
    kill -s CONT "${LAB_PID[$1/$2]}"
    lab_wait_line 5 '^State:[[:space:]]*[^T[:space:]]' "/proc/$(lab_pid "$1" "$2")/status"
}
lab_expect_sockets() { # NODE NAME PID
    local own
    own=$(awk '/^NSpid:/ { print $NF }' "/proc/$3/status")
    LAB_KILLED[$1]+="|uds-client-$2-$own\$"
    [ "$2" != mgmtd ] || LAB_KILLED[$1]+='|uds-provider-mgmtd$'
}
# Waits until a program exits by itself; the result is its status, or 124.
lab_wait_exit() { # SECONDS NODE NAME
    local i
    for ((i = 0; i < $1 * LAB_PATIENCE * 20; i++)); do
        lab_alive "$2" "$3" || { wait "${LAB_PID[$2/$3]}"; return; }
        lab_pause 0.05
    done
    return 124
}
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
lab_link() { # NODE up|down : plugs or unplugs the cable of eth0
    ip link set "v-$1" "$2"
}

lab_ctl() { # ROUTER COMMAND... : sends a command to a simulated router
    local node=$1; shift
    "$WCCP_BIN/wccp_router" ctl "$LAB/$node.ctl" "$@"
}

# Runs a command repeatedly until the jq expression is true for its output. After that many seconds it prints the last
# output, and the result is 1.
lab_wait() { # SECONDS EXPRESSION COMMAND...
    local limit=$(($1 * LAB_PATIENCE)) expression=$2 began=$SECONDS pause=0.2 last='' before='' LAB_WALKED=yes; shift 2
    while :; do
        # jq takes longer to start than anything else here: only for output that has changed, and once.
        last=$("$@" 2>&1) && [ "$last" != "$before" ] &&
            jq -en "$LAB_SHAPE | $expression" <<<"$last" >/dev/null 2>&1 && return 0
        before=$last
        [ $((SECONDS - began)) -lt "$limit" ] || break
        lab_pause $pause
        [ $((SECONDS - began)) -lt 2 ] || pause=0.5
    done
    echo "lab: not true after $limit s: $expression" >&2
    [ "${#last}" -lt 4000 ] && echo "$last" >&2
    return 1
}
# Runs a test repeatedly until it succeeds. The result is 1 if it has not after that many seconds.
lab_wait_until() { # SECONDS COMMAND...
    local limit=$(($1 * LAB_PATIENCE)) began=$SECONDS pause=0.1; shift
    until "$@"; do
        [ $((SECONDS - began)) -lt "$limit" ] || return 1
        lab_pause $pause
        [ $((SECONDS - began)) -lt 1 ] || pause=0.3
    done
}
# Waits for a line in a file.
lab_wait_line() { # SECONDS EXPRESSION FILE
    lab_wait_until "$1" grep -Eqs -- "$2" "$3" || { echo "lab: after $(($1 * LAB_PATIENCE)) s no line in $3: $2" >&2; return 1; }
}

# --- The programs of an appliance

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
# mgmtd keeps real time and starts programs that run by the clock of the protocol, therefore through scripts.
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
    lab_wait_event 20 "$1" '^mgmtd ready' || lab_show_and_die "$1" "mgmtd of $1 did not start"
}
lab_mgmtd_start() { # NODE
    : >"$LAB/$1-mgmtd.out"
    local killed=${LAB_KILLED[$1]-}
    LAB_KILLED[$1]=${killed//'|uds-provider-mgmtd$'/}
    lab_start "$1" mgmtd mgmtd --config $LAB_CONFIG
    lab_wait_event 20 "$1" '^mgmtd ready' || lab_show_and_die "$1" "mgmtd of $1 did not start"
}
lab_wccpd_start() { # NODE
    local before
    before=$(grep -c 'wccpd_init: encap entries:' "$LAB/$1.log")
    lab_start "$1" wccpd wccpd
    local i
    for ((i = 0; i < 300; i++)); do
        [ "$(grep -c 'wccpd_init: encap entries:' "$LAB/$1.log")" -gt "$before" ] && return
        lab_alive "$1" wccpd || break
        lab_pause 0.1
    done
    lab_show_and_die "$1" "wccpd of $1 did not start"
}
lab_show() { # NODE : the last lines of its log and of the output of its programs
    tail -n 40 "$LAB/$1.log" "$LAB/$1"-*.out >&2
}
lab_show_and_die() { # NODE TEXT
    lab_show "$1"
    lab_die "$2"
}

lab_configure() { # NODE [TEXT]...
    local before now i
    mapfile -t before <"$LAB/$1-mgmtd.out"
    lab_write_config "$@" || return
    kill -HUP "$(lab_pid "$1" mgmtd)"
    for ((i = 0; i < 200 * LAB_PATIENCE; i++)); do
        mapfile -s "${#before[@]}" now <"$LAB/$1-mgmtd.out"
        [[ ${now[*]} != *'configuration read again: '* ]] || return 0
        [[ ${now[*]} != *$LAB_CONFIG:* ]] || break
        lab_pause 0.05
    done
    echo "lab: mgmtd of $1 refused the configuration: ${now[*]}" >&2
    return 1
}

lab_events() { # NODE
    cat "$LAB/$1-mgmtd.out"
}
# Sets LAB_ROLE.
lab_find_role() { # NODE GROUP
    local lines i
    mapfile -t lines <"$LAB/$1-mgmtd.out"
    LAB_ROLE=
    for ((i = ${#lines[@]} - 1; i >= 0; i--)); do
        [[ ${lines[i]} = "role of group $2: "* ]] || continue
        LAB_ROLE=${lines[i]##*: }
        return
    done
}
lab_role() { # NODE GROUP
    lab_find_role "$1" "$2"
    echo "$LAB_ROLE"
}
lab_has_role() { # NODE GROUP ROLE
    lab_find_role "$1" "$2"
    [ "$LAB_ROLE" = "$3" ]
}
lab_wait_role() { # SECONDS NODE GROUP ROLE
    lab_wait_until "$1" lab_has_role "${@:2}" ||
        { echo "lab: after $(($1 * LAB_PATIENCE)) s the role of group $3 in $2 is '$LAB_ROLE', not $4" >&2; return 1; }
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
lab_logged() { # NODE EXPRESSION
    grep -Eq -- "$2" "$LAB/$1.log" && grep -Eq -- "$2" < <(lab_log "$1") # the second one runs only when there is a match
}
lab_wait_log() { # SECONDS NODE EXPRESSION
    lab_wait_until "$1" lab_logged "${@:2}" || { echo "lab: after $(($1 * LAB_PATIENCE)) s no line in the log of $2: $3" >&2; return 1; }
}

lab_manage() { # NODE WORDS...
    lab_in "$1" "$WCCP_BIN/mgmtctl" --json "${@:2}"
}

# Prints the nodes below a name as nested objects: /a/b/c/d below /a/b is {"c": {"d": VALUE}}. In lab_wait, which
# sets LAB_WALKED, it prints the name and the nodes as mgmtctl does; LAB_SHAPE turns these into the objects.
lab_tree() { # NODE NAME
    if [ -n "${LAB_WALKED-}" ]; then
        echo "{\"below\": \"${2%/}\"}"
        lab_manage "$1" walk "$2" 2>/dev/null || true
    else
        LAB_WALKED=yes lab_tree "$@" | jq -cn "$LAB_SHAPE"
    fi
}
LAB_SHAPE='
    def tree($depth):
        (reduce (.[].name | split("/") | range(1; length) as $n | .[:$n] | join("/")) as $above ({}; .[$above] = true)) as $parents |
        reduce (.[] | select($parents[.name] | not)) as $node ({}; setpath($node.name | split("/")[$depth:]; $node.value));
    [inputs] | (.[0] | objects.below // null) as $name |
    if $name then .[1:][] | arrays // [] | tree($name | split("/") | length) else .[] end'
# {"51": {"oper": "ACTIVE, DESIGNATED", "router": {"1": {"state": ..., "appliance": {"10.0.0.101": {"load_dist": 100}}}},
# "appliance": {"1": {"ipaddr": ..., "weight": ...}}, ...}}
lab_state() { # NODE [GROUP]
    lab_tree "$1" "/qv/wccpd/wccp/srv_grp/state${2:+/$2}"
}
lab_tunneld_state() { # NODE KIND
    lab_tree "$1" "/qv/tunneld/$2/state"
}

# Prints what is left in an appliance: processes, shared memory, semaphores, sockets, interfaces, files. Not printed is
# what stays by design: the registry of shared memory with its semaphore, the tunnel mailbox if no process has it
# attached, and the pid file.
lab_remains() { # NODE
    lab_in "$1" bash -c '
        for own in /proc/[0-9]*; do
            [ "${own#/proc/}" = 1 ] || [ "${own#/proc/}" = $$ ] || { mapfile -d "" words <$own/cmdline && [ ${#words[@]} -gt 0 ] && echo "process ${words[*]}"; } 2>/dev/null
        done
        for own in /tmp/gcl-socks/*; do [ ! -e "$own" ] || echo "file $own"; done
        awk "
            FNR == 1 { n = split(FILENAME, path, \"/\"); table = path[n]; if (table != \"unix\") next }
            table == \"shm\" && ! (\$7 == 0 && (\$1 == -1091567891 || \$1 == 1464025933)) { print \"segment\", \$1, \"attached\", \$7 }
            (table == \"sem\" || table == \"msg\") && \$1 != -1091567891 { print \"semaphore or queue\", \$0 }
            (table == \"udp\" || table == \"raw\") && \$2 ~ /:0800\$/ { print \"socket\", \$0 }
            table == \"unix\" && match(\$0, /\\/.*/) && substr(\$0, RSTART) != \"/dev/log\" { print \"socket\", substr(\$0, RSTART) }
            table == \"dev\" && FNR > 2 { sub(/:.*/, \"\"); print \"interface\", \$1 }
        " /proc/sysvipc/shm /proc/sysvipc/sem /proc/sysvipc/msg /proc/net/udp /proc/net/raw /proc/net/unix /proc/net/dev
        { printf "%s\n" "link show group 2048" "rule show" "route show table all" | ip -o -force -batch -; nft list tables 2>/dev/null; } | awk "
            /^[0-9]+: [^ ]+: </ { sub(/:\$/, \"\", \$2); print \"interface of group 2048\", \$2 }
            / proto 204/ && /^[0-9]+:/ { print \"ip rule\", \$0 }
            match(\$0, / table [0-9]+/) && substr(\$0, RSTART + 7, RLENGTH - 7) >= 204800 { print \"route\", \$0 }
            /^table .* tunneld/ { print \"nft\", \$0 }"'
}

lab_end() { # NODE...
    local node name status now
    for node; do
        for name in wccpd tunneld mgmtd; do
            [ -n "${LAB_PID[$node/$name]-}" ] || continue
            lab_alive "$node" $name || continue
            lab_stop "$node" $name; status=$?
            [ $status = 0 ] || { echo "lab: $name of $node exited with $status" >&2; lab_show "$node"; return 1; }
        done
        now=$(lab_remains "$node" | grep -vE "^\$${LAB_KILLED[$node]-}")
        [ "$now" = "${LAB_FOUND[$node]-}" ] ||
            { echo "lab: before the start (<) and after the end (>) of $node:"; diff <(echo "${LAB_FOUND[$node]-}") <(echo "$now"); return 1; } >&2
    done
}

# A log line begins with <N>: 8 times the facility, plus the level.
lab_clean_log() { # NODE [EXPRESSION...]
    local node=$1 allowed bad; shift
    allowed=$(IFS='|'; echo "$*")
    bad=$(grep -E '^<([0-9]*[02468])?[0-9]>' "$LAB/$node.log" | awk -F'[<>]' '$2 % 8 <= 3' | grep -vE -- "${allowed:-^$}")
    bad+=$(grep -hE 'Sanitizer|runtime error:' "$LAB/$node"-*.out)
    [ -z "$bad" ] || { printf 'lab: errors in the log of %s:\n%s\n' "$node" "$bad" >&2; return 1; }
}

# Captures WCCP and GRE packets on the bridge to a file, until lab_capture_end or the end of the lab. Where an ordinary
# user's namespace does not let tcpdump change its user and groups, dumpcap from tshark is used.
lab_capture() { # FILE
    local with=(tcpdump -i lan --immediate-mode -U -Z root -w "$1" udp port 2048 or ip proto 47) ready='listening on'
    if [ "$(cat /proc/self/setgroups)" = deny ]; then
        with=(dumpcap -q -P -i lan -f 'udp port 2048 or ip proto 47' -w "$1") ready='Capturing on'
    fi
    "${with[@]}" </dev/null >"$LAB/capture.out" 2>&1 &
    LAB_CAPTURE=$!
    lab_wait_line 20 "$ready" "$LAB/capture.out" || { cat "$LAB/capture.out" >&2; return 1; }
}
lab_capture_end() {
    lab_pause 1.2
    kill -INT "$LAB_CAPTURE"; wait "$LAB_CAPTURE"
}

# --- As a command

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
