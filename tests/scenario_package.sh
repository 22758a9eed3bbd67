#!/bin/bash
# The Debian package on a system of its own: it is built, checked by lintian and installed under a systemd in namespaces.
# The three programs run with few privileges, a group becomes active, and a command that runs as nobody is notified of
# it. Programs that are killed or hang are restarted, with an alarm when that happens too often. An upgrade and a reboot
# keep the configuration, and a purge leaves nothing.
#   scenario_package.sh [DIRECTORY_OF_THE_PROGRAMS]    of wccp_router
#
#   WCCP_PACKAGE    a directory with a package that has been built already
#
# The system is this machine's root, without its enabled services, below an overlay in memory. Nothing is written outside
# build/package, which is kept: the next run builds only what has changed. Needs root.
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
bin=$(readlink -f "${1:-$top/build/release/bin}")
work=${WCCP_PACKAGE:-$top/build/package}
export LC_ALL=C TERM=dumb

die() {
    echo "$*" >&2
    [ -z "${init-}" ] || { inside systemctl --no-pager --lines=0 status 'wccp*' mgmtd tunneld; inside mgmtctl show; inside journalctl --no-pager -qn 40; cat $here/r1.log; } >&2
    exit 1
}
skip() { echo "skipped: $*"; exit 77; }

# --- Outside: the package, and namespaces that end with this script

if [ "${2-}" != --inside ]; then
    [ "$(id -u)" = 0 ] || skip "needs root"
    grep -qw overlay /proc/filesystems || modprobe overlay 2>/dev/null || skip "no overlay file system"
    groups=$(findmnt -t cgroup2 -no TARGET | head -n 1)
    [ -n "$groups" ] && [ -w "$groups/cgroup.procs" ] || skip "no control groups of version 2"
    [ -x /lib/systemd/systemd ] || skip "no systemd"
    if [ -z "${WCCP_PACKAGE-}" ]; then
        mkdir -p "$work/src"
        find "$work/src" -mindepth 1 -maxdepth 1 ! -name 'obj-*' -exec rm -rf {} +
        cd "$top" && git ls-files -co --exclude-standard -z | xargs -0 cp -p --parents -t "$work/src" 2>/dev/null
        export CCACHE_DIR=${CCACHE_DIR:-$HOME/.cache/ccache} CCACHE_BASEDIR=$work CCACHE_NOHASHDIR=1
        ! command -v ccache >/dev/null || export CMAKE_CXX_COMPILER_LAUNCHER=ccache
        (cd "$work/src" &&
            DEB_BUILD_OPTIONS=noautodbgsym dpkg-buildpackage -b -us -uc -nc "-j$(nproc)") >"$work/build.log" 2>&1 ||
            { tail -n 30 "$work/build.log"; die "the package was not built"; }
    fi
    if command -v lintian >/dev/null; then
        lintian --allow-root --fail-on error,warning,info "$work"/wccpd_*.changes || die "lintian found faults"
    fi
    group=$groups/wccp-package-$$
    mkdir "$group" && echo $$ >"$group/cgroup.procs" || die "cannot create a control group"
    # shellcheck disable=SC2064
    trap "echo $$ >'$groups/cgroup.procs'; find '$group' -depth -type d -exec rmdir {} + 2>/dev/null" EXIT
    setpriv --pdeathsig KILL unshare --mount --net --pid --fork --kill-child --cgroup --propagation private --mount-proc \
        "$0" "$bin" --inside
    status=$?
    for ((i = 0; i < 50; i++)); do
        [ "$(cat "$group/cgroup.procs" | wc -l)" -gt 2 ] || break # until the killed processes have exited
        sleep 0.1
    done
    exit $status
fi

# --- Inside: a router on eth1, and the system, whose first process is `init`

