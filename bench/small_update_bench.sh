#!/bin/bash
# Small-update benchmark (run by hand, not by CI).
#
# A small update of 50 packages (1 MiB each) is published by the loopback update server.
# Each round times, inside the test sandbox (build-bench/tests/kyto-sandbox, so no fixed
# appliance path of this machine is touched):
#   library  SmallUpdate::Download(true) of the 50 packages (the patch-list lookup before
#            it is not timed), then SmallUpdate::Apply() of them;
#   plain    50 runs of "wget -O <file> <url>", then 50 runs of "dpkg -i <file>".
# Both sides' wget write their usual progress log to a file and both sides' dpkg append
# their output to a log file.  The installed packages are purged between runs (not timed).
# Rounds alternate which side goes first (library first in odd rounds, plain first in even
# ones), so that warm caches favour neither.  Prints every run and the median ratios
# library/plain for the download and for the apply.
#
# Usage: bench/small_update_bench.sh [ROUNDS]      (default 6; needs root, like the tests)
set -euo pipefail

SRC=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
source "$SRC/bench/bench_lib.sh"

if [ "${1:-}" != "--inside" ]; then
    kyto_bench_enter_sandbox "$SRC/bench/small_update_bench.sh" small_update_bench "${1:-6}"
fi

# ---- inside the sandbox ----------------------------------------------------------------
BUILD=$2
ROUNDS=$3
DRIVER="$BUILD/bench/small_update_bench"
COUNT=50
BUILDNUM=$(sed -n 's/^buildnumber="\{0,1\}\([0-9]*\)"\{0,1\}$/\1/p' /etc.defaults/VERSION)
UNIQUE=$(sed -n 's/^unique="\{0,1\}\([^"]*\)"\{0,1\}$/\1/p' /etc.defaults/kytoinfo.conf)
SERVED=/srv/bench
PLAIN=/volume2/plain
cd /

mkdir -p /volume1 /volume2 "$SERVED/debs" /tmp/benchpkg
mount -t tmpfs -o size=512m tmpfs /volume1
mount -t tmpfs -o size=512m tmpfs /volume2

# The packages: benchNN_6.1-<build>-s1_all.deb, each shipping 1 MiB of random data.
NAMES=()
for i in $(seq -w 1 "$COUNT"); do
    pkg="bench$i"
    NAMES+=("$pkg")
    root="/tmp/benchpkg/$pkg"
    mkdir -p "$root/DEBIAN" "$root/usr/share/$pkg"
    head -c $((1 << 20)) /dev/urandom >"$root/usr/share/$pkg/payload"
    cat >"$root/DEBIAN/control" <<CONTROL
Package: $pkg
Version: 6.1-$BUILDNUM-s1
Architecture: all
Maintainer: Bench <bench@example.invalid>
Description: small-update benchmark package $i
CONTROL
    dpkg-deb --root-owner-group -b "$root" "$SERVED/debs/${pkg}_6.1-$BUILDNUM-s1_all.deb" \
        >/dev/null
done
# The fix's small-update package (fetched with further packages, unpacked only for a
# configuration update, never installed): tiny.
SU="benchsu_6.1-$BUILDNUM-s1_all.deb"
mkdir -p /tmp/benchpkg/su/DEBIAN
printf 'Package: benchsu\nVersion: 6.1-%s-s1\nArchitecture: all\nMaintainer: Bench <bench@example.invalid>\nDescription: small-update package of the benchmark\n' \
    "$BUILDNUM" >/tmp/benchpkg/su/DEBIAN/control
dpkg-deb --root-owner-group -b /tmp/benchpkg/su "$SERVED/debs/$SU" >/dev/null
rm -rf /tmp/benchpkg

kyto_bench_start_server "$SERVED"
trap kyto_bench_stop_server EXIT
BASE="http://127.0.0.1:$PORT"

