#!/bin/bash
# Full-release download benchmark (run by hand, not by CI).
#
# Compares, on a 1 GiB image served by the loopback update server, the library's whole
# VyxUpdate::DownloadVyx (feed fetch, release check, wget download, MD5 verification)
# with a plain "wget -O file URL" followed by "openssl md5 file".  Both wget runs write
# their usual progress log to a file (the library needs it for the percentage; plain wget
# writes it to stderr when not on a terminal), so both pay for it.  Everything runs inside
# the test sandbox (build/tests/kyto-sandbox), so no fixed appliance path of this machine
# is touched.  Prints every run and the median ratio library/plain.
#
# Usage: bench/download_bench.sh [ROUNDS]      (default 5; needs root, like the tests)
set -euo pipefail

SRC=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
source "$SRC/bench/bench_lib.sh"

if [ "${1:-}" != "--inside" ]; then
    kyto_bench_enter_sandbox "$SRC/bench/download_bench.sh" vyx_download_bench "${1:-5}"
fi

# ---- inside the sandbox ----------------------------------------------------------------
BUILD=$2
ROUNDS=$3
DRIVER="$BUILD/bench/vyx_download_bench"
SIZE_MIB=1024

mkdir -p /volume1 /srv/bench
mount -t tmpfs -o size=$((SIZE_MIB * 2 + 256))m tmpfs /volume1
mount -t tmpfs -o size=$((SIZE_MIB + 64))m tmpfs /srv/bench
mkdir -p /srv/bench/images /srv/bench/autoupdate
head -c $((SIZE_MIB << 20)) /dev/urandom >/srv/bench/images/vyx.img
MD5=$(openssl md5 /srv/bench/images/vyx.img | awk '{print $2}')

kyto_bench_start_server /srv/bench
trap kyto_bench_stop_server EXIT
URL="http://127.0.0.1:$PORT/images/vyx.img"

cat >/srv/bench/autoupdate/genRSS.php <<FEED
<rss>
<channel>
<item>
<MajorVer>5</MajorVer>
<MinorVer>2</MinorVer>
<BuildNum>5700</BuildNum>
<model>
<mUnique>demo_model</mUnique>
<mLink>$URL</mLink>
<mCheckSum>$MD5</mCheckSum>
</model>
</item>
</channel>
</rss>
FEED
echo "rss_server=\"http://127.0.0.1:$PORT/autoupdate/genRSS.php\"" >>/etc.defaults/kytoinfo.conf

now() { date +%s.%N; }
RATIOS=()
echo "image: ${SIZE_MIB} MiB, rounds: $ROUNDS"
printf '%-6s %12s %12s %8s\n' round library_s plain_s ratio
for round in $(seq "$ROUNDS"); do
    rm -rf /volume1/@autoupdate /volume1/plain.img /autoupd@te.info
    lib=$("$DRIVER")

    rm -rf /volume1/@autoupdate /autoupd@te.info
    t0=$(now)
    wget -O /volume1/plain.img "$URL" 2>/tmp/plain-wget.log
    plain_md5=$(openssl md5 /volume1/plain.img | awk '{print $2}')
    t1=$(now)
    [ "$plain_md5" = "$MD5" ] || { echo "plain download corrupted" >&2; exit 1; }
    plain=$(awk -v a="$t0" -v b="$t1" 'BEGIN { printf "%.6f", b - a }')

    ratio=$(awk -v a="$lib" -v b="$plain" 'BEGIN { printf "%.6f", a / b }')
    RATIOS+=("$ratio")
    printf '%-6s %12.3f %12.3f %8.3f\n' "$round" "$lib" "$plain" "$ratio"
done
median=$(printf '%s\n' "${RATIOS[@]}" | sort -g | awk '{a[NR]=$1} END {
    if (NR % 2) print a[(NR + 1) / 2]; else print (a[NR / 2] + a[NR / 2 + 1]) / 2 }')
printf 'median ratio library/plain: %.3f\n' "$median"
