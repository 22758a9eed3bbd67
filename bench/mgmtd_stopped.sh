#!/bin/bash
# mgmtd_stopped.sh [BIN [SECONDS]]: measures how long the engine's lock is held while 200 groups send alarms and role
# changes, first with mgmtd running, then with mgmtd stopped and its socket full.
set -u
exec "$(dirname "$0")/../tests/scenario_alarm_stop.sh" "${1:-$(dirname "$0")/../build/release/bin}" "${2:-60}"
