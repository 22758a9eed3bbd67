#!/bin/bash
# Configuration changes while groups run: each node of a group, whole groups, policy groups, the mode of the system; and
# mgmtd with its file: killed in commits, on a full disk, and in a fleet.
#   scenario_configuration.sh DIRECTORY_OF_THE_PROGRAMS [CASE...]
set -u
export LAB_SPEED=${LAB_SPEED:-8}
# shellcheck source=../lab/cases.sh
source "$(dirname "$0")/../lab/cases.sh"
lab_cases "$@"

# Commits during the start of wccpd: 30 starts with 256 groups and 10 commits each, none of which is lost. With a
# sanitizer, where commits take long, 3 starts.
case_start() {
    local id text='' round rounds=30 absent=0 commits running configured nodes=/qv/wccpd/wccp/srv_grp/config
    for id in $(seq 0 255); do text+="$(lab_group "$id" 10.0.0.1 "weight=$id")"$'\n'; done
    LAB_LOG_LEVEL=notice start_appliance a1 10.0.0.101 "$text"
    ! grep -q __asan_init "$WCCP_BIN/wccpd" || rounds=3
    for round in $(seq $rounds); do
        lab_stop a1 wccpd || die "wccpd exited with $?"
        # One group is deleted, the one deleted before is created again, and eight others change.
        lab_in a1 bash -c "set -e; exec {never}<> <(:)
            ctl() { '$WCCP_BIN/mgmtctl' --timeout 60 \"\$@\"; read -rt 0.0\$((RANDOM % 4)) -u \$never || true; }
            ctl delete $nodes/$round
            for id in \$(shuf -i 100-255 -n 8); do ctl set $nodes/\$id/weight=$round\$((RANDOM % 100)); done
            ctl set $nodes/$absent/{interface=eth0,router/1/ipaddr=10.0.0.1,weight=$round}" >"$LAB/commits.out" 2>&1 &
        commits=$!
        lab_wccpd_start a1
        wait $commits || die "commits: $(cat "$LAB/commits.out")"
        absent=$round
        running=$(lab_manage a1 walk --children ${nodes/config/state} | jq -r '.[].name + "/debug"')
        configured=$(lab_manage a1 walk --children $nodes | jq -r '.[].name + "/weight"')
        # shellcheck disable=SC2086
        diff <(lab_manage a1 get $running | jq -r '.[] | "\(.name | split("/")[6]) \(.value | capture("WCCP weight *: (?<w>[0-9]+)").w)"' | sort) \
            <(lab_manage a1 get $configured | jq -r '.[] | "\(.name | split("/")[6]) \(.value)"' | sort) >&2 ||
            die "start $round: the running groups differ from the configuration"
    done
    finish a1
}

# mgmtd is killed while three clients commit (WCCP_KILLS times): the file and the history have every commit that was
# acknowledged, and no half-written files are left.
case_killed() {
    lab_appliance a1 10.0.0.101
    # shellcheck disable=SC2016
    lab_in a1 bash -c '
        bin=$1 dir=/etc/opt/rvl/kept node=/qv/wccpd/wccp/srv_grp/config cut=0 mgmtd=
        fail() { echo "kill $kill: $*"; cat $dir/out; exit 1; }
        ctl() { "$bin/mgmtctl" --timeout 20 "$@" 2>/dev/null; }
        start() {
            "$bin/mgmtd" --config $dir/conf >>$dir/out 2>&1 & mgmtd=$!
            until ctl get /qv/tunneld/system/config/mode >/dev/null; do kill -0 $mgmtd || fail "does not start"; sleep 0.01; done
        }
        change() { local n=$2; while ctl set $node/$1/weight=$n; do echo $n >$dir/acknowledged-$1; n=$((n + 1)); done; }
        mkdir $dir; start; ctl set $node/{1,2,3}/weight=0 >/dev/null
        for kill in $(seq "$2"); do
            at=()
            for id in 1 2 3; do
                at[id]=$(ctl get $node/$id/weight)
                last=$(cat $dir/acknowledged-$id 2>/dev/null || echo 0)
                [ "${at[id]}" = "$last" ] || [ "${at[id]}" = $((last + 1)) ] || fail "$last was acknowledged, there is ${at[id]}"
                echo "${at[id]}" >$dir/acknowledged-$id
                change $id $((at[id] + 1)) &
                clients[id]=$!
            done
            sleep "0.$(printf %03d $((RANDOM % 150 + 10)))"
            kill -KILL $mgmtd; wait $mgmtd "${clients[@]}"
            [ -z "$(find $dir -name "*unfinished" -o -name pending)" ] || cut=$((cut + 1))
            "$bin/mgmtd" --config $dir/conf --check || fail "the file is broken"
            start
            [ -z "$(find $dir -name "*unfinished" -o -name pending)" ] || fail "something is left over"
            last=$(ctl history --json | jq -r "if length <= 50 and all(.[]; .commit == 1 or .cause == \"set\") then .[0].commit else 0 end")
            [ -z "$(ctl diff "$last" || echo failed)" ] || fail "commit $last is not the configuration"
        done 2>/dev/null
        ! grep "can.t be" $dir/out || fail "an entry is broken"
        echo "$kill kills, $cut of them in a commit, $(ctl history --json | jq ".[0].commit") commits"
        kill $mgmtd; wait $mgmtd' - "$WCCP_BIN" "${WCCP_KILLS:-60}" || die "mgmtd did not survive a kill"
}

words=(assign_method=hash)
# Adds a NAME=VALUE to the group, or changes its value, and expects wccpd to apply it to the running group.
change() { # NAME=VALUE LINE_OF_THE_LOG
    local word kept=()
    for word in "${words[@]}"; do [ "${word%%=*}" = "${1%%=*}" ] || kept+=("$word"); done
    words=("${kept[@]}" "$1")
    lab_mark a1
    configure a1 "$(lab_group 51 10.0.0.1 10.0.0.2 "${words[@]}")" || die "$1"
    wait_log a1 5 "WCCP config: $2\$"
    wait_log a1 5 'WCCP Modify config complete'
}
record_has() { [[ $(lab_state a1 51 | jq -r .debug) = *"$1"* ]] || die "not in the record of the group: $1"; }

# No change of a node makes the group leave ACTIVE.
case_nodes() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    start_appliance a1 10.0.0.101 "$(lab_group 51 10.0.0.1 10.0.0.2 assign_method=hash)"
    wait_role a1 30 51 ACTIVE
    change weight=7 'set weight to 7'
    change hash_dst_ip=true 'set hash dst ip to yes'
    change hash_src_port=true 'set hash src port to yes'
    change hash_dst_port=true 'set hash dst port to yes'
    change hash_src_ip=false 'set hash src ip to no'
    change mask_src_ip=0x3 'set mask src ip to 0x3'
    change mask_dst_ip=0x1 'set mask dst ip to 0x1'
    change mask_src_port=0x10 'set mask src port to 0x10'
    change mask_dst_port=0x20 'set mask dst port to 0x20'
    change force_l2_return=true 'set force l2 return to yes'
    change encap=gre 'set encap gre to 1'
    change assign_method=mask 'set assignment method to mask'
    change policy_grp=9 'set policy grp to 9'
    router_is r1 15 51 '$g.appliances[0].weight == 7'
    record_has 'WCCP config fwd, assign, return  : gre, mask,'
    record_has 'WCCP service flags               : 0xe'
    record_has 'Configured MASK            : src-ip: 0x00000003, src-port: 0x0010'
    # The negotiated methods stay until the group starts again; then the changed ones are negotiated.
    group_is a1 1 51 '.oper == "ACTIVE, DESIGNATED" and .router["1"].fwd_method == "L2" and .router["1"].assign_method == "HASH" and
        any(.reason[]; .code == "restart-needed" and .offered == "forwarding by L2" and .wanted == "gre")'
    change admin=down 'set admin down:2'
    router_is r1 5 51 '$g.appliances == []'
    group_is a1 5 51 '.oper == "INIT" and .num_routers == 0'
    change admin=up 'set admin up:1'
    wait_role a1 30 51 ACTIVE
    group_is a1 10 51 '.router["1"].fwd_method == "GRE" and .router["1"].assign_method == "MASK" and
        all(.reason[]?; .code != "restart-needed")'
    router_is r1 10 51 '$g.service.flags == 14 and ($g.assignment.masks[0].mask | [.src_ip, .dst_ip, .src_port, .dst_port]) == [3, 1, 16, 32]'
    grep -q 'L2 return group 51 value 1: done' "$LAB/a1-tunneld.out" || die "tunneld did not get the L2 return"
    finish a1
}

