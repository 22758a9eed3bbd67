#!/bin/sh
# fill.sh MGMTCTL VERSION PAGE OUTPUT: a manual page, with what fill.awk fills in.
set -e
docs=$(dirname "$0")/..
trap 'rm -f "$4.help"' EXIT
"$1" --help >"$4.help"
awk -v VERSION="$2" -v NODES="$docs/mgmtd.md" -v HELP="$4.help" -f "$docs/man/fill.awk" "$3" >"$4"