here=/mnt
mount -t tmpfs tmpfs $here && mkdir $here/upper $here/work $here/root || die "cannot mount a file system"
mount -t overlay overlay $here/root -o lowerdir=/,upperdir=$here/upper,workdir=$here/work || skip "no overlay over this root"
find $here/root/etc/systemd/system -mindepth 1 -delete 2>/dev/null
rm -rf $here/root/usr/sbin/policy-rc.d $here/root/{etc/wccpd,etc/opt/rvl,etc/rc?.d,var/opt/rvl,var/log/journal}
for unit in systemd-sysctl systemd-udevd systemd-modules-load systemd-logind systemd-networkd; do
    ln -s /dev/null "$here/root/etc/systemd/system/$unit.service"
done
: >$here/root/etc/machine-id

cat >$here/boot <<'BOOT'
mount -t proc proc $1/proc && mount -t sysfs -o ro sysfs $1/sys && mount -t cgroup2 cgroup2 $1/sys/fs/cgroup || exit
mount -t tmpfs -o mode=755 tmpfs $1/run && mount -t tmpfs -o mode=1777 tmpfs $1/tmp || exit
mount -t tmpfs -o mode=755 tmpfs $1/mnt && mkdir $1/mnt/dev $1/mnt/dev/net || exit
for node in null zero full random urandom tty net/tun; do
    [ ! -e /dev/$node ] || { : >$1/mnt/dev/$node && mount --bind /dev/$node $1/mnt/dev/$node; }
done
ln -s /proc/self/fd $1/mnt/dev/fd; ln -s pts/ptmx $1/mnt/dev/ptmx; mkdir $1/mnt/dev/pts $1/mnt/dev/shm
mount -t devpts -o newinstance,ptmxmode=666 devpts $1/mnt/dev/pts
mount --move $1/mnt/dev $1/dev 2>/dev/null || mount --rbind $1/mnt/dev $1/dev
ip link set lo up
cd $1 && exec env -i container=lab PATH=/usr/sbin:/usr/bin:/sbin:/bin chroot $1 /lib/systemd/systemd --unit=multi-user.target --log-target=journal
BOOT
boot() {
    unshare --mount --net --pid --ipc --uts --cgroup --fork --kill-child --propagation private \
        bash $here/boot $here/root </dev/null >$here/boot.log 2>&1 &
    local outer=$!
    until_true 10 eval 'init=$(pgrep -P '$outer') && [ "$(cat /proc/$init/comm)" = systemd ]' || { cat $here/boot.log; die "systemd did not start"; }
    ip link add eth0 netns "$init" type veth peer name eth1
    ip address add 10.0.0.1/24 dev eth1 && ip link set eth1 up
    inside ip address add 10.0.0.101/24 dev eth0 && inside ip link set eth0 up
    until_true 20 eval 'inside systemctl is-system-running 2>/dev/null | grep -qE "running|degraded"' || die "the system did not come up"
}
inside() { nsenter -t "$init" --mount --net --pid --ipc --uts --cgroup --root --wdns=/ env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin LC_ALL=C "$@"; }
until_true() { # SECONDS COMMAND...
    local end=$((SECONDS + $1)); shift
    until "$@" >/dev/null 2>&1; do [ $SECONDS -lt $end ] || return 1; sleep 0.1; done
}
is_up() { # UNIT... : running and ready
    local unit
    for unit; do [ "$(inside systemctl show -P SubState "$unit")" = running ] || return; done
}
main_pid() { inside systemctl show -P MainPID "$1"; }
wait_restarted() { # SECONDS UNIT OLD_PID
    until_true "$1" eval "is_up $2 && [ \$(main_pid $2) != $3 ]" || die "$2 was not restarted"
}
ctl() { inside mgmtctl "$@"; }
wait_active() { until_true "$1" eval 'sleep 0.4; ctl get /qv/alarms/state/role/51 | grep -q ACTIVE' || die "the group did not become active"; }
install_package() { inside dpkg --install "$1" >$here/dpkg.log 2>&1 || { cat $here/dpkg.log; die "dpkg"; }; }
services=(mgmtd tunneld wccpd)