# The group gets a password before the routers do: they refuse its messages until they have the password as well.
case_password() {
    lab_router r1 10.0.0.1 -- --query-after 600 --drop-after 600
    start_appliance a1 10.0.0.101 "$(lab_group 51 10.0.0.1)"
    wait_role a1 30 51 ACTIVE
    lab_mark a1
    configure a1 "$(lab_group 51 10.0.0.1 password=squeak)"
    wait_log a1 5 'WCCP config: set password$'
    lab_wait_line 10 'refused: ' "$LAB/r1.log" || die "r1 accepts a signed message"
    lab_ctl r1 password squeak >/dev/null
    local answers; answers=$(grep -c '"what":"i-see-you".*"service":51' "$LAB/r1.log")
    lab_wait 10 ". > $answers" grep -c '"what":"i-see-you".*"service":51' "$LAB/r1.log" || die "r1 does not answer"
    group_is a1 10 51 '.router["1"].state == "TWO-WAY connected"'
    ! grep -q squeak "$LAB/a1.log" || die "the password is in the log"
    finish a1 -- 'mismatch security opt'
}

# One commit recreates a group (its priority can't change while it runs, and a node without a default is deleted), changes
# another group in place and creates a third.
case_recreated() {
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    start_appliance a1 10.0.0.101 "$(lab_group 51 10.0.0.1 10.0.0.2 policy_grp=5)" "$(lab_group 52 10.0.0.1)"
    wait_role a1 30 51 ACTIVE
    lab_mark a1
    configure a1 "$(lab_group 51 10.0.0.1 priority=9 protocol=udp weight=9)" "$(lab_group 52 10.0.0.1 weight=8)" "$(lab_group 53 10.0.0.1)"
    wait_log a1 5 'WCCP update: Deleted Group 51'
    wait_log a1 5 'Created WCCP group 51'
    wait_log a1 5 'Created WCCP group 53'
    router_is r1 30 51 '$g.service.priority == 9 and $g.service.protocol == 17 and $g.appliances[0].weight == 9'
    router_is r1 15 52 '$g.appliances[0].weight == 8'
    router_is r1 15 53 '($g.appliances | length) == 1'
    router_is r2 1 51 '$g.appliances == []'
    ! lab_log a1 | grep -q 'Deleted Group 52' || die "group 52 was not changed in place"
    wait_role a1 30 51 ACTIVE
    finish a1
}

