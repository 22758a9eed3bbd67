#!/bin/bash
# mgmtd --supervise starts tunneld and wccpd with their options. A tunneld that crashes is replaced without wccpd noticing;
# one that exits makes wccpd restart as well, and one that restarts in a loop raises an alarm. SIGHUP applies an edited
# file, a program that does not exit is killed, and no program outlives an mgmtd that is killed.
#   scenario_supervise.sh DIRECTORY_OF_THE_PROGRAMS
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
bin=$(readlink -f "${1:-$top/build/release/bin}")
if [ "${2-}" != --inside ]; then
    cd "$bin" && exec "$top/lab/in-appliance" "$top/tests/scenario_supervise.sh" "$bin" --inside
fi

out=/run/wccpd/mgmtd.out; config=/run/wccpd/mgmtd.conf
mkdir -p /run/wccpd /etc/opt/rvl
cp "$top"/packaging/*.conf /etc/opt/rvl/
ip link add eth0 type veth peer name eth1 && ip address add 10.0.0.9/24 dev eth0
ip link set eth0 up && ip link set eth1 up
printf '[/qv/wccpd/wccp/srv_grp/config/51]\ninterface = eth0\nrouter/1/ipaddr = 10.0.0.1\n' >$config

die() { echo "$*" >&2; cat $out >&2; exit 1; }
wait_line() { # SECONDS COUNT PATTERN
    local i
    for ((i = 0; i < $1 * 10; i++)); do
        [ "$(grep -cE "$3" $out)" -ge "$2" ] && return
        sleep 0.1
    done
    die "not $2 lines in the output of mgmtd: $3"
}
# SIGCHLD may be ignored by whatever starts mgmtd, and it notices the exit of its programs nevertheless.
start_mgmtd() {
    : >$out
    env --ignore-signal=CHLD "$bin/mgmtd" --config $config --supervise --wccpd "$bin/wccpd" --tunneld " $bin/tunneld  --plane table" >$out 2>&1 &
    mgmtd=$!
    wait_line 20 2 "^session of wccpd-[0-9]+ open"
    wait_line 20 1 "^role of group 51: BACKUP"
}
pid_of() { sed -n "s/^process $1: started, pid //p" $out | tail -n 1; }

! "$bin/mgmtd" --config $config --supervise --tunneld ' ' >$out 2>&1 || die "mgmtd accepted an empty command"
# A program that never opens a session.
"$bin/mgmtd" --config $config --supervise --wccpd false --tunneld "$bin/tunneld --plane table" >$out 2>&1 &
mgmtd=$!
wait_line 20 1 "^alarm raised: wccpd restarted 3 times in [0-9]+ s; the last one exited with 1"
"$bin/mgmtctl" alarms | grep -q 'restart-loop  wccpd *wccpd ends again and again: restarted [3-9] times in [0-9]* s; the last one exited with 1$' ||
    die "$("$bin/mgmtctl" alarms)"
"$bin/mgmtctl" explain | grep -q '^  restart-loop: wccpd ends again and again' && "$bin/mgmtctl" show | grep -q '^! wccpd ends again' ||
    die "$("$bin/mgmtctl" explain; "$bin/mgmtctl" show)"
"$bin/mgmtctl" metrics | grep -qx 'wccp_alarm_active{alarm="restart-loop",source="wccpd"} 1' && "$bin/mgmtctl" metrics | grep -qx 'wccp_process_restarts_total{process="wccpd"} [3-9]' ||
    die "$("$bin/mgmtctl" metrics)"
kill -TERM $mgmtd
wait $mgmtd || die "mgmtd ended with $?"
start_mgmtd
[ "$(tr '\0' ' ' <"/proc/$(pid_of tunneld)/cmdline")" = "$bin/tunneld --plane table " ] || die "the options of tunneld"
first=$(pid_of wccpd)
wait_line 10 1 "^session of tunneld-[0-9]+ open"
sleep 0.6 # a program that exits earlier counts as one that failed to start
kill -KILL "$(pid_of tunneld)"
wait_line 10 1 "^process tunneld: ended by SIGKILL, replaced after [0-9]+ ms"
wait_line 10 2 "^session of tunneld-[0-9]+ open"
[ "$(pid_of wccpd)" = "$first" ] && kill -0 "$first" || die "wccpd was restarted"
kill -TERM "$(pid_of tunneld)"
wait_line 10 1 "^process tunneld: /pm/events/failure/unexpected_exit"
wait_line 10 1 "^process wccpd: exited with 0, starts again in 1 s"
wait_line 20 4 "^session of wccpd-[0-9]+ open"
[ "$(pid_of wccpd)" != "$first" ] || die "wccpd was not restarted"

sed -i 's/^interface.*/&\nweight = 7/' $config
kill -HUP $mgmtd
wait_line 5 1 "^configuration read again: 1 nodes changed"

kill -STOP "$(pid_of wccpd)"
kill -TERM $mgmtd
wait $mgmtd || die "mgmtd exited with $?"
wait_line 1 1 "^process wccpd: does not end, killed"
wait_line 1 1 "^process tunneld: exited with 0"
[ ! -e /tmp/gcl-socks/uds-provider-mgmtd ] || die "the socket is left"

# The next mgmtd starts while the programs of the killed one are still exiting.
start_mgmtd
kill -KILL $mgmtd
start_mgmtd
programs=("$(pid_of wccpd)" "$(pid_of tunneld)")
kill -KILL $mgmtd
for ((i = 0; i < 50; i++)); do
    kill -0 "${programs[@]}" 2>/dev/null || exit 0
    sleep 0.1
done
die "left running: $(ps -o pid,comm -p "${programs[0]},${programs[1]}")"
