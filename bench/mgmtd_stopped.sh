#!/bin/bash
# mgmtd_stopped.sh [BIN [SECONDS]]: how long the engine's lock is held while alarms and changes of role of 200 groups go
# out, with mgmtd running and with mgmtd stopped and its socket full, and the ratio of the two.
set -u
exec "$(dirname "$0")/../tests/scenario_alarm_stop.sh" "${1:-$(dirname "$0")/../build/release/bin}" "${2:-60}"
