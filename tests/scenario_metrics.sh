#!/bin/bash
# The metrics of a running appliance as their readers take them: promtool accepts them, the alert rules pass their tests, a
# Prometheus scrapes them over HTTP, every query of the dashboard returns data and every alert rule can be evaluated.
#   scenario_metrics.sh DIRECTORY_OF_THE_PROGRAMS
# promtool and prometheus are those in PATH or in build/tools (scripts/install-deps.sh metrics); skipped without them.
set -u
top=$(cd "$(dirname "$0")/.." && pwd)
export WCCP_BIN=${1:-$top/build/release/bin} PATH=$PATH:$top/build/tools LAB_SPEED=${LAB_SPEED:-8} LAB_PLANE=${LAB_PLANE-user}
for tool in promtool prometheus systemd-socket-activate; do
    command -v $tool >/dev/null || { echo "skipped: no $tool"; exit 77; }
done
# shellcheck source=../lab/topology.sh
source "$top/lab/topology.sh"
lab_enter "$0" "$@"
fail() { echo "$*" >&2; tail -n 12 "$LAB"/*.out >&2; exit 1; }
rules=$top/packaging/prometheus/wccp.rules.yml

promtool check rules "$rules" >"$LAB/said" 2>&1 && promtool test rules "$top/tests/prometheus_rules.yml" >"$LAB/said" 2>&1 ||
    fail "$(cat "$LAB/said")"

lab_router r1 10.0.0.1
lab_appliance a1 10.0.0.101
lab_appliance_start a1 "$(lab_group 51 10.0.0.1)" "$(lab_group 52 10.0.0.1 interface=none0)" "$(lab_intercept 51 ports=80 leave_after=0)"
lab_wait_role 30 a1 51 ACTIVE || fail "not active"
lab_in a1 "$WCCP_BIN/mgmtctl" metrics --text >"$LAB/text" && promtool check metrics <"$LAB/text" >"$LAB/said" 2>&1 ||
    fail "$(cat "$LAB/said")"

lab_start a1 http "$(command -v systemd-socket-activate)" --accept --inetd -l 127.0.0.1:9815 "$WCCP_BIN/mgmtctl" metrics --http
cat >"$LAB/prometheus.yml" <<CONFIG
global: {scrape_interval: 1s, evaluation_interval: 1s}
rule_files: [$rules]
scrape_configs: [{job_name: wccp, static_configs: [{targets: ['127.0.0.1:9815']}]}]
CONFIG
lab_start a1 prometheus "$(command -v prometheus)" --config.file="$LAB/prometheus.yml" --storage.tsdb.path="$LAB/tsdb" \
    --web.listen-address=127.0.0.1:9090
api() { lab_in a1 curl -s "http://127.0.0.1:9090/api/v1/$1" "${@:2}"; }
lab_wait 20 '.data.result | length == 1 and (.[0].value[1] | tonumber >= 3)' \
    api query --data-urlencode 'query=count_over_time(up[1m])' || fail "no scrapes"
api targets | jq -e '.data.activeTargets[0].health == "up"' >/dev/null || fail "$(api targets)"
while IFS=$'\t' read -r panel query; do
    api query --data-urlencode "query=$query" | jq -e '.data.result | length > 0' >/dev/null || fail "panel \"$panel\" is empty: $query"
done < <(jq -r '.panels[] | .title as $t | .targets[] | [$t, (.expr | gsub("\\$instance"; ".*") | gsub("5m"; "10s"))] | @tsv' \
    "$top/packaging/prometheus/wccp.dashboard.json")
api rules | jq -e '.data.groups[].rules | length > 10 and all(.[]; .health == "ok")' >/dev/null || fail "$(api rules)"
lab_wait 5 '[.data.alerts[].labels | select(.group == "52") | .alertname] | index("WccpGroupNotActive")' api alerts || fail "no alert"
lab_stop a1 prometheus || fail "prometheus ended with $?"
lab_stop a1 http
lab_end a1 || fail "the end"