# One commit creates forty groups, another deletes them.
case_many() {
    local id text=''
    lab_router r1 10.0.0.1
    for id in $(seq 10 49); do text+="$(lab_group "$id" 10.0.0.1 weight=$id)"$'\n'; done
    start_appliance a1 10.0.0.101
    configure a1 "$text"
    lab_wait 15 '[.groups[].assignment.kind] | length == 40 and all(. == "mask")' lab_ctl r1 show || die "not all groups have tables"
    lab_wait 15 '[.[].oper] | length == 40 and all(. == "ACTIVE, DESIGNATED")' lab_state a1 || die "not all groups are active"
    configure a1
    lab_wait 10 '[.groups[].appliances[]] == []' lab_ctl r1 show || die "not all groups have left"
    lab_wait 5 '. == {}' lab_state a1 || die "groups are left"
    finish a1
}

# A policy group is ACTIVE when all of its groups are.
case_policy() {
    wait_policy_role() { lab_wait_line "$1" "$2" "$LAB/a1-tunneld.out" || die "role of the policy group"; }
    local policy='[/qv/wccpd/wccp/policy_grp/config/5]'
    lab_router r1 10.0.0.1
    lab_router r2 10.0.0.2
    lab_ctl r2 stop >/dev/null
    LAB_TUNNELD=--roles
    start_appliance a1 10.0.0.101 "$policy" name=blue "$(lab_group 51 10.0.0.1 policy_grp=5)" "$(lab_group 52 10.0.0.2 policy_grp=5)"
    wait_role a1 30 51 ACTIVE
    wait_policy_role 5 '5.*BACKUP'
    lab_ctl r2 resume >/dev/null
    wait_role a1 40 52 ACTIVE
    wait_policy_role 5 '5.*ACTIVE'
    configure a1 "$(lab_group 51 10.0.0.1 policy_grp=6)" "$(lab_group 52 10.0.0.2 policy_grp=6)"
    wait_log a1 5 'WCCP update: Deleted policy Group 5'
    wait_policy_role 5 '6.*ACTIVE'
    wait_policy_role 5 '5.*UNKNOWN'
    lab_ctl r2 stop >/dev/null
    wait_role a1 40 52 BACKUP
    wait_policy_role 5 '6.*BACKUP'
    finish a1
}

