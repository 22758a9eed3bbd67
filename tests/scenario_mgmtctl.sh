#!/bin/bash
# mgmtctl with the real programs: every command, its output for people and scripts and its exit status; the monitoring tree
# of a running group, node by node; mgmtd absent, stopped and killed; and a watch of everything that happens meanwhile.
#   scenario_mgmtctl.sh DIRECTORY_OF_THE_PROGRAMS
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin} LAB_SPEED=${LAB_SPEED:-8}
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"

G=/qv/wccpd/wccp/srv_grp/config/51
S=/qv/wccpd/wccp/srv_grp/state/51
fail() { echo "$*" >&2; cat "$LAB"/said "$LAB"/complained >&2; lab_show a1 2>/dev/null; exit 1; }
as=() # command prefix that changes the user
ctl() { lab_in a1 "${as[@]}" "$WCCP_BIN/mgmtctl" "$@"; }
# Runs mgmtctl and checks its exit status and whole standard output: a bash pattern, or after "jq:" a jq expression.
expect() { # STATUS OUTPUT WORDS...
    local status=$1 wanted=$2 got; shift 2
    ctl "$@" >"$LAB/said" 2>"$LAB/complained"; got=$?
    [ $got = "$status" ] || fail "mgmtctl $*: status $got, not $status"
    if [[ $wanted == jq:* ]]; then
        jq -e "${wanted#jq:}" <"$LAB/said" >/dev/null
    else # shellcheck disable=SC2053
        [[ $(<"$LAB/said") == $wanted ]]
    fi || fail "mgmtctl $*: not true, or the output does not match: $wanted"
}
complains() { # PATTERN : for the standard error of the last `expect`
    # shellcheck disable=SC2053
    [[ $(<"$LAB/complained") == $1 ]] || fail "standard error does not match: $1"
}

lab_router r1 10.0.0.1 -- --password geheim
lab_appliance a1 10.0.0.101

# --- Without mgmtd

expect 3 '' get $G/weight
complains 'mgmtctl: mgmtd is not running (nothing listens at /tmp/gcl-socks/uds-provider-mgmtd)'
expect 3 'jq:.exit == 3 and (.error | startswith("mgmtd is not running"))' --json walk /
expect 2 '' get
complains 'mgmtctl: NAME is required*'
expect 2 '' --timeout 5 gte
complains 'mgmtctl: unknown word "gte"; known are get walk*'
expect 2 '' set /a=1 /b
expect 0 'mgmtctl [0-9]*' --version
expect 0 '/qv/wccpd' complete /qv/wcc
lab_in a1 test ! -e /tmp/gcl-socks || fail "mgmtctl left its socket directory"

# --- A running group, and a watch from its start

lab_in a1 bash -c 'cp /etc/group /tmp/group; echo wccpd:x:2999: >>/tmp/group; mount --bind /tmp/group /etc/group'
lab_appliance_start a1 "$(lab_group 51 10.0.0.1 password=geheim)" || fail "the appliance did not start"
(ctl --json watch; echo "{\"ended\": $?}") >"$LAB/watched" &
watch=$!
(ctl watch "$G/wei*" "$G/weight" --count 2; echo "status $?") >"$LAB/watched-one" 2>&1 &
watch_one=$!
lab_wait_role 60 a1 51 ACTIVE || fail "the group did not become active"
lab_wait 20 '.["51"].router["1"].appliance["10.0.0.101"].load_dist == 100' lab_state a1 || fail "no assignment"
expect 0 '*wccp_group_active{group="51"} 1*# EOF' metrics
ctl metrics --http <<<$'HEAD /metrics HTTP/1.1\r\nAccept: text/plain\r\n\r' | grep -q '^Content-Type: text/plain; version=0.0.4' ||
    fail "no metrics over HTTP"
ctl metrics --http <<<$'GET / HTTP/1.1\r\n\r' | grep -q '^HTTP/1.1 404' || fail "no error 404 for another path"

expect 0 100 get $G/weight
expect 0 "$G/weight = 100"$'\n'"$G/password = [*][*][*][*][*][*][*][*]" get $G/weight $G/password
expect 0 'jq:. == [{name: "'$G'/weight", type: "uint32", value: 100}, {name: "'$G'/password", type: "string", value: "geheim"}]' \
    get --json --secrets $G/weight $G/password
