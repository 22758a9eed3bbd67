#!/bin/bash
# Commands are run at changes of a group's role, of alarms and of a proxy's health, by an unprivileged service.
#   scenario_notify.sh DIRECTORY_OF_THE_PROGRAMS
set -u
export LAB_SPEED=${LAB_SPEED:-8} LAB_PLANE=${LAB_PLANE-}
# shellcheck source=../lab/cases.sh
source "$(dirname "$0")/../lab/cases.sh"
lab_cases "$@"

run=/run/wccpd/notify
notify_start() {
    lab_start a1 notify mgmtctl notify run --directory $run/d --state $run/state/reported --user nobody --limit 1
}
# Expects these changes in the log of the first command since the last call, in this order and no others.
reported() { # SECONDS "KIND PREVIOUS>STATE REASON"...
    local wanted limit=$1; shift
    wanted=$(printf '%s\n' "$@")
    lab_wait "$limit" ". == $(jq -Rs 'rtrimstr("\n")' <<<"$wanted")" eval "lab_in a1 tail -n +$((seen + 1)) $run/out/log | jq -Rs 'rtrimstr(\"\n\")'" ||
        die "not reported: $wanted"
    seen=$((seen + $#))
}

# The router stops answering and comes back, the proxy is killed and started again; then the service itself, wccpd and
# mgmtd are gone for a time.
case_changes() {
    local seen=0
    lab_router r1 10.0.0.1
    lab_appliance a1 10.0.0.101
    lab_in a1 setpriv --reuid 65534 --clear-groups true 2>/dev/null || { echo "skipped: no other user"; exit 0; }
    # shellcheck disable=SC2016
    lab_in a1 bash -c '
        cp /etc/group /tmp/group; echo wccpd:x:2999:nobody >>/tmp/group; mount --bind /tmp/group /etc/group
        mkdir -p $1/d $1/out && chmod 777 $1/out && mkdir -m 700 $1/state && chown nobody $1/state && cd $1/d
        printf "%s\n" "#!/bin/sh" "echo \"\$WCCP_KIND \$WCCP_PREVIOUS>\$WCCP_STATE \$WCCP_REASON\" >>$1/out/log" \
            "echo \"\$(id -u) \$WCCP_GROUP \$WCCP_ALARM \$WCCP_CAUSE\" >>$1/out/more" >10-log
        printf "%s\n" "#!/bin/sh" "[ \$WCCP_KIND = alarm ] || exit 0" "sleep 1000 & echo \$! >>$1/out/pid" wait >20-slow
        echo "#!/bin/sh" >writable; chmod 755 10-log 20-slow; chmod 757 writable' - $run || die "no commands"
    lab_gateway a1 10.0.0.1
    lab_proxy a1 3129
    lab_appliance_start a1 "$(lab_group 51 10.0.0.1)" "$(lab_intercept 51 ports=80 interval=1 rise=1 fall=1 leave_after=0)"
    wait_ready 51 a1
    notify_start
    reported 20 'role UNKNOWN>ACTIVE ' 'health unknown>up '
    lab_wait_line 5 'refused: .*/writable: others than root may write to it' "$LAB/a1-notify.out" || die "not refused"

    lab_stop a1 proxy
    reported 20 'health up>down proxy-down'
    lab_ctl r1 stop >/dev/null
    reported 30 'role ACTIVE>BACKUP router-silent' 'alarm cleared>raised router-silent'
    lab_wait_line 10 '20-slow: not done after 1 s, ended' "$LAB/a1-notify.out" || die "not ended"
    # shellcheck disable=SC2016
    lab_in a1 bash -c '! kill -0 $(cat '$run'/out/pid)' 2>/dev/null || die "a child of the command is left running"
    lab_in a1 grep -qx '65534 51 adjacency 10.0.0.1 has stopped answering: no I-See-You for 40 s' $run/out/more || die "$(lab_in a1 cat $run/out/more)"
    lab_ctl r1 resume >/dev/null
    reported 40 'role BACKUP>ACTIVE ' 'alarm raised>cleared '

    lab_wait 10 '. == 2' grep -c '20-slow: not done' "$LAB/a1-notify.out" || die "the command of the cleared alarm did not end"

    # Changes while the service is stopped are reported after the next start.
    lab_stop a1 notify || die "ended with $?"
    lab_proxy a1 3129
    wait_ready 51 a1
    notify_start
    reported 10 'health down>up '
    lab_stop a1 wccpd || die "ended with $?"
    reported 10 'role ACTIVE>UNKNOWN wccpd-absent'
    lab_wccpd_start a1
    wait_role a1 40 51 ACTIVE
    lab_wait 20 '. == "ACTIVE"' eval "lab_in a1 awk '/^role/ { sub(/.*>/, \"\", \$2); last = \$2 } END { print \"\\\"\" last \"\\\"\" }' $run/out/log" || die "not reported"
    seen=$(lab_in a1 cat $run/out/log | wc -l)
    # mgmtd is gone: wccpd ends, and the service waits for both.
    lab_stop a1 mgmtd KILL
    lab_wait_exit 15 a1 wccpd
    lab_mgmtd_start a1
    reported 20 'role ACTIVE>UNKNOWN wccpd-absent'
    [ "$(lab_in a1 cat $run/state/reported)" = 'up health 51' ] || die "the file: $(lab_in a1 cat $run/state/reported)"
    lab_stop a1 notify || die "ended with $?"
    ! lab_in a1 "$WCCP_BIN/mgmtctl" notify run 2>"$LAB/refused.out" || die "runs as root"
    finish a1 -- 'Lost connection to mgmtd'
}

lab_case
