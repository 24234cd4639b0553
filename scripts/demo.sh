#!/usr/bin/env bash
# The library's main job end to end on a sample appliance.  Run as root on a Debian machine:
#
#   bash scripts/demo.sh
#
# Installs the packages it needs, builds kytoupdate, kytosite and the sandbox launcher in
# build/, then, inside a disposable appliance root (build/tests/kyto-sandbox: overlay over
# "/", own loopback network): makes a sample update site with kytosite (two fixes of real
# packages), signs it with a demo key made on the spot, serves it with nginx on 127.0.0.1
# and checks it with kytosite check; trusts the key on the appliance and drives a small
# update (check, download, status, plan, apply) with kytoupdate, shows a package altered on
# the server refused, then publishes and downloads a full release (check, download).
# Everything the demo writes inside the appliance root vanishes with it; afterwards the
# host's appliance paths are checked.  KYTO_DEMO_IMAGE_MB sets the release image's size (default 96),
# KYTO_BUILD_DIR the build folder.
#
#   bash scripts/demo.sh --page
#
# sets up the same site and appliance, then serves the sample update page (www/) on the
# appliance's loopback, brought to the host's as http://127.0.0.1:8090/ (socat), until
# Ctrl-C.
set -euo pipefail
PAGE_ARGS=()
if [ "${1:-}" = --page ]; then PAGE_ARGS=(--page); fi
cd "$(dirname "$0")/.."
ROOT=$(pwd)
source scripts/deps.sh
kyto_require_root
BUILD=${KYTO_BUILD_DIR:-$ROOT/build}  # another build folder: KYTO_BUILD_DIR=/path

# Appliance paths that must never appear on the host because of the demo.
HOST_PATHS=(/autoupd@te.info /passive_upd@te.info /etc.defaults /smallupd@te /@smallupd@te_deb
    /.upgrade_vol /usr/kyto /volume1 /srv/kyto-demo /var/run/downloadVYX.status
    /var/run/applySmallUpd@te.status /var/run/downloadVYX.pid /var/log/kytoupdate.log
    /var/log/dpkg_upgrade.log /var/log/kyto-calls.log /etc/kytoupdate)
snapshot_host() {
    local d p
    for p in "${HOST_PATHS[@]}"; do
        if [ -e "$p" ] || [ -L "$p" ]; then echo "path $p"; fi
    done
    for d in / /etc /run /srv /var/log /var/lib/dpkg/info /usr; do
        find "$d" -mindepth 1 -maxdepth 1 -printf "$d/%f\n" 2>/dev/null || true
    done
    dpkg-query -W -f='${Package} ${Status}\n' 2>/dev/null | grep -c 'ok installed' | sed 's/^/packages /'
}

echo "== packages"
kyto_install_packages "${KYTO_BUILD_PACKAGES[@]}" "${KYTO_TEST_PACKAGES[@]}"
kyto_install_packages_without_services "${KYTO_DEMO_PACKAGES[@]}"
BEFORE=$(snapshot_host)

echo "== build kytoupdate, kytosite and the sandbox launcher in $BUILD"
cmake -S . -B "$BUILD" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DKYTO_BUILD_TESTS=ON -DKYTO_WERROR=ON \
    >/dev/null
if ! cmake --build "$BUILD" -j"$(nproc)" --target kytoupdate kytosite kyto-sandbox kytoupdate-cgi \
    >"$BUILD/demo-build.log" 2>&1; then
    tail -n 30 "$BUILD/demo-build.log"
    echo "demo.sh: FAILED (build; log: $BUILD/demo-build.log)"
    exit 1
fi

RC=0
if [ ${#PAGE_ARGS[@]} -eq 0 ]; then
    "$BUILD/tests/kyto-sandbox" "$ROOT/scripts/demo/appliance.sh" "$BUILD" || RC=$?
else
    # The appliance serves the page until Ctrl-C, which ends it, the forwarder and the demo
    # alike; an end by Ctrl-C is the page demo's normal end.
    "$BUILD/tests/kyto-sandbox" "$ROOT/scripts/demo/appliance.sh" "$BUILD" --page &
    SANDBOX=$!
    scripts/demo/page-forward.sh $SANDBOX 8090 &
    FORWARD=$!
    trap 'kill $FORWARD $SANDBOX 2>/dev/null || true' INT TERM
    wait $SANDBOX || RC=$?
    kill $FORWARD 2>/dev/null || true
    wait $FORWARD 2>/dev/null || true
    trap - INT TERM
    if [ $RC -eq 130 ] || [ $RC -eq 143 ]; then RC=0; fi
fi

echo
echo "== host root check"
CHANGED=$(comm -13 <(echo "$BEFORE" | sort) <(snapshot_host | sort))
if [ -n "$CHANGED" ]; then
    echo "host root changed by the demo:"
    echo "$CHANGED"
    RC=1
else
    echo "host root unchanged (appliance paths, the entries of / /etc /run /srv /var/log" \
        "/var/lib/dpkg/info /usr, the installed packages)"
fi
if [ $RC -eq 0 ]; then
    echo "demo.sh: PASSED"
else
    echo "demo.sh: FAILED (exit $RC)"
fi
exit $RC