expect 4 'jq:.[0].code == 14004 and .[0].hint == "did you mean '$G'/weight?" and .[1].value == 100' --json get $G/wieght $G/weight
expect 4 '' get $G/policy_grp
complains "mgmtctl: $G/policy_grp: is not set"$'\n'"*has no default"
expect 4 '' walk /qv/nobody
complains '*there is nothing below*'

# --- The whole monitoring tree: names, types, and values as far as they are known

expect 0 'jq:(map({key: (.name | ltrimstr("'$S'")), value: .}) | from_entries) as $n |
    ([$n[] | select(.name | test("/(counter|reason)/") | not) | "\(.name | ltrimstr("'$S'")) \(.type)"] | sort) == (" string, /oper string, '\
'/uptime duration_ms, /app_id string, /num_routers uint32, /num_appliances uint32, /debug string, /assignment string, '\
'/since duration_ms, /owners string, /pending_acks uint32, /router/1/heard duration_ms, /router/1 string, /router/1/state string, '\
'/router/1/fwd_method string, /router/1/ret_method string, /router/1/assign_method string, /router/1/id ipv4addr, '\
'/router/1/ipaddr ipv4addr, /router/1/conn_time duration_ms, /router/1/appliance/10.0.0.101 string, '\
'/router/1/appliance/10.0.0.101/load_dist uint32, /appliance/1/ipaddr ipv4addr, /appliance/1/weight uint32" | split(", ") | sort)
    and ([$n["", "/oper", "/app_id", "/num_routers", "/num_appliances", "/router/1", "/router/1/state", "/router/1/ipaddr",
        "/router/1/appliance/10.0.0.101", "/router/1/appliance/10.0.0.101/load_dist", "/appliance/1/ipaddr", "/appliance/1/weight"].value] ==
        ["51", "ACTIVE, DESIGNATED", "10.0.0.101", 1, 1, "1", "TWO-WAY connected", "10.0.0.1", "10.0.0.101", 100, "10.0.0.101", 100])
    and all($n["/router/1/fwd_method", "/router/1/ret_method"].value; . == "GRE" or . == "L2")
    and $n["/counter/tx_here_i_am"].value > 0 and $n["/counter/rx_icu_failures"].value == 0
    and ($n["/router/1/assign_method"].value | . == "HASH" or . == "MASK") and ($n["/router/1/id"].value | test("^([0-9]+[.]){3}[0-9]+$"))
    and all($n["/uptime", "/router/1/conn_time"].value; type == "number" and . > 0 and . % 1000 == 0)
    and all($n["/debug", "/assignment"].value; contains("\n")) and (tostring | contains("geheim") | not)' --json walk $S
expect 0 '*WCCP password * : geheim *' get --secrets $S/debug
expect 0 'jq:(map({key: (.name | ltrimstr("/qv/wccpd/system/state/")), value: .value}) | from_entries) as $n |
    ($n | keys - ["debug_all", "debug_global", "is_alive", "proto_ver", "version"] | length) == 14 and $n["interface/eth0/link"] == "up" and $n.proto_ver == "2.0" and $n.is_alive == "Ready"' \
    --json walk /qv/wccpd/system/state
expect 0 'jq:map(.name) == ["'$S'"]' --json walk --children "${S%/*}"
expect 0 "*$S/debug ="$'\n    '"*$S/appliance/1/weight = 100*" walk /
expect 4 '' get $S/router/1/speed
# A state node of an entry that does not exist reads as zero, by design.
expect 0 0.0.0.0 get $S/appliance/2/ipaddr

# --- Changes

expect 0 '' set $G/weight 7
lab_wait 20 '.groups["51"].appliances[0].weight == 7' lab_ctl r1 show || fail "the weight did not reach the router"
expect 0 '' set $G/weight=9 $G/mask_dst_ip=0x7f
expect 1 '' set $G/weight=70000 $G/priority=1
complains "mgmtctl: $G/weight: \"70000\" is not between 0 and 65535"
expect 0 'jq:map(.value) == [9, 200, 127]' --json get $G/weight $G/priority $G/mask_dst_ip
expect 1 'jq:.name == "'$G'/password" and .code == 14008 and (.error | contains("123456789") | not)' --json set $G/password 123456789
expect 4 '' set --existing "${G%51}52/weight" 1
expect 4 '' set $S/oper=BACKUP
complains '*it is a state: it can only be read'
expect 0 "created ${G%51}52" set "${G%51}52/weight=1"
expect 0 'jq:.changed == ["'"${G%51}52"'"] and .exit == 0' --json delete "${G%51}52"
expect 4 '' delete "${G%51}52"
expect 0 '' set $G/priority 100
complains '*note: group 51: wccpd applies a change of priority only by recreating the group*'
expect 0 '' delete $G/mask_dst_ip

