#!/bin/bash
# vm.sh [CASE...] | vm.sh -- COMMAND...: boots Debian's own kernel in a virtual machine, with the project in /wccpd,
# and runs there the cases that need features which this machine's kernel may lack (lab/vm/cases.sh), or a command.
#
# Needs no privileges and mounts nothing: packages come from where the host's apt gets its own and are unpacked below
# build/vm, mke2fs writes the file systems, debugfs reads back what the machine has written. The machine has no network
# device, and it ends with this script, whatever ends that. Below build/vm:
#   debs, root-*    packages, and the file system and kernel made of them: kept for the next run
#   run             of the last run: the project's disk, the console, and in results/ the files of the cases
#
#   WCCP_BIN    where the programs are (default: build/release/bin)
#   VM_LIMIT    seconds after which the machine is ended (default 330)
#   LAB_PLANE   of tunneld (default kernel); LAB_SIDE_BY_SIDE: cases at a time (default 2); LAB_PATIENCE: see topology.sh
#   VM_ACCEL    kvm or tcg (default: kvm where that boots, which is tried once; otherwise tcg)
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
: "${WCCP_BIN:=$top/build/release/bin}" "${VM_LIMIT:=330}" "${VM_ACCEL:=}"
vm=$top/build/vm
run=$vm/run
export LC_ALL=C TMPDIR=$run PATH=$PATH:/usr/sbin:/sbin

programs=(wccpd mgmtd mgmtctl tunneld wccp_router)
packages=(base-files dash bash coreutils sed grep mawk findutils diffutils util-linux mount procps iproute2 nftables jq
    haproxy curl kmod busybox-static libgcc-s1 libevent-core-2.1-7 libnuma1 libmd0 libnl-route-3-200 libnftables1
    libbpf1)
kernel=linux-image-cloud-amd64 # has NVMe and ext4 built in: it needs no initial file system
modules=(kernel/{net,lib,crypto,arch/x86/crypto} kernel/drivers/net/{veth,tun,dummy,ifb}.ko)

die() { echo "vm: $*" >&2; exit 1; }

# ---- the root, made once for a set of packages