ip link set lo up
# The protocol of wccpd and the router runs eight times as fast as real time.
fast=("LD_PRELOAD=$bin/../lib/libfast_clock.so" FAST_CLOCK=8)
mkdir -p $here/root/etc/systemd/system/wccpd.service.d && cp "$bin/../lib/libfast_clock.so" $here/root/usr/lib/
printf '[Service]\nEnvironment=LD_PRELOAD=/usr/lib/libfast_clock.so FAST_CLOCK=8\n' >$here/root/etc/systemd/system/wccpd.service.d/fast.conf
boot
env "${fast[@]}" "$bin/wccp_router" --control $here/r1.ctl --router 10.0.0.1 >$here/r1.log 2>&1 &
mkdir $here/root/root/deb && cp "$work"/wccpd_*.deb $here/root/root/deb/old.deb
install_package /root/deb/old.deb
is_up "${services[@]}" || die "the services are not up after the installation"

# As in README.md.
ctl group add 51 interface eth0 router 10.0.0.1 || die "no group"
ctl intercept add 51 port 80 to 3129 leave 0 || die "no intercept"
wait_active 30
ctl show | grep -q '^51 *ACTIVE' || die "$(ctl show)"

# Not started by the package; its commands have the rights of nobody.
[ "$(inside systemctl is-enabled wccp-notify)" = disabled ] && ! is_up wccp-notify || die "notifications are enabled"
notified=$here/root/var/lib/wccp-notify/notified
printf '#!/bin/sh\necho "$(id -un) $WCCP_KIND $WCCP_GROUP $WCCP_STATE $WCCP_ALARM" >>/var/lib/wccp-notify/notified\n' >$here/root/etc/wccpd/notify.d/record
chmod 755 $here/root/etc/wccpd/notify.d/record
inside systemctl enable --now wccp-notify >/dev/null 2>&1 && until_true 10 grep -qx 'wccp-notify role 51 ACTIVE ' "$notified" ||
    die "no notification: $(cat "$notified"; inside journalctl -qu wccp-notify)"

for unit in "${services[@]}" wccp-notify wccp-metrics@0.service; do
    inside systemd-analyze security --no-pager "$unit" >$here/security 2>&1
    level=$(sed -n 's/.*exposure level for .*: \([0-9.]*\) .*/\1/p' $here/security)
    echo "$unit: exposure $level"
    [ -n "$level" ] && awk "BEGIN { exit !($level < 3.0) }" || { cat $here/security; die "$unit has too many privileges"; }
done

# Metrics over HTTP, once the administrator enables them.
[ "$(inside systemctl is-enabled wccp-metrics.socket)" = disabled ] || die "metrics are served by default"
inside systemctl enable -q --now wccp-metrics.socket || die "no socket for metrics"
for at in http://127.0.0.1:9815/metrics '--unix-socket /run/wccp-metrics.sock http://localhost/metrics'; do
    # shellcheck disable=SC2086
    inside curl -s $at >$here/metrics
    grep -q '^wccp_group_active{group="51"} 1' $here/metrics || die "no metrics at $at: $(cat $here/metrics)"
done

# A tunneld that is killed is replaced without wccpd noticing; one that exits makes wccpd restart. Programs that hang are
# restarted by the watchdog.
before=$(main_pid wccpd) old=$(main_pid tunneld)
inside systemctl kill -s KILL tunneld
wait_restarted 10 tunneld "$old"
until_true 10 eval 'inside journalctl -qu mgmtd | grep "process tunneld: its session is lost, replaced after"' || die "mgmtd did not notice"
sleep 3.5
[ "$(main_pid wccpd)" = "$before" ] || die "wccpd was restarted"
inside systemctl restart tunneld
wait_restarted 10 wccpd "$before"
for unit in wccpd mgmtd; do
    old=$(main_pid $unit)
    inside systemctl kill -s KILL $unit
    wait_restarted 20 $unit "$old"
