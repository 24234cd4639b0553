#!/bin/bash
# Signed-release benchmark (run by hand, not by CI).
#
# 1. "kytoupdate download" of a 1 GiB release, timed as a whole process, with a trust folder
#    holding the site's public key (the image is verified against its signature, the feed is
#    fetched again with its signature and read again) against the same download without a
#    trust folder.  The download is removed between runs; nothing is dropped from the page
#    cache, so the extra read of the image for its signature comes from memory, as it would
#    on an appliance right after the download.
# 2. "kytosite release" of the same image into a fresh site (copy into the site with its
#    MD5, the feed written and read back) against "md5sum IMAGE" followed by
#    "minisign -S" of it (a key without password).
#
# The site is made with kytosite (init, release, keygen without password, sign) and served
# by the loopback update server of the tests; volumes and site are tmpfs.  Each comparison
# runs in counterbalanced pairs (pair 1: A then B, pair 2: B then A, ...) after one warm-up
# of each side; prints each pair's times, its ratio A/B and the load average before it, then
# the median ratio.  Everything runs inside the test sandbox (build-bench/tests/kyto-sandbox),
# so no fixed appliance path of this machine is touched.
#
# Usage: bench/trust_bench.sh [ROUNDS]    (pairs per comparison, default 5; needs root and
#                                          minisign, like the tests)
set -euo pipefail

SRC=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
source "$SRC/bench/bench_lib.sh"

if [ "${1:-}" != "--inside" ]; then
    command -v minisign >/dev/null || {
        echo "trust_bench.sh: minisign is missing (apt-get install minisign)" >&2
        exit 1
    }
    kyto_bench_enter_sandbox "$SRC/bench/trust_bench.sh" "kytoupdate kytosite" "${1:-5}"
fi

# ---- inside the sandbox ----------------------------------------------------------------
BUILD=$2
ROUNDS=$3
KYTOUPDATE="$BUILD/tools/kytoupdate"
KYTOSITE="$BUILD/tools/kytosite"
SIZE_MIB=1024
VERSION=5.2-5700 # newer than the sandbox's 5.2-5644
MODEL=demo_model # the sandbox's model
TRUST=/etc/kytoupdate/trusted.d
WORK=/srv/bench/work # the image, the keys, the fresh sites of the release runs
IMAGE=$WORK/VYX_$VERSION.img

mkdir -p /volume1 /srv/bench
mount -t tmpfs -o size=$((SIZE_MIB + 256))m tmpfs /volume1
mount -t tmpfs -o size=$((SIZE_MIB * 3 + 256))m tmpfs /srv/bench
mkdir -p $WORK /srv/bench/www
head -c $((SIZE_MIB << 20)) /dev/urandom >"$IMAGE"

kyto_bench_start_server /srv/bench/www
trap kyto_bench_stop_server EXIT
BASE="http://127.0.0.1:$PORT/site"

# The served site, signed; the device's feed address points at it.
SITE=/srv/bench/www/site
"$KYTOSITE" init $SITE --base-url "$BASE"
"$KYTOSITE" release $SITE "$IMAGE" --version $VERSION --model $MODEL
"$KYTOSITE" keygen $WORK/site.pub $WORK/site.key 2>/dev/null
"$KYTOSITE" sign $SITE --key $WORK/site.key
echo "rss_server=\"$BASE/autoupdate/genRSS.php\"" >>/etc.defaults/kytoinfo.conf
minisign -G -W -p $WORK/minisign.pub -s $WORK/minisign.key >/dev/null

now() { date +%s.%N; }
since() { awk -v a="$1" -v b="$(now)" 'BEGIN { printf "%.6f", b - a }'; }
fail() {
    echo "trust_bench.sh: $*" >&2
    exit 1
}

# One download, with ($1 = trust) or without ($1 = none) the trust folder; prints seconds.
download() {
    rm -rf /volume1/@autoupdate /autoupd@te.info $TRUST
    if [ "$1" = trust ]; then
        mkdir -p $TRUST
        cp $WORK/site.pub $TRUST/site.pub
    fi
    local t0 rc=0
    t0=$(now)
    "$KYTOUPDATE" download >/tmp/download.out 2>/tmp/download.err || rc=$?
    since "$t0"
    if [ $rc != 0 ] || ! grep -q "^downloaded vyx " /tmp/download.out; then
        fail "download ($1) failed with $rc: $(cat /tmp/download.out /tmp/download.err)"
    fi
    # Without the folder the driver says that nothing is checked; with it, it must not.
    if grep -q "signatures are not checked" /tmp/download.err; then
        [ "$1" = none ] || fail "the trust folder was not used: $(cat /tmp/download.err)"
    else
        [ "$1" = trust ] || fail "no notice without a trust folder"
    fi
}

# kytosite release of the image into a fresh site; prints seconds.
site_release() {
    rm -rf $WORK/site
    "$KYTOSITE" init $WORK/site --base-url "$BASE" >/dev/null
    local t0
    t0=$(now)
    "$KYTOSITE" release $WORK/site "$IMAGE" --version $VERSION --model $MODEL >/dev/null
    since "$t0"
    rm -rf $WORK/site # untimed: both sides start with the same free memory
}

# md5sum of the image, then minisign's signature of it; prints seconds.
plain_sign() {
    rm -f "$IMAGE.minisig"
    local t0
    t0=$(now)
    md5sum "$IMAGE" >/dev/null
    minisign -S -s $WORK/minisign.key -m "$IMAGE" >/dev/null
    since "$t0"
    [ -s "$IMAGE.minisig" ] || fail "minisign wrote no signature"
}

median() {
    sort -g | awk '{ a[NR] = $1 } END {
        if (NR % 2) print a[(NR + 1) / 2]; else print (a[NR / 2] + a[NR / 2 + 1]) / 2 }'
}

# pairs TITLE A_NAME A_COMMAND B_NAME B_COMMAND: the counterbalanced pairs, their median.
pairs() {
    local title=$1 an=$2 a=$3 bn=$4 b=$5 i ta tb load order ratios=()
    echo
    echo "$title: $ROUNDS pairs (one warm-up of each first)"
    $a >/dev/null
    $b >/dev/null
    printf '%-5s %-6s %12s %12s %8s %6s\n' pair order "${an}_s" "${bn}_s" ratio load1
    for i in $(seq "$ROUNDS"); do
        load=$(cut -d' ' -f1 /proc/loadavg)
        if [ $((i % 2)) = 1 ]; then
            order=AB
            ta=$($a)
            tb=$($b)
        else
            order=BA
            tb=$($b)
            ta=$($a)
        fi
        ratios+=("$(awk -v a="$ta" -v b="$tb" 'BEGIN { printf "%.4f", a / b }')")
        printf '%-5s %-6s %12.3f %12.3f %8.3f %6s\n' "$i" $order "$ta" "$tb" "${ratios[-1]}" "$load"
    done
    printf 'median ratio %s/%s: %.3f\n' "$an" "$bn" "$(printf '%s\n' "${ratios[@]}" | median)"
}

echo "image: $SIZE_MIB MiB; load average: $(cut -d' ' -f1-3 /proc/loadavg)"
pairs "kytoupdate download, trust folder against none" \
    trust "download trust" none "download none"
pairs "kytosite release against md5sum + minisign -S" \
    release site_release plain "plain_sign"
echo "load average at the end: $(cut -d' ' -f1-3 /proc/loadavg)"