# --- Alarms: the router stops, and the group goes down

expect 0 '' delete $G
expect 0 'created*' set $G/interface=eth0 $G/router/1/ipaddr=10.0.0.1 $G/password=geheim
lab_wait 60 '.["51"].router["1"].state == "TWO-WAY connected"' lab_state a1 || fail "the group was not created again"
expect 0 'no alarm is active' alarms --check
completed() { # WORD... : prints what bash would offer
    lab_in a1 bash -c 'PATH=$1:$PATH; source "$2"; compopt() { :; }; shift 2
        COMP_WORDS=(mgmtctl "$@"); COMP_CWORD=$#; _mgmtctl; echo "${COMPREPLY[*]}"' - "$WCCP_BIN" "$top/packaging/mgmtctl.bash-completion" "$@"
}
[ "$(completed al)" = alarms ] && [ "$(completed get "${G%1}")" = $G ] && [ "$(completed group set '')" = 51 ] &&
    [ "$(completed get "$S/router/")" = "$S/router/1" ] && [ "$(completed set $G/encap = g)" = gre ] &&
    [ "$(completed walk --le)" = --leaves ] || fail "completion of alarms, get, group, set and walk"
lab_ctl r1 stop >/dev/null

# Until the alarm: pipes, a full device, and completion for intercepts

(ctl walk / | true; exit "${PIPESTATUS[0]}"); [ $? = 141 ] || fail "wrong status for a pipe without a reader"
ctl walk / >/dev/full 2>"$LAB/complained"; [ $? = 7 ] || fail "wrong status for a full device"
complains 'mgmtctl: standard output: No space left on device'
ctl bypass add 10.0.0.0/8 >/dev/null && ctl intercept add 51 all to 3128 >/dev/null || fail "mgmtd refused an intercept"
[ "$(completed bypass delete 10.0.0.0/)" = 10.0.0.0/8 ] && [ "$(completed intercept set '')" = 51 ] &&
    [ "$(completed intercept set 51 ch)" = check ] && [ "$(completed intercept set 51 rest d)" = drop ] ||
    fail "completion of bypass and intercept"
lab_wait 20 '.intercepts[0] | .group == 51 and .to == 3128 and .proxy == "down"' ctl --json intercept show 051 ||
    fail "the intercept is not shown, or its proxy, which does not exist, is not down"
ctl bypass delete 10.0.0.0/8 >/dev/null; ctl intercept delete 51 >/dev/null
if lab_in a1 setpriv --reuid 65534 --clear-groups true 2>/dev/null; then
    as=(setpriv --reuid 65534 --regid 65534 --clear-groups)
    expect 3 '' get $G/weight
    complains '*only root, the user that mgmtd runs as and the group wccpd may use it'
    as=(setpriv --reuid 65534 --regid 65534 --groups "$(getent group wccpd | cut -d: -f3 | grep . || echo 2999)")
    expect 0 'jq:.groups[0].password' --json show
    for words in "get $G/password" 'walk /' "get $S/debug" export 'export --json' "get /mgmtd/config/state/text" 'diff 1 2'; do
        # shellcheck disable=SC2086
        ctl $words --secrets >"$LAB/said" 2>"$LAB/complained" && [ -s "$LAB/said" ] && ! grep -q geheim "$LAB/said" ||
            fail "$words --secrets by a viewer"
    done
    expect 1 '' set $G/weight 7
    complains 'mgmtctl: user 65534 may look, but not change anything'
    as=()
fi

# Export, apply, history, rollback

