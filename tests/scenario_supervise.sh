#!/bin/bash
# mgmtd starts the appliance's programs with their options and keeps them: both sessions open, a tunneld that crashes
# is replaced unnoticed, one that is ended takes wccpd with it and both come back, a file edited by hand reaches wccpd,
# a program that doesn't end is made to, and nothing outlives an mgmtd that is killed.
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
says() { # SECONDS COUNT PATTERN
    local i
    for ((i = 0; i < $1 * 10; i++)); do
        [ "$(grep -cE "$3" $out)" -ge "$2" ] && return
        sleep 0.1
    done
    die "not said $2 times: $3"
}
start() { # however it was started: a caller may have ignored the signal that tells of a child's end
    : >$out
    env --ignore-signal=CHLD "$bin/mgmtd" --config $config --supervise --wccpd "$bin/wccpd" --tunneld " $bin/tunneld  --plane table" >$out 2>&1 &
    mgmtd=$!
    says 20 2 "^session of wccpd-[0-9]+ open"
    says 20 1 "^role of group 51: BACKUP"
}
pid_of() { sed -n "s/^process $1: started, pid //p" $out | tail -n 1; }

! "$bin/mgmtd" --config $config --supervise --tunneld ' ' >$out 2>&1 || die "started without a program"
start
[ "$(tr '\0' ' ' <"/proc/$(pid_of tunneld)/cmdline")" = "$bin/tunneld --plane table " ] || die "the options of tunneld"
first=$(pid_of wccpd)
says 10 1 "^session of tunneld-[0-9]+ open"
sleep 0.6 # a run that is shorter counts as one that failed to start
kill -KILL "$(pid_of tunneld)"
says 10 1 "^process tunneld: ended by SIGKILL, replaced after [0-9]+ ms"
says 10 2 "^session of tunneld-[0-9]+ open"
[ "$(pid_of wccpd)" = "$first" ] && kill -0 "$first" || die "wccpd has noticed"
kill -TERM "$(pid_of tunneld)"
says 10 1 "^process tunneld: /pm/events/failure/unexpected_exit"
says 10 1 "^process wccpd: exited with 0, starts again in 1 s"
says 20 4 "^session of wccpd-[0-9]+ open"
[ "$(pid_of wccpd)" != "$first" ] || die "wccpd is the same"

sed -i 's/^interface.*/&\nweight = 7/' $config
kill -HUP $mgmtd
says 5 1 "^configuration read again: 1 nodes changed"

kill -STOP "$(pid_of wccpd)"
kill -TERM $mgmtd
wait $mgmtd || die "mgmtd ended with $?"
says 1 1 "^process wccpd: does not end, killed"
says 1 1 "^process tunneld: exited with 0"
[ ! -e /tmp/gcl-socks/uds-provider-mgmtd ] || die "the socket is left"

# The next mgmtd starts while the programs of the killed one are still ending.
start
kill -KILL $mgmtd
start
programs=("$(pid_of wccpd)" "$(pid_of tunneld)")
kill -KILL $mgmtd
for ((i = 0; i < 50; i++)); do
    kill -0 "${programs[@]}" 2>/dev/null || exit 0
    sleep 0.1
done
die "left running: $(ps -o pid,comm -p "${programs[0]},${programs[1]}")"