# In bridge mode nothing is redirected: the groups send a shutdown message, and stay down until wccpd starts in another
# mode.
case_bridge() {
    local mode='[/qv/tunneld/system/config]' sent
    lab_router r1 10.0.0.1
    start_appliance a1 10.0.0.101 "$(lab_group 51 10.0.0.1)"
    wait_role a1 30 51 ACTIVE
    configure a1 "$mode" mode=bridge "$(lab_group 51 10.0.0.1)"
    router_is r1 5 51 '.counters.rx_shutdown == 1 and $g.appliances == []'
    group_is a1 5 51 '.oper == "INIT"'
    sent=$(lab_ctl r1 show | jq .counters.rx_here_i_am)
    configure a1 "$mode" mode=router "$(lab_group 51 10.0.0.1)"
    lab_sleep 25
    router_is r1 1 51 ".counters.rx_here_i_am == $sent"
    lab_stop a1 wccpd || die "wccpd exited with $?"
    lab_wccpd_start a1
    wait_role a1 30 51 ACTIVE
    lab_stop a1 wccpd || die "wccpd exited with $?"
    # Started in bridge mode, wccpd sends nothing, but answers mgmtctl.
    configure a1 "$mode" mode=bridge "$(lab_group 51 10.0.0.1)"
    sent=$(lab_ctl r1 show | jq .counters.rx_here_i_am)
    lab_wccpd_start a1
    wait_log a1 5 'WCCP timer/rx threads are not launched in non Router mode'
    lab_sleep 15
    router_is r1 1 51 ".counters.rx_here_i_am == $sent"
    group_is a1 5 51 '.oper == "INIT"'
    finish a1
}