ctl export >"$LAB/exported"
expect 0 'nothing to change' apply --check - <"$LAB/exported"
sed 's/weight = .*//; $a [/qv/wccpd/wccp/policy_grp/config/5]' "$LAB/exported" >"$LAB/applied"
expect 1 'add    /qv/wccpd/wccp/policy_grp/config/5 = 5' apply --check - <"$LAB/applied"
expect 2 '' apply - <"$LAB/applied"
complains '*cannot ask for confirmation: add --yes or --check'
expect 2 'jq:.exit == 2 and (.error | startswith("standard input:1: "))' --json apply --check - <<<nonsense
expect 0 'jq:.done and .changes[0].after == 5 and .confirm_minutes == 3' --json apply --yes --confirm 3 - <"$LAB/applied"
expect 1 '' set $G/weight 8
complains 'mgmtctl: commit [0-9]* waits until * to be confirmed; "mgmtctl confirm" keeps it, "mgmtctl rollback [0-9]*" undoes it'
expect 0 'jq:.[0].confirm_by != null and .[0].cause == "apply" and .[0].user == "root"' --json history
expect 0 'commit * confirmed' confirm
expect 0 'add    /qv/wccpd/wccp/policy_grp/config/5 = 5' diff
last=$(ctl --json history | jq '.[1].commit')
[[ " $(completed rollback '') " == *" $last "* ]] || fail "completion of commits"
expect 0 $'delete /qv/wccpd/wccp/policy_grp/config/5 (was 5)\ncommit *' rollback "$last"
expect 4 '' diff 9999
lab_in a1 tee /tmp/applied <"$LAB/applied" >/dev/null
for answer in n y; do
    lab_in a1 script -qec "'$WCCP_BIN/mgmtctl' apply /tmp/applied" /dev/null <<<$answer >"$LAB/said" 2>&1
    [ $? = "$([ $answer = y ] && echo 0 || echo 1)" ] && grep -q 'apply this? \[y/N\]' "$LAB/said" || fail "apply with the answer $answer"
done
expect 0 '' delete /qv/wccpd/wccp/policy_grp/config/5

lab_wait_event 60 a1 '^alarm raised: .*51' || fail "no alarm for the router"
expect 6 '*adjacency*grp:51*' alarms --check
expect 0 'jq:.[0] | .type == 196638 and .name == "adjacency" and (.source | endswith(":grp:51")) and
    (.reporter | startswith("wccpd-")) and (.since | length) == 19' --json alarms
lab_ctl r1 resume >/dev/null

# Until the alarm is cleared: mgmtd is stopped

mgmtd=$(lab_pid a1 mgmtd)
kill -STOP "$mgmtd"
began=$EPOCHREALTIME
expect 3 '' --timeout 0.5 get $G/weight
complains 'mgmtctl: mgmtd gave no answer in 0.500 s'
[ "$(completed get "${G%1}")" = '' ] || fail "completion prints something"
took_ms=$(((${EPOCHREALTIME/./} - ${began/./}) / 1000))
[ $took_ms -lt 6000 ] || fail "with mgmtd stopped, get and completion took $took_ms ms"
lab_start a1 asker mgmtctl get $G/weight
until [ -n "$(lab_pid a1 asker)" ]; do sleep 0.1; done
sleep 0.3
lab_stop a1 asker 2>/dev/null; [ $? = 143 ] || fail "mgmtctl did not end by the signal"
kill -CONT "$mgmtd" "${LAB_PID[a1/mgmtd]}"

lab_wait_event 60 a1 '^alarm cleared: .*51' || fail "the alarm was not cleared"
expect 0 '[[]]' --json alarms --check

# --- explain: faults made on purpose

print_explanation() { ctl --json explain "$1" || [ $? = 1 ]; }
explains() { # GROUP CODE WORDS : within some seconds the first reason of the group is CODE, with WORDS in its cause, a time and a next step
    lab_wait 20 "[.reasons[] | select(.group == $1 and .attention)][0] | .reason == \"$2\" and .first_ms != null and
        .next != \"\" and (.cause | contains(\"$3\"))" print_explanation "$1" || fail "explain $1 does not report $2: $3"
}
lab_wait 60 '.attention == false' print_explanation 51 || fail "a reason is left of the time without a router"
expect 0 '*nothing needs attention*' explain 51
lab_in a1 bash -c 'ip link add eth1 type veth peer name eth4; ip link add eth2 type veth peer name eth3
    ip address add 10.9.1.1/24 dev eth1; ip address add 10.9.3.1/24 dev eth3; ip link set eth2 up; ip link set eth3 up
    ip route add unreachable 10.8.0.0/16'
lab_start a1 taker wccp_router --router 10.9.3.1 # occupies port 2048
causes='60|interface eth9 router 10.0.0.1|interface-missing|no interface eth9
61|interface eth0 router 10.0.0.77|no-answer|10.0.0.77 does not answer
62||no-interface|has no interface
63|interface eth0|no-router|has no router
64|interface eth1 router 10.0.0.1|interface-down|eth1 is down
65|interface eth2 router 10.0.0.1|interface-no-address|eth2 has no IPv4 address
66|interface eth3 router 10.0.0.1|port-taken|2048 on eth3 is taken
67|interface eth0 router 10.8.0.1|send-failed|sending to 10.8.0.1 fails: '
while IFS='|' read -r group words _; do # shellcheck disable=SC2086
    ctl group add $group $words >/dev/null || fail "mgmtd refused group $group $words"