# The patch list: one fix (1) naming the 50 packages.
LIST_DIR="$SERVED/smallupdate/$BUILDNUM/$UNIQUE"
mkdir -p "$LIST_DIR"
{
    printf '{"vyxversion":%s,"unique":"%s","smallupdate":[{"version":1,' "$BUILDNUM" "$UNIQUE"
    printf '"flash_upgrade":false,"config_upgrade":false,"restart":"none","proj":['
    sep=""
    for pkg in "${NAMES[@]}"; do
        printf '%s{"name":"%s","url":"%s/debs/%s_6.1-%s-s1_all.deb"}' "$sep" "$pkg" "$BASE" \
            "$pkg" "$BUILDNUM"
        sep=","
    done
    printf ',{"name":"smallupdate","url":"%s/debs/%s"}' "$BASE" "$SU"
    printf ']}]}\n'
} >"$LIST_DIR/VYX-Security.json"
echo "small_info_path=\"$BASE/smallupdate\"" >>/etc.defaults/kytoinfo.conf

now() { date +%s.%N; }
elapsed() { awk -v a="$1" -v b="$2" 'BEGIN { printf "%.6f", b - a }'; }

reset() {
    dpkg -P "${NAMES[@]}" >/dev/null 2>&1 || true
    sed -i '/^smallfixnumber=/d' /etc.defaults/VERSION
    rm -rf /volume1/@smallupd@te_deb /autoupd@te.info "$PLAIN" /smallupd@te
}

run_library() {
    reset
    LIB_DL=$("$DRIVER" download 2>>/tmp/library-wget.log)
    LIB_AP=$("$DRIVER" apply)
}

run_plain() {
    reset
    mkdir -p "$PLAIN"
    local t0 t1 t2 pkg file
    t0=$(now)
    for pkg in "${NAMES[@]}"; do
        file="${pkg}_6.1-$BUILDNUM-s1_all.deb"
        wget -O "$PLAIN/$file" "$BASE/debs/$file" 2>>/tmp/plain-wget.log
    done
    wget -O "$PLAIN/$SU" "$BASE/debs/$SU" 2>>/tmp/plain-wget.log
    t1=$(now)
    for pkg in "${NAMES[@]}"; do
        dpkg -i "$PLAIN/${pkg}_6.1-$BUILDNUM-s1_all.deb" >>/tmp/plain-dpkg.log 2>&1
    done
    t2=$(now)
    RAW_DL=$(elapsed "$t0" "$t1")
    RAW_AP=$(elapsed "$t1" "$t2")
}

median() {
    printf '%s\n' "$@" | sort -g | awk '{a[NR]=$1} END {
        if (NR % 2) print a[(NR + 1) / 2]; else print (a[NR / 2] + a[NR / 2 + 1]) / 2 }'
}

DL_RATIOS=()
AP_RATIOS=()
echo "packages: $COUNT x 1 MiB, rounds: $ROUNDS"
printf '%-6s %-8s %10s %10s %8s %10s %10s %8s\n' round first lib_dl raw_dl ratio lib_ap \
    raw_ap ratio
for round in $(seq "$ROUNDS"); do
    if [ $((round % 2)) -eq 1 ]; then
        first=library
        run_library
        run_plain
    else
        first=plain
        run_plain
        run_library
    fi
    dl=$(awk -v a="$LIB_DL" -v b="$RAW_DL" 'BEGIN { printf "%.6f", a / b }')
    ap=$(awk -v a="$LIB_AP" -v b="$RAW_AP" 'BEGIN { printf "%.6f", a / b }')
    DL_RATIOS+=("$dl")
    AP_RATIOS+=("$ap")
    printf '%-6s %-8s %10.3f %10.3f %8.3f %10.3f %10.3f %8.3f\n' "$round" "$first" "$LIB_DL" \
        "$RAW_DL" "$dl" "$LIB_AP" "$RAW_AP" "$ap"
done
printf 'median ratio library/plain, download: %.3f\n' "$(median "${DL_RATIOS[@]}")"
printf 'median ratio library/plain, apply:    %.3f\n' "$(median "${AP_RATIOS[@]}")"