# On a full disk a commit is refused, and the configuration and its history stay as they were.
case_full() {
    lab_appliance a1 10.0.0.101
    # shellcheck disable=SC2016
    lab_in a1 bash -c '
        bin=$1 dir=/etc/opt/rvl/small node=/qv/wccpd/wccp/srv_grp/config
        fail() { echo "$*"; cat /etc/opt/rvl/out; exit 1; }
        ctl() { "$bin/mgmtctl" "$@"; }
        start() { "$bin/mgmtd" --config $dir/conf >>/etc/opt/rvl/out 2>&1 & mgmtd=$!; until ctl get /qv/tunneld/system/config/mode >/dev/null 2>&1; do sleep 0.01; done; }
        mkdir $dir; mount -t tmpfs -o size=160k tmpfs $dir; start
        for n in $(seq 200); do
            ctl set $node/{$n,$((n + 50))}/assign_detail=$(printf %0200d $n) >/dev/null 2>$dir/../said || break
        done
        [ "$n" -gt 5 ] && [ "$n" -lt 200 ] && grep -q "could not be saved: .*No space left on device" $dir/../said || fail "commit $n: $(<$dir/../said)"
        before=$(ctl export) last=$(ctl history --json | jq ".[0].commit")
        [[ $before = *"config/$((n - 1))]"* && $before != *"config/$n]"* ]] && [ -z "$(ctl diff "$last")" ] || fail "not as before"
        ctl confirm >/dev/null 2>&1; kill -KILL $mgmtd; wait $mgmtd 2>/dev/null; start
        [ "$(ctl export)" = "$before" ] && [ "$(ctl history --json | jq ".[0].commit")" = "$last" ] || fail "something is lost"
        mount -o remount,size=1m $dir && ctl set $node/$n/assign_detail=x >/dev/null || fail "no commit after there is room again"
        ctl rollback "$last" >/dev/null && [ "$(ctl export)" = "$before" ] || fail "no rollback"
        kill $mgmtd; wait $mgmtd' - "$WCCP_BIN" || die "mgmtd did not survive a full disk"
}

# One change for three sites: fleet-apply stops at the second, which refuses it, and at a site that is unhealthy after it.
# In batches, the first site is alone, and fleet-apply stops after the batch of the site that refuses.
case_fleet() {
    local site file=$LAB/change.conf
    for site in 1 2 3; do
        lab_appliance a$site 10.0.0.10$site
        lab_write_config a$site "$(lab_group 51 10.0.0.1)"
        lab_mgmtd_start a$site
    done
    # shellcheck disable=SC2016
    { declare -p LAB_INIT; echo 'exec nsenter -t "${LAB_INIT[$1]}" --net --mount --root --ipc --pid --wdns=/ "$WCCP_BIN/${@:2}"'; } >"$LAB/at"
    fleet() { # STATUS SAID WORDS...
        local status=$1 said=$2 got; shift 2
        got=$(FLEET_RUN="bash $LAB/at" FLEET_WAIT=1 FLEET_HEALTH=${FLEET_HEALTH-mgmtctl get /qv/tunneld/system/config/mode} "$LAB_TOP/packaging/examples/fleet-apply" "$@" 2>&1 | grep -v ^mgmtctl; exit "${PIPESTATUS[0]}")
        [ $? = "$status" ] && [ "$got" = "$said" ] || die "fleet-apply $*: $got"
    }
    lab_group 51 10.0.0.1 10.0.0.102 weight=7 >"$file"
    fleet 1 $'a1: changed\na2: refuses the change\nhalted; not yet reached: a3' --merge "$file" a1 a2 a3
    [ "$(lab_manage a1 history | jq -c '.[0] | [.cause, .confirm_by]')" = '["apply",null]' ] || die "a1 is not confirmed"
    [ "$(lab_manage a3 history | jq length)" = 1 ] || die "a3 is changed"
    lab_group 51 10.0.0.1 weight=7 >"$file"
    FLEET_HEALTH=false fleet 1 $'a2: is not healthy, and undoes the change in 5 minutes\nhalted; not yet reached: a3' --batch 2 --merge "$file" a2 a3
    lab_in a2 "$WCCP_BIN/mgmtctl" confirm >/dev/null || die "a2 does not wait"
    fleet 1 "a2: nothing to change"$'\n'"a3: modify /qv/wccpd/wccp/srv_grp/config/51/weight = 7 (was 100)" --check --merge "$file" a2 a3
    fleet 0 $'a2: unchanged\na3: changed' --merge "$file" a2 a3
    fleet 0 $'a2: nothing to change\na3: nothing to change' --check --batch 2 --merge "$file" a2 a3
    lab_group 51 10.0.0.1 10.0.0.102 weight=8 >"$file"
    fleet 1 $'a1: changed\na2: refuses the change\na3: changed\nhalted; not yet reached: a1' --batch 2 --merge "$file" a1 a2 a3 a1
}

lab_case