done
until_true 20 is_up wccpd || die "wccpd is not up with the new mgmtd"
for time in 1 2 3; do
    old=$(main_pid wccpd)
    inside systemctl kill -s KILL wccpd
    wait_restarted 20 wccpd "$old"
    until_true 20 eval 'ctl get /qv/alarms/state/process/wccpd | grep -q running'
done
ctl alarms | grep -q 'restart-loop.*wccpd ends again and again: restarted [3-9] times' || die "no alarm: $(ctl alarms)"
until_true 10 grep -qx 'wccp-notify alarm  raised restart-loop' "$notified" || die "not notified: $(cat "$notified")"
for unit in "${services[@]}"; do
    mkdir -p $here/root/etc/systemd/system/$unit.service.d
    printf '[Service]\nWatchdogSec=3\n' >$here/root/etc/systemd/system/$unit.service.d/quick.conf
done
inside systemctl daemon-reload
inside systemctl restart mgmtd tunneld wccpd
sleep 5
is_up "${services[@]}" && [ "$(inside systemctl show -P NRestarts "${services[@]}" | xargs)" = '0 0 0' ] || die "the watchdog restarted a healthy program"
for unit in tunneld wccpd mgmtd; do
    old=$(main_pid $unit)
    inside systemctl kill -s STOP $unit
    wait_restarted 20 $unit "$old"
done
rm $here/root/etc/systemd/system/*.service.d/quick.conf
inside systemctl daemon-reload

# An upgrade, and a reboot.
echo '# edited' >>$here/root/etc/opt/rvl/platform.conf
cp $here/root/etc/wccpd/mgmtd.conf $here/conf
mkdir $here/new && dpkg-deb -R "$work"/wccpd_*.deb $here/new && sed -i 's/^Version: .*/&+1/' $here/new/DEBIAN/control &&
    dpkg-deb --root-owner-group -b $here/new $here/root/root/deb/new.deb >/dev/null || die "cannot build a newer package"
until_true 20 is_up "${services[@]}"
old=$(main_pid wccpd) old_notify=$(main_pid wccp-notify)
install_package /root/deb/new.deb
wait_restarted 20 wccpd "$old"
wait_restarted 20 wccp-notify "$old_notify"
is_kept() {
    cmp -s $here/conf $here/root/etc/wccpd/mgmtd.conf && grep -q '# edited' $here/root/etc/opt/rvl/platform.conf &&
        [ "$(stat -c %a $here/root/etc/wccpd/mgmtd.conf)" = 600 ] && is_up "${services[@]}"
}
is_kept || die "the upgrade changed the configuration, or the services are down"
inside systemctl poweroff --force >/dev/null 2>&1
until_true 30 eval '! kill -0 $init' || die "the system did not power off"
ip link del eth1 2>/dev/null
boot
until_true 20 is_kept || die "the reboot changed the configuration, or the services are down"
wait_active 30

inside systemctl stop wccp.target
until_true 20 eval '[ "$(inside systemctl is-active "${services[@]}" | sort -u)" = inactive ]' || die "the services did not stop with the target"
inside systemctl start wccp.target && until_true 20 is_up "${services[@]}" || die "the services did not start with the target"

inside dpkg --purge wccpd >$here/dpkg.log 2>&1 || { cat $here/dpkg.log; die "dpkg"; }
! inside ps -A -o comm= | grep -qxE 'wccpd|tunneld|mgmtd|mgmtctl' || die "programs are left running"
left=$(cd $here/root && ls -d etc/wccpd var/lib/wccp-notify etc/opt/rvl var/opt/rvl run/tunneld run/wccpd.pid run/mgmtd.lock usr/sbin/wccpd \
    etc/systemd/system/*.wants/{wccp,mgmtd,tunneld}* tmp/gcl-socks/* 2>/dev/null
    inside sh -c 'cd /; ls -d /run/tunneld /run/wccpd.pid /run/mgmtd.lock /tmp/gcl-socks/* 2>/dev/null; ip -o link show group 2048')
[ -z "$left" ] || die "left after the purge: $left"
