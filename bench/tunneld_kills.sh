#!/bin/bash
# tunneld_kills.sh [BIN [KILLS]]: tunneld is killed that often (100) at random moments of transfers, under mgmtd --supervise.
# Each transfer completes or is reset, new fetches work within 3 s of each kill, wccpd keeps running, and nothing is
# left.
set -u
LAB_KILLS=${2:-100} exec "$(dirname "$0")/../tests/scenario_traffic.sh" "${1:-$(dirname "$0")/../build/release/bin}" kills
