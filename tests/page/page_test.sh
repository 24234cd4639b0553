#!/bin/bash
# The update page's test, run by scripts/test.sh after ctest: in a sandbox, the demo's
# sample site and appliance (scripts/demo/appliance.sh --page) with the packages served
# slowly enough to watch and cancel; curl checks the back end alone, then page_browser.py
# drives the page in headless Chromium.  Screenshots in BUILD_DIR/page-test/.
#   page_test.sh BUILD_DIR          (as root)
set -euo pipefail
BUILD=$1
HERE=$(cd "$(dirname "$0")" && pwd)
OUT=$BUILD/page-test
if [ "${KYTO_IN_SANDBOX:-}" != 1 ]; then
    rm -rf "$OUT"
    mkdir -p "$OUT"
    KYTO_IN_SANDBOX=1 KYTO_DEMO_PKG_RATE=${KYTO_DEMO_PKG_RATE:-150k} KYTO_DEMO_IMG_RATE=2m \
        "$BUILD/tests/kyto-sandbox" "$HERE/../../scripts/demo/appliance.sh" "$BUILD" --page \
        "$HERE/page_test.sh" "$BUILD" >"$OUT/appliance.log" 2>&1 || rc=$?
    # The sandbox's files vanish with it: the screenshots come out as a base64 tar.
    sed -n '/^SHOTS BEGIN$/,/^SHOTS END$/{/^SHOTS/d;p}' "$OUT/appliance.log" | base64 -d |
        tar -x -C "$OUT" 2>/dev/null || true
    sed -i '/^SHOTS BEGIN$/,/^SHOTS END$/d' "$OUT/appliance.log"
    sed -n '/== the update page/,$p' "$OUT/appliance.log"
    ls "$OUT"
    if [ "${rc:-0}" -ne 0 ]; then echo "page_test.sh: FAILED"; exit 1; fi
    echo "page_test.sh: PASSED"
    exit 0
fi

# Inside the sandbox, after page.sh: the back end alone.
B=http://127.0.0.1:8090
fails=0
expect() { # $1 code, $2 what, curl arguments...
    local want=$1 what=$2 got
    shift 2
    got=$(curl -s -o /dev/null -w '%{http_code}' "$@")
    if [ "$got" = "$want" ]; then echo "ok   $want $what"; else echo "FAIL $what: $got, not $want"; fails=1; fi
}
while read -r code what args; do
    # shellcheck disable=SC2086
    expect "$code" "$what" $args
done <<TABLE
405 status-posted -X POST -H Origin:$B $B/api/status
405 action-read $B/api/check
405 action-deleted -X DELETE -H Origin:$B $B/api/cancel
404 unknown-action -X POST -H Origin:$B $B/api/reboot
404 action-with-args -X POST -H Origin:$B $B/api/check/--help
403 other-origin -X POST -H Origin:http://127.0.0.1:8091 $B/api/check
403 no-origin -X POST $B/api/check
403 cross-site-fetch -X POST -H Origin:$B -H Sec-Fetch-Site:cross-site $B/api/check
421 rebound-name -X POST -H Host:evil.example:8090 -H Origin:http://evil.example:8090 $B/api/check
200 page $B/update.html
TABLE
status=$(curl -s $B/api/status)
if python3 -c 'import json,sys; d=json.loads(sys.argv[1]); s=d["status"]; assert s["installed"]=={"version":"5.2-5644","smallfix":0}, d; assert s["smallupdate"]["status"]=="none" and d["check"] is None and d["download"] is None, d' "$status"; then
    echo "ok   status JSON: $status"
else
    echo "FAIL status JSON: $status"
    fails=1
fi
[ $fails -eq 0 ]
SHOTS=/tmp/kyto-page-shots
mkdir -p $SHOTS
export HOME=/tmp
rc=0
# The browser test publishes a fix and a release half-way, signed with the demo's key.
python3 "$HERE/page_browser.py" $B $SHOTS "$HERE/page_publish.sh" "$BUILD" || rc=$?
if [ $rc -ne 0 ]; then
    echo "-- download.log"; cat /run/kyto-page/download.log
    echo "-- system log"; grep -h kytoupdate /var/log/sandbox.syslog | tail -n 15
fi
echo "SHOTS BEGIN"
tar -c -C $SHOTS . | base64
echo "SHOTS END"
exit $rc
