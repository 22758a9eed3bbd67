#!/bin/bash
# mgmtctl group, policy and show with a whole appliance: groups are added, changed in place, recreated and deleted, a second
# appliance takes its share, and `show --watch` follows while a router, mgmtd and wccpd stop and come back.
#   scenario_mgmtctl_groups.sh DIRECTORY_OF_THE_PROGRAMS
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin} LAB_SPEED=${LAB_SPEED-8}
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"

fail() { echo "$*" >&2; lab_show a1; exit 1; }
# Runs mgmtctl --json and checks its exit status and that the jq expression is true for its output.
expect() { # STATUS EXPRESSION WORDS...
    local status=$1 expression=$2 output got; shift 2
    output=$(lab_manage a1 "$@"); got=$?
    [ $got = "$status" ] || fail "$* exited with $got, not $status: $output"
    jq -e "$expression" <<<"$output" >/dev/null || fail "$*: not true: $expression: $output"
}
wait_shown() { lab_wait 60 "$1" lab_manage a1 show || fail "show"; }

lab_router r1 10.0.0.1
lab_router r2 10.0.0.2
lab_appliance a1 10.0.0.101
lab_appliance a2 10.0.0.102
GROUP=/qv/wccpd/wccp/srv_grp/config
config=/proc/${LAB_INIT[a1]}/root$LAB_CONFIG
LAB_FOUND[a1]=$(lab_remains a1)

# Without mgmtd, and without wccpd.
expect 3 '.mgmtd == "unreachable" and (.reason | length > 0)' show
expect 3 '.exit == 3' group add 51 router 10.0.0.1
lab_write_config a1
lab_mgmtd_start a1
expect 3 '.wccpd == "absent" and .groups == []' show
expect 0 '.done == "added" and .wccpd == "absent"' group add 50 interface eth0 router 10.0.0.1
expect 3 '.groups[0] | .configured and (.running | not) and .routers[0].connection == "unknown"' show
expect 0 '.done == "deleted"' group delete 50
expect 4 '.code == 14004' group delete 50
lab_tunneld_start a1
lab_wccpd_start a1
expect 0 '.wccpd == "running" and .status == "Ready" and .groups_total == 0' show

# A group is added with one commit.
expect 2 '.error | test("did you mean .weight")' group add 51 wieght 100
expect 1 '.code == 14008 and .commits == 0' group add 51 interface eth0 router 10.0.0.999
expect 0 '.done == "added" and .commits == 1 and .running and .state == "INIT"' \
    group add 51 interface eth0 router 10.0.0.1 weight 30 assign hash priority 10 password - <<<secret
for router in r1 r2; do lab_ctl $router password secret >/dev/null; done
lab_wait_role 30 a1 51 ACTIVE || fail "the group did not become active"
wait_shown '.groups[0] | .designated and .state == "ACTIVE" and .appliances[0].share_percent == 100'
expect 0 '.groups[0] | .password and .link == "up" and .priority == 10 and .tables[0].kind == "hash" and
    .tables[0].buckets == [{"first": 0, "last": 255, "appliance": "10.0.0.101"}] and (.routers[0] | .connection == "two-way" and
    .assign == "hash" and (.forward == "gre" or .forward == "l2") and .return and .shares["10.0.0.101"] == 100)' show
expect 0 '.[0] | .weight == "30" and .password == "********" and .routers == ["10.0.0.1"]' group list

# Changed in place.
lab_mark a1
expect 0 '.done == "changed" and .commits == 1 and .state == "ACTIVE" and .designated' group set 51 weight 7
lab_wait 15 '.groups["51"].appliances[0].weight == 7' lab_ctl r1 show || fail "the weight did not reach the router"
expect 0 '.done == "changed"' group set 51 weight default hash_dst_ip true
! lab_log a1 | grep -q 'Deleted Group' || fail "a change in place deleted the group"

# Another router requires that the group is recreated, in one commit. A change that is refused leaves the group alone.
expect 1 '.done == "nothing" and .code == 14002 and (.error | test("an address of this appliance"))' group set 51 router 10.0.0.101
expect 1 '.done == "nothing" and (.error | test("four masks"))' group set 51 router 10.0.0.2 mask_src_ip 0xffff
! lab_log a1 | grep -q 'Deleted Group' || fail "a refused change deleted the group"
expect 0 '.done == "recreated" and .commits == 1 and .running and (.note | test("router"))' \
    group set 51 router 10.0.0.1 router 10.0.0.2
[ "$(lab_log a1 | grep -c 'Created WCCP group 51')" = 1 ] || fail "the group was not created again"
grep -A 20 'config/51' "$config" | sort >"$LAB/set"
printf '%s\n' 'assign_method = hash' 'hash_dst_ip = true' 'interface = eth0' 'password = secret' 'priority = 10' \
    'router/1/ipaddr = 10.0.0.1' 'router/2/ipaddr = 10.0.0.2' '[/qv/wccpd/wccp/srv_grp/config/51]' | sort |
    diff - "$LAB/set" || fail "the file differs from the group, or has defaults"
wait_shown '.groups[0] | .state == "ACTIVE" and .designated and (.routers | length == 2 and
    all(.connection == "two-way" and .shares["10.0.0.101"] == 100))'

