#!/bin/bash
# install-deps.sh WHAT...: installs the missing packages for `build`, `lab`, `capture`, `test`, `browser`, `package`, `vm`, on
# Debian 12, as root or with sudo. `metrics` unpacks promtool and prometheus into build/tools: the package would start a server.
set -eu
build="g++ cmake ninja-build pkg-config libevent-dev libnuma-dev libmd-dev libnl-route-3-dev libnftables-dev libbpf-dev clang-14 libcli11-dev nlohmann-json3-dev"
lab="iproute2 util-linux procps mount jq nftables haproxy curl"
package="debhelper dpkg-dev lintian systemd"
capture="tcpdump tshark"
test="libgtest-dev libbenchmark-dev lld libclang-rt-14-dev clang-format-14 clang-tidy-14 git $capture"
browser="chromium" # 110 MB to download
vm="qemu-system-x86 e2fsprogs"
wanted=
unpack_prometheus() {
    [ ! -x build/tools/promtool ] || return 0
    local work status=0
    work=$(mktemp -d) && mkdir -p build/tools
    { (cd "$work" && apt-get download -q prometheus) && dpkg-deb -x "$work"/prometheus_*.deb "$work/root" &&
        mv "$work"/root/usr/bin/prometheus "$work"/root/usr/bin/promtool build/tools/; } >"$work/log" 2>&1 ||
        { status=1; tail -n 3 "$work/log" >&2; }
    rm -rf "$work"
    return $status
}
for what in "$@"; do
    case $what in
    build | lab | capture | test | browser | package | vm) wanted="$wanted ${!what}" ;;
    metrics) cd "$(dirname "$0")/.." && unpack_prometheus || exit 1 ;;
    *) echo "install-deps.sh: unknown word $what" >&2; exit 2 ;;
    esac
done
missing=
for package in $wanted; do
    [ "$(dpkg-query -W -f '${db:Status-Status}' "$package" 2>/dev/null)" = installed ] || missing="$missing $package"
done
[ -n "$missing" ] || exit 0
sudo=; [ "$(id -u)" = 0 ] || sudo=sudo
echo "installing:$missing"
log=$(mktemp)
trap 'rm -f "$log"' EXIT
export DEBIAN_FRONTEND=noninteractive
# shellcheck disable=SC2086
if ! { $sudo apt-get update -q && $sudo env DEBIAN_FRONTEND=noninteractive apt-get install -yq --no-install-recommends $missing; } >"$log" 2>&1; then
    tail -n 20 "$log" >&2
    exit 1
fi