done <<<"$causes"
while IFS='|' read -r group _ code words; do explains "$group" "$code" "$words"; done <<<"$causes"
[ "$(ctl get "${S%51}67/counter/tx_send_errors")" -gt 0 ] || fail "failed sends are not counted"
# Each fault takes precedence over the earlier ones, whose reasons last for a while.
while read -r broken code words; do
    lab_ctl r1 fault "$broken" always >/dev/null
    explains 51 "$code" "$words"
done <<'FAULTS'
other-service service-mismatch here it has priority 200
no-router-id router-id-zero 10.0.0.1 calls itself 0.0.0.0
routers-33 message-malformed 33 routers
bad-length message-length bytes were received
bad-version message-version 10.0.0.1 speaks version 0x100
bad-digest password-mismatch 10.0.0.1 signs its messages with another password
other-security security-missing 10.0.0.1 does not sign
FAULTS
expect 1 '*group 51 *security-missing: *[0-9] ago*next: *router-id-zero: *' explain
expect 0 '*51  * !*10.0.0.1 does not sign*router 10.0.0.1 *security-missing*' show
lab_ctl r1 fault none >/dev/null
for broken in {60..67}; do ctl group delete "$broken" >/dev/null; done
lab_stop a1 taker
expect 2 '' explain 300
lab_wait 20 '.attention == false' ctl --json explain 51 || fail "a reason is left"

# --- wccpd stopped, mgmtd killed

kill -STOP "$(lab_pid a1 wccpd)"
expect 3 '*wccpd does not answer*' show
[[ $(<"$LAB/said") != *'no alarm'* ]] || fail 'show reports "no alarm" without wccpd'
expect 3 '*wccpd-silent*' alarms --check
expect 1 'jq:.reasons[0] | .reason == "wccpd-silent" and .first_ms != null' --json explain
ctl walk /qv >"$LAB/walked" 2>&1 &
walk=$!
expect 3 '' get $S/oper
complains "mgmtctl: $S/oper: wccpd-* did not answer in time"
wait $walk && grep -q "^$G/weight = " "$LAB/walked" || fail "the walk did not skip wccpd"
kill -CONT "$(lab_pid a1 wccpd)" "${LAB_PID[a1/wccpd]}"
expect 0 '?*' get $S/oper
expect 4 '' get /qv/alarms/state/process/wccpd/silent_since
if lab_in a1 chown 1 /tmp/gcl-socks/uds-provider-mgmtd; then # fails in a user namespace with one user
    expect 3 '' get $S/oper
    complains "mgmtctl: /tmp/gcl-socks/uds-provider-mgmtd belongs to user 1; *"
    lab_in a1 chown 0 /tmp/gcl-socks/uds-provider-mgmtd
fi
! lab_in a1 ls /tmp/gcl-socks | grep mgmtctl || fail "mgmtctl left sockets"

wait $watch_one
[ "$(cut -d' ' -f2- <"$LAB/watched-one")" = "modify $G/weight = 7 (was 100)
modify $G/weight = 9 (was 7)
0" ] || { cat "$LAB/watched-one" >&2; fail "wrong output of the watch of one node"; }
lab_stop a1 mgmtd KILL 2>/dev/null
wait $watch
jq -s -e 'def one(f): [.[] | select(f)] | length == 1;
    .[-2].error == "mgmtd closed the session" and .[-1].ended == 3
    and one(.event == "change" and any(.changes[]; .name == "'$G'/weight" and .change == "modify" and .before == 100 and .after == 7))
    and one(.event == "change" and (.changes | length) == 1 and .changes[0] == {name: "'$G'/mask_dst_ip", change: "modify", type: "uint32", before: 127, after: 3840})
    and any(.[]; .event == "role" and .group == 51 and .role == "ACTIVE")
    and all(("alarm_raised", "alarm_cleared") as $event | any(.[]; .event == $event and .name == "adjacency"); .)
    and all(.[:-2][]; .time | test("^20..-..-..T..:..:..[+-]....$"))' <"$LAB/watched" >/dev/null ||
    { cat "$LAB/watched" >&2; fail "wrong output of the watch"; }
expect 3 '' get $G/weight
complains 'mgmtctl: mgmtd is not running (nothing listens at *)'
exit 0