# A second appliance: the shares follow the weights, in JSON and in text.
lab_appliance_start a2 "$(lab_group 51 10.0.0.1 10.0.0.2 weight=300 assign_method=hash priority=10 password=secret hash_dst_ip=true)"
wait_shown '.groups[0].appliances | length == 2 and (map({(.address): .share_percent}) | add |
    .["10.0.0.101"] == 25 and .["10.0.0.102"] == 75) and all(.asked_percent == .share_percent)'
screen=$(LC_ALL=C lab_in a1 "$WCCP_BIN/mgmtctl" show)
for text in '51  ACTIVE, designated' '  router 10.0.0.2 .* two-way' '  A 10.0.0.101 .* this weight 100 .* 25% has 25%' \
    '  B 10.0.0.102 .* has 75%' '  hash A*B*$'; do
    grep -Eq -- "$text" <<<"$screen" || fail "show has no line $text
$screen"
done
[ "$(wc -l <<<"$screen")" -le 23 ] && [ "$(awk '{ print length }' <<<"$screen" | sort -n | tail -n 1)" -le 79 ] || fail "the output of show is too large: $screen"

# show --watch in a file and on terminals, while a router stops and mgmtd is killed and started again.
lab_start a1 lines mgmtctl show --watch
lab_start a1 terminal /usr/bin/env TERM=xterm LANG=C.UTF-8 script -qfec "stty rows 24 columns 80; exec $WCCP_BIN/mgmtctl show --watch" /dev/null
lab_start a1 guest /usr/bin/env TERM=xterm LANG=C script -qfec "stty rows 12 columns 80; exec $WCCP_BIN/mgmtctl show --watch --below 5" /dev/null
lab_wait_line 15 '^[0-9:]{8}  group 51  ACTIVE, designated  routers 2/2  share 25% of 25%' "$LAB/a1-lines.out" ||
    fail "no line for the group"
lab_stop r2 router KILL 2>/dev/null
lab_wait_line 30 '^[0-9:]{8}  alarm  group 51: 10.0.0.2 has stopped answering' "$LAB/a1-lines.out" ||
    fail "no line for the alarm"
expect 0 '.alarms_total == 1 and .alarms[0].group == 51 and .alarms[0].name == "adjacency" and
    ([.groups[0].routers[] | select(.address == "10.0.0.2")][0].connection != "two-way")' show
lab_stop a1 mgmtd KILL 2>/dev/null
lab_wait_line 15 'mgmtd: ' "$LAB/a1-lines.out" || fail "no line for the loss of mgmtd"
lab_wait_exit 15 a1 wccpd || fail "without mgmtd wccpd exited with $?"
lab_mgmtd_start a1
lab_wccpd_start a1
lab_wait_line 30 'wccpd Ready.* 1 group: 1 active' "$LAB/a1-terminal.out" || fail "the display did not recover"
lab_stop a1 lines INT || fail "show --watch in a file exited with $?"
for name in terminal guest; do
    read -r script _ <<<"$(lab_pid a1 $name)"
    read -r live _ <"/proc/$script/task/$script/children"
    kill -INT "$live"
    lab_wait_exit 15 a1 $name || fail "show --watch ($name) exited with $?"
done
grep -aq $'^\033\\[?1049h' "$LAB/a1-terminal.out" && tail -c 40 "$LAB/a1-terminal.out" | grep -aqF $'\033[?25h\033[?1049l' ||
    fail "the terminal was not restored"
# With --below 5 only the lower seven rows are drawn, and the screen is not switched.
[ "$(grep -aoE $'\033[^A-Za-z]*[A-Za-z]' "$LAB/a1-guest.out" | grep -v 'm$' | sort -u | tr -d '\033\n')" = '[6H[J[K' ] &&
    awk -v 'RS=\033[[]6H' '{ lines = gsub(/\n/, ""); if (lines > most) most = lines } END { exit most < 2 || most > 6 }' \
        "$LAB/a1-guest.out" || fail "show --watch --below: $(tail -n 20 "$LAB/a1-guest.out" | cat -v)"
! grep -aq $'\033' "$LAB/a1-lines.out" || fail "control sequences in a file"

# Policy groups.
expect 0 '.done == "added"' policy add 5 name web
expect 0 '.done == "changed" and .state != null' group set 51 policy 5
expect 0 '.groups[0].policy == 5' show
expect 1 '.code == 14002 and (.error | test("51/policy_grp: policy group 5 is in use"))' policy delete 5
expect 0 '.notes[0] | test("priority only by")' set $GROUP/51/priority 20
lab_wait_log 5 a1 'WCCP config: set priority to 20' || fail "wccpd did not log the priority"
expect 0 '.done == "recreated" and .commits == 1 and .running' group restart 51
expect 0 '.done == "recreated" and .running' group set 51 policy none
expect 0 '.done == "deleted"' policy delete 5
expect 4 '.code == 14004' policy delete 5
expect 0 '.done == "deleted" and (.running | not)' group delete 51
expect 0 '.groups_total == 0 and .alarms_total == 0' show
lab_end a1 a2 || exit 1
lab_clean_log a1 'Lost connection to mgmtd' || exit 1
exit 0
