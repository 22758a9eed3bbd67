#!/bin/bash
# The page of "mgmtctl show --html": two appliances with redirected flows, and two routers, one of which does not have the
# wanted table. Checks the file and the exit codes, then opens the page in a headless browser, where it must render without
# errors and load nothing: light and dark, narrow and wide. The part with the browser is skipped without chromium.
#   scenario_page.sh DIRECTORY_OF_THE_PROGRAMS
#   LAB_PAGE   a directory to which the page is copied, with screenshots
set -u
export WCCP_BIN=${1:-$(dirname "$0")/../build/release/bin} LAB_SPEED=${LAB_SPEED:-8} LAB_PLANE=${LAB_PLANE-}
# shellcheck source=../lab/cases.sh
source "$(dirname "${BASH_SOURCE[0]}")/../lab/cases.sh"
lab_enter "$0" "$@"

show() { # OPTIONS... : by a1, under the name of a host
    lab_in a1 unshare --uts bash -c 'echo cache1 >/proc/sys/kernel/hostname; exec "$@"' - "$WCCP_BIN/mgmtctl" show "$@"
}
page() { # STATUS TEXT... : the page has each text
    local status=$1 got; shift
    show --html - >"$LAB/page.html" 2>"$LAB/complained"; got=$?
    [ $got = "$status" ] || die "status $got, not $status"
    for text; do grep -qF "$text" "$LAB/page.html" || die "the page lacks: $text"; done
}

lab_router r1 10.0.0.1 -- --redirect c1=51 --forward gre --return gre
lab_router r2 10.0.0.2 -- --forward gre --return gre
lab_client c1 r1
lab_server s1 r1
start_proxied a1 10.0.0.101 '' "$(lab_group 51 10.0.0.1 10.0.0.2 weight=100)" "$(lab_intercept 51 'ports=80 8000-8010')"
start_proxied a2 10.0.0.102 '' "$(lab_group 51 10.0.0.1 10.0.0.2 weight=200)" "$(lab_intercept 51 'ports=80 8000-8010')"
wait_ready 51 a1 a2
lab_fetch c1 --count 112 --sources 112 >/dev/null
lab_fetch c1 --count 8 --sources 8 --port 8080 >/dev/null
nsenter -t "${LAB_INIT[c1]}" --net "$WCCP_BIN/wccp_router" fetch --from 10.1.0.128 --sources 112 10.2.0.2 --long 40 --life 600 >"$LAB/flows" &
LAB_PID[c1/client]=$!
tunneld_is a1 20 intercept '.["51"].flows > 5'
lab_wait 40 '[.reasons[] | select(.attention)] == []' eval 'show --json' || die "something needs attention: $(show)"
page 0 '<h1>Nothing needs attention</h1>' cache1 'as wanted'

# --- One router has another table

lab_ctl r2 assign 51 40 55 10.0.0.102 >/dev/null
lab_ctl r2 assign 51 200 203 none >/dev/null
lab_wait 40 '[.reasons[] | select(.attention)] | length > 0' eval 'show --json' || die "no reason: $(show)"
lab_wait_event 60 a1 '^alarm raised: .*51' || die "no alarm"
page 0 '<h1>Group 51 needs attention</h1>' '20 buckets not as wanted' '<code>assignment-differs</code>' \
    'title="bucket 40: B 10.0.0.102, wanted: A 10.0.0.101"'

# --- The file

expect() { # STATUS ERROR OPTIONS...
    local status=$1 wanted=$2 got; shift 2
    show "$@" >"$LAB/said" 2>"$LAB/complained"; got=$?
    [[ $got = "$status" && $(<"$LAB/complained") == *"$wanted"* ]] || die "show $*: $got: $(cat "$LAB/complained")"
}
expect 0 '' --html /tmp/page.html
[ ! -s "$LAB/said" ] && lab_in a1 grep -q '</html>' /tmp/page.html || die "no file"
expect 2 'excludes' --html /tmp/page.html --watch
expect 7 '/tmp/none/page.html: No such file or directory' --html /tmp/none/page.html
expect 7 '/dev/null: is not a regular file' --html /dev/null

# --- In a browser

browse() { # OPTIONS...
    (cd "$LAB" && exec timeout 60 chromium --headless --no-sandbox --disable-gpu --disable-quic --no-first-run \
        --disable-background-networking --disable-component-update --disable-sync --allow-file-access-from-files \
        --user-data-dir="$(mktemp -d -p "$LAB")" --enable-logging=stderr "$@") 2>"$LAB/browser"
}
looks() { # COLOURS BACKGROUND : 0 is dark, 1 light
    browse --blink-settings=preferredColorScheme="$1" --dump-dom "file://$LAB/page_check.html" |
        sed -n 's/.*<pre id="found">\(.*\)<\/pre>.*/\1/p' | sed 's/&lt;/</g; s/&gt;/>/g; s/&amp;/\&/g' >"$LAB/found"
    ! grep CONSOLE "$LAB/browser" >&2 || die "errors in the console"
    jq -e --arg background "$2" 'length == 2 and .[0].width <= 360 and .[1].width > 1200 and all(.[];
        .overflow == 0 and .background == $background and .faint == [] and .texts > 100 and .loaded == [] and
        .headline == "Group 51 needs attention" and (.title | startswith("cache1")) and
        [.strips[] | [.cells, .other, .titled]] == [[256, 0, true], [256, 20, true], [256, 0, true]])' \
        <"$LAB/found" >/dev/null || die "$(cat "$LAB/found" "$LAB/browser")"
}
skipped=0
if command -v chromium >/dev/null; then
    cp "$LAB_TOP/tests/page_check.html" "$LAB"
    if [ -n "${LAB_PAGE-}" ]; then
        while read -r name colours size; do
            browse --hide-scrollbars --force-device-scale-factor=1.5 --blink-settings=preferredColorScheme="$colours" \
                --window-size="$size" --screenshot="$LAB/$name.png" "file://$LAB/page.html"
        done <<<$'readme 1 1000,1330\nlight 1 1120,2300\ndark 0 1120,2300\nnarrow 1 390,2600'
        browse --no-pdf-header-footer --print-to-pdf="$LAB/print.pdf" "file://$LAB/page.html"
        cp "$LAB/page.html" "$LAB"/*.png "$LAB/print.pdf" "$LAB_PAGE"
    fi
    looks 1 'rgb(244, 246, 248)'
    looks 0 'rgb(18, 22, 27)'
else
    echo 'skipped: chromium is not installed, the page is not opened in a browser'
    skipped=77
fi

# --- Programs that do not answer

kill -STOP "$(lab_pid a1 tunneld)"
page 0 'tunneld does not answer' '<code>tunneld-silent</code>'
lab_continue a1 tunneld
kill -STOP "$(lab_pid a1 wccpd)"
page 3 '<h1>wccpd does not answer</h1>' 'state unknown'
lab_continue a1 wccpd
lab_stop a1 mgmtd KILL 2>/dev/null
page 3 '<h1>mgmtd does not answer</h1>'
grep -q 'mgmtd is not running' "$LAB/complained" || die 'no error'
exit $skipped