# As if nothing were installed, so that all dependencies are resolved.
apt_apart() {
    apt-get -q -y --no-install-recommends -o Dir::State::status="$vm/status" -o Dir::Cache::archives="$vm/debs" \
        -o Dir::Cache::pkgcache= -o Dir::Cache::srcpkgcache= -o Debug::NoLocking=1 -o APT::Sandbox::User=root "$@"
}
# Sets `image` (the package of the kernel) and `debs` (the files that the root is made of).
resolve_packages() {
    image=$(apt-cache depends "$kernel" | awk '$1 == "Depends:" && /linux-image-[0-9]/ { print $2 }')
    [ -n "$image" ] || return 1
    mkdir -p "$vm/debs/partial" && : >"$vm/status" || return 1
    debs=$(apt_apart -s install "${packages[@]}" |
        sed -n 's/^Inst \([^ ]*\) (\([^ ]*\) .*\[\(.*\)\]).*/\1_\2_\3.deb/p' | sed 's/:/%3a/' | sort) && [ -n "$debs" ]
    debs+=$'\n'$(apt-cache show --no-all-versions "$image" | awk '/^(Package|Version|Architecture):/ { word[$1] = $2 }
        END { print word["Package:"] "_" word["Version:"] "_" word["Architecture:"] ".deb" }')
}
fetch_packages() {
    apt_apart --download-only install "${packages[@]}" &&
        (cd "$vm/debs" && apt-get -q download -o APT::Sandbox::User=root "$image")
}
make_root() { # DIRECTORY : a file system in `root.img`, and `vmlinuz`
    local root=$1/root deb version loader
    rm -rf "$vm"/root-*
    mkdir -p "$root"/usr/{bin,sbin,lib,lib64} "$root/wccpd" "$1/kernel" || return
    for deb in bin sbin lib lib64; do ln -s usr/$deb "$root/$deb"; done
    while read -r deb; do
        [ "${deb#linux-image}" = "$deb" ] || { dpkg-deb -x "$vm/debs/$deb" "$1/kernel" || return; continue; }
        dpkg-deb --fsys-tarfile "$vm/debs/$deb" | tar -C "$root" -x --no-same-owner --keep-directory-symlink \
            --exclude=./usr/share/{doc,man,locale,info} --exclude='./usr/*/perl*' || return
    done <<<"$debs"
    # The steps of the packages' own scripts that are needed here.
    mkdir -p "$root"/{media,mnt,opt,srv} "$root"/etc/opt "$root"/var/opt
    rm -rf "$root/var/run" && ln -s /run "$root/var/run"
    ln -s mawk "$root/usr/bin/awk"
    printf '%s\n' root:x:0:0:root:/root:/bin/bash nobody:x:65534:65534::/:/usr/sbin/nologin \
        haproxy:x:100:100::/var/lib/haproxy:/usr/sbin/nologin >"$root/etc/passwd"
    printf '%s\n' root:x:0: tty:x:5: haproxy:x:100: nogroup:x:65534: >"$root/etc/group"
    version=$(basename "$1"/kernel/lib/modules/*)
    mkdir -p "$root/usr/lib/modules/$version"
    (cd "$1/kernel/lib/modules/$version" && tar -c modules.order modules.builtin* "${modules[@]}") |
        tar -C "$root/usr/lib/modules/$version" -x --no-same-owner || return
    loader=$root/usr/lib/x86_64-linux-gnu/ld-linux-x86-64.so.2
    "$loader" --argv0 depmod --library-path "$root/usr/lib/x86_64-linux-gnu" "$root/usr/bin/kmod" -b "$root" "$version" || return
    install -m 755 "$top/lab/vm/boot" "$root/usr/sbin/init" || return
    mv "$1/kernel/boot/vmlinuz-$version" "$1/vmlinuz" && make_disk "$root" "$1/root.img" 400M && rm -rf "$root" "$1/kernel"
}
make_disk() { # DIRECTORY FILE SIZE
    rm -f "$2"
    mke2fs -q -F -t ext4 -O ^has_journal -m 0 -E root_owner=0:0 -d "$1" "$2" "$3" >"$2.log" 2>&1 || { cat "$2.log" >&2; return 1; }
}

prepare_root() { # sets `root`
    resolve_packages || { update_lists && resolve_packages; } || die "apt knows no packages"
    root=$vm/root-$( (echo "$debs"; cat "$0" "$top/lab/vm/boot") | sha256sum | cut -c 1-12)
    [ -e "$root/made" ] && return
    { fetch_packages || { update_lists && fetch_packages; }; } >"$vm/apt.log" 2>&1 || { tail "$vm/apt.log" >&2; die "no packages"; }
    make_root "$root" || die "no root"
    : >"$root/made"
    local deb
    for deb in "$vm"/debs/*.deb; do grep -qxF "$(basename "$deb")" <<<"$debs" || rm -f "$deb"; done
}
update_lists() {
    local sudo=; [ "$(id -u)" = 0 ] || sudo=sudo
    $sudo apt-get -q update >"$vm/apt.log" 2>&1
}

# The project, as in a checkout with a build, and the command for the machine.
prepare_project() { # ARGUMENTS...
    local tree=$run/project name
    rm -rf "$run"
    mkdir -p "$tree"/build/release/{bin,lib} "$tree"/{tests,results,state} || die "no $run"
    cp -r "$top"/{lab,packaging,scripts} "$tree/" && cp "$top"/tests/scenario_*.sh "$tree/tests/" || die "no project"
    for name in "${programs[@]}"; do cp "$WCCP_BIN/$name" "$tree/build/release/bin/" || die "no $name"; done
    cp "$WCCP_BIN"/../lib/lib{qvcommondyn,fast_clock}.so "$tree/build/release/lib/" || die "no libraries"
    if [ "${1-}" = -- ]; then printf '%q ' "${@:2}" >"$tree/command"; else
        printf '%q ' env "LAB_PLANE=${LAB_PLANE-}" "LAB_SIDE_BY_SIDE=${LAB_SIDE_BY_SIDE-}" \
            "LAB_PATIENCE=${LAB_PATIENCE-}" lab/vm/cases.sh "$@" >"$tree/command"
    fi
    make_disk "$tree" "$run/project.img" 256M || die "no disk for the project"
    rm -rf "$tree"
}

# ---- the machine

start_machine() { # kvm|tcg : sets `machine`
    local accel=tcg,thread=multi cpu=max
    [ "$1" = tcg ] || accel=kvm cpu=host
    setpriv --pdeathsig KILL bash -c '[ $PPID = "$0" ] && exec "$@"' $$ qemu-system-x86_64 -M q35,hpet=off -accel $accel \
        -cpu $cpu -smp 2 -m 1536 -nodefaults -no-user-config -nic none -display none -monitor none \
        -no-reboot -chardev "file,id=console,path=$run/console,append=on" -serial chardev:console -kernel "$root/vmlinuz" \
        -append "console=ttyS0 quiet root=/dev/nvme0n1 rw rootwait panic=1 mitigations=off nokaslr tsc=reliable" \
        -device nvme,id=disks,serial=vm \
        -drive "file=$root/root.img,format=raw,if=none,id=root,snapshot=on" -device nvme-ns,drive=root,bus=disks,nsid=1 \
        -drive "file=$run/project.img,format=raw,if=none,id=project,cache=unsafe" -device nvme-ns,drive=project,bus=disks,nsid=2 \
        </dev/null >"$run/qemu.log" 2>&1 {lock}>&- &
    machine=$!
}
stop_machine() {
    [ -n "${machine-}" ] && { kill -KILL "$machine"; wait "$machine"; } 2>/dev/null
    machine=
}
running() { kill -0 "$machine" 2>/dev/null; }
is_up() { grep -q '^vm: up' "$run/console"; }

boot() {
    local i
    [ -n "$VM_ACCEL" ] || read -r VM_ACCEL <"$vm/accel" || VM_ACCEL=
    if [ -z "$VM_ACCEL" ]; then
        VM_ACCEL=tcg
        if [ -w /dev/kvm ]; then
            : >"$run/console"
            start_machine kvm
            for ((i = 0; i < 60; i++)); do
                is_up && { VM_ACCEL=kvm; break; }
                running || break
                sleep 0.1
            done
        fi
        echo $VM_ACCEL >"$vm/accel"
        [ $VM_ACCEL = tcg ] || return 0
        stop_machine
    fi
    : >"$run/console"
    start_machine "$VM_ACCEL"
} 2>/dev/null
# A machine that reboots exits and is started again: the reset of an emulated one does not always succeed.
restart() {
    [ -z "$restarted" ] && grep -q 'reboot: Restarting system' "$run/console" || return
    restarted=yes
    wait "$machine" 2>/dev/null
    start_machine "$VM_ACCEL"
}
# Shows the output of the cases as it is written.
watch() {
    local seen=0 now began=$SECONDS ended= restarted=
    until [ -n "$ended" ]; do
        running || restart || ended=yes
        [ $((SECONDS - began)) -lt "$VM_LIMIT" ] || { echo "vm: after $VM_LIMIT s not yet done" >&2; stop_machine; ended=yes; }
        now=$(wc -l <"$run/console")
        [ "$now" = "$seen" ] || tail -n "+$((seen + 1))" "$run/console" | head -n $((now - seen)) | tr -d '\r' | sed '/^\[ *[0-9.]*\] reboot: /d'
        seen=$now
        [ -n "$ended" ] || sleep 0.3
    done
}

mkdir -p "$vm"
exec {lock}>"$vm/lock"
flock -n "$lock" || die "another one is at work in $vm"
trap stop_machine EXIT
trap 'exit 130' INT
trap 'exit 143' TERM HUP
began=${EPOCHREALTIME/./}
prepare_root
prepare_project "$@"
printf 'vm: prepared in %d ms\n' $(((${EPOCHREALTIME/./} - began) / 1000))
boot
watch
debugfs -R "rdump /results $run" "$run/project.img" >/dev/null 2>&1
read -r status 2>/dev/null <"$run/results/status" || { cat "$run/qemu.log" >&2; die "the machine has ended without a result"; }
printf 'vm: %s, all in %d s\n' "$VM_ACCEL" $(((${EPOCHREALTIME/./} - began) / 1000000))
exit "$status"
