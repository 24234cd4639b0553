#!/usr/bin/env bash
# Builds the Debian packages (debian/) the way a distribution does, checks them with lintian
# and runs their as-installed tests (debian/tests/control).  Run as root on Debian 12:
#
#   bash scripts/debian.sh            build in a copy of the tree, lintian, install, test
#
# The tree (tracked and untracked files, not the ignored build folders) is copied into a
# temporary folder and built there with dpkg-buildpackage -us -uc -b, so that nothing lands
# in the checkout or beside it.  lintian must report no error and no warning.  The packages
# are then installed with apt inside the test sandbox (tests/sandbox/kyto-sandbox: an
# overlay over "/" that vanishes with it), where every test of debian/tests/control runs
# from the source tree as autopkgtest would run it.  KYTO_DEB_KEEP=1 keeps the temporary
# folder (its path is printed).
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
source scripts/deps.sh

START=$SECONDS
STEP=start
step() {
    STEP=$1
    echo "== $1 (at $((SECONDS - START))s)"
}
trap 'echo "debian.sh: FAILED at step \"$STEP\" after $((SECONDS - START))s" >&2' ERR

# Inside the sandbox: install the packages, then run every test of debian/tests/control.
#   debian.sh --as-installed SOURCE_TREE DEB_FOLDER TEST_PACKAGE...
if [ "${1:-}" = --as-installed ]; then
    SRC=$2 DEBS=$3
    shift 3
    [ -e /.kyto-sandbox ] || { echo "$0: --as-installed runs only in the test sandbox" >&2; exit 1; }
    export DEBIAN_FRONTEND=noninteractive
    # No service of an installed package (nginx) is started in the sandbox.
    printf '#!/bin/sh\nexit 101\n' >/usr/sbin/policy-rc.d
    chmod 0755 /usr/sbin/policy-rc.d
    step "apt-get install the packages and the tests' dependencies"
    apt-get install -y -q --no-upgrade "$DEBS"/*.deb "$@" >/tmp/apt.log 2>&1 ||
        { tail -n 30 /tmp/apt.log; false; }
    dpkg-query -W -f='  ${Package} ${Version} ${Status}\n' libkytoinstallcpp0 \
        libkytoinstallcpp-dev kytoupdate libkytoinstallcpp0-dbgsym kytoupdate-dbgsym
    echo "  timer enabled: $(readlink /etc/systemd/system/timers.target.wants/kytoupdate-auto.timer)"
    FAILED=()
    for t in $(sed -n 's/^Tests:[[:space:]]*//p' "$SRC/debian/tests/control" | tr ',' ' '); do
        step "as-installed test $t"
        rc=0
        (cd "$SRC" && AUTOPKGTEST_TMP=$(mktemp -d) "debian/tests/$t") || rc=$?
        echo "-- $t: $([ $rc -eq 0 ] && echo PASS || echo "FAIL (exit $rc)")"
        [ $rc -eq 0 ] || FAILED+=("$t")
    done
    [ ${#FAILED[@]} -eq 0 ] || { echo "failed as-installed tests: ${FAILED[*]}"; exit 1; }
    exit 0
fi

kyto_require_root
TMP=$(mktemp -d /tmp/kyto-deb.XXXXXX)
if [ "${KYTO_DEB_KEEP:-0}" = 1 ]; then echo "== keeping $TMP"; else trap 'rm -rf "$TMP"' EXIT; fi
VERSION=$(dpkg-parsechangelog -l debian/changelog -S Version 2>/dev/null ||
    sed -n '1s/.*(\(.*\)).*/\1/p' debian/changelog)
SRC=$TMP/libkytoinstallcpp-${VERSION%-*}

step "copy the tree into $SRC"
mkdir -p "$SRC"
if git -C "$ROOT" rev-parse --git-dir >/dev/null 2>&1; then
    git -C "$ROOT" ls-files -z --cached --others --exclude-standard |
        (cd "$ROOT" && xargs -0 cp --parents -t "$SRC" 2>/dev/null || true)
    # Files deleted in the worktree but still in the index are simply not copied.
else
    tar -C "$ROOT" --exclude='./build*' --exclude='./_install*' -cf - . | tar -C "$SRC" -xf -
fi

step "build dependencies"
kyto_install_packages build-essential dpkg-dev lintian
if ! (cd "$SRC" && dpkg-checkbuilddeps) 2>/dev/null; then
    export DEBIAN_FRONTEND=noninteractive
    apt-get update -qq
    # build-dep of a folder reads its debian/control; no deb-src lines are needed.
    apt-get build-dep -y -qq "$SRC" >/dev/null
fi

step "source package (for lintian)"
# The source package as a vendor's build system would make it: the tree without debian/ as
# the upstream tarball, debian/ beside it.
tar -C "$TMP" --exclude="${SRC##*/}/debian" -czf "$TMP/libkytoinstallcpp_${VERSION%-*}.orig.tar.gz" \
    "${SRC##*/}"
(cd "$TMP" && dpkg-source -b "${SRC##*/}" >/dev/null)

step "dpkg-buildpackage -us -uc -b"
BUILD_START=$SECONDS
if ! (cd "$SRC" && dpkg-buildpackage -us -uc -b) >"$TMP/build.log" 2>&1; then
    tail -n 40 "$TMP/build.log"
    false
fi
grep -E '^dpkg-deb: building|dpkg-gensymbols' "$TMP/build.log" || true
echo "   built in $((SECONDS - BUILD_START))s"
CHANGES=$(ls "$TMP"/*.changes)

step "lintian (the binary packages and the source package)"
LINTIAN_START=$SECONDS
lintian -I --pedantic --show-overrides "$CHANGES" "$TMP"/*.dsc 2>&1 |
    grep -v 'running with root privileges' | tee "$TMP/lintian.log" || true
echo "   lintian took $((SECONDS - LINTIAN_START))s"
if grep -qE '^[EW]: ' "$TMP/lintian.log"; then
    echo "lintian reports errors or warnings" >&2
    false
fi

step "as-installed tests"
# The tests' dependencies as debian/tests/control lists them.
mapfile -t TEST_DEPS < <(sed -n 's/^Depends:[[:space:]]*//p' debian/tests/control | tr ',' '\n' |
    sed 's/^[[:space:]]*//; s/[[:space:]]*$//' | grep -vE '^$|^@$|^(libkytoinstallcpp|kytoupdate)' |
    sort -u)
mkdir "$TMP/debs"
mv "$TMP"/*.deb "$TMP/debs/"
# The sandbox has no network: apt fetches what the install needs into its cache first.
# Packages already installed stay at their version (--no-upgrade), as on the host.
export DEBIAN_FRONTEND=noninteractive
if ! apt-get install -y -qq --no-upgrade --download-only "$TMP"/debs/*.deb "${TEST_DEPS[@]}" >/dev/null 2>&1; then
    apt-get update -qq
    apt-get install -y -qq --no-upgrade --download-only "$TMP"/debs/*.deb "${TEST_DEPS[@]}" >/dev/null
fi
gcc -O2 -Wall -DKYTO_PROVISION_SCRIPT="\"$SRC/tests/sandbox/provision.sh\"" \
    "$SRC/tests/sandbox/kyto-sandbox.c" -o "$TMP/kyto-sandbox"
TEST_START=$SECONDS
"$TMP/kyto-sandbox" "$SRC/scripts/debian.sh" --as-installed "$SRC" "$TMP/debs" "${TEST_DEPS[@]}"
echo "   as-installed tests took $((SECONDS - TEST_START))s"
echo "debian.sh: PASSED in $((SECONDS - START))s (packages built, lintian clean, as-installed tests passed)"
