#!/bin/bash
# Peak memory of "kytoupdate download" during a 1 GiB release download from the sample
# server (its site made with kytosite), against bare processes that load the same
# libraries.  Run inside the sandbox (after scripts/demo.sh's build):
#   build/tests/kyto-sandbox scripts/demo/memory.sh BUILD_DIR [MiB]
# Prints the peak resident set (VmHWM) of every kytoupdate process (the display and the
# download process it forks) and of wget, sampled every 20 ms, and of the bare processes.
set -euo pipefail
BUILD=$1
MB=${2:-1024}
HERE=$(cd "$(dirname "$0")" && pwd)
PORT=8088
BASE=http://127.0.0.1:$PORT
SITE=/srv/kyto-demo
STATE=/run/kyto-demo-nginx

# The release image, published with kytosite (unsigned: no trust folder on this appliance).
head -c $((MB * 1048576)) /dev/urandom >/tmp/VYX_5.2-5700.img
"$BUILD/tools/kytosite" init $SITE --base-url $BASE >/dev/null
"$BUILD/tools/kytosite" release $SITE /tmp/VYX_5.2-5700.img --version 5.2-5700 --model demo_model
rm /tmp/VYX_5.2-5700.img
mkdir -p $STATE /volume1
sed -e "s|@SITE@|$SITE|; s|@PORT@|$PORT|; s|@STATE@|$STATE|g; s|@PKG_RATE@|0|; s|@IMG_RATE@|0|" \
    "$HERE/nginx.conf.in" >$STATE/nginx.conf
nginx -e $STATE/error.log -c $STATE/nginx.conf
trap 'kill "$(cat $STATE/nginx.pid)" 2>/dev/null || true' EXIT
mount -t tmpfs -o size=$((MB + 256))m kyto-demo-volume /volume1
printf 'rss_server="%s/autoupdate/genRSS.php"\n' $BASE >>/etc.defaults/kytoinfo.conf

hwm() { awk '/^VmHWM/ {print $2}' "/proc/$1/status" 2>/dev/null || true; }

# Bare: the two libraries (and what they pull in) loaded into a program that does nothing,
# and kytoupdate itself started but doing nothing but wait.
LD_PRELOAD="$BUILD/src/libkytoinstallcpp.so.0 $BUILD/platform/libkytoplatform.so.0" sleep 1 &
pid=$!
sleep 0.5
BARE_LIBS=$(hwm $pid)
wait $pid
"$BUILD/tools/kytoupdate" status --watch --interval 3600 >/dev/null &
pid=$!
sleep 0.5
BARE_DRIVER=$(hwm $pid)
kill $pid
wait $pid || true

START=$(date +%s.%N)
"$BUILD/tools/kytoupdate" download >/tmp/download.out 2>&1 &
main=$!
declare -A PEAK=() NAME=()
while kill -0 $main 2>/dev/null; do
    for s in /proc/[0-9]*/status; do
        p=${s#/proc/}
        p=${p%/status}
        n=$(awk '/^Name/ {print $2}' "$s" 2>/dev/null || true)
        case $n in kytoupdate | wget) ;; *) continue ;; esac
        [ "$p" = "$pid" ] && continue
        v=$(hwm "$p")
        [ -n "$v" ] || continue
        NAME[$p]=$n
        if [ "${PEAK[$p]:-0}" -lt "$v" ]; then PEAK[$p]=$v; fi
    done
    sleep 0.02
done
wait $main
END=$(date +%s.%N)
tail -1 /tmp/download.out
echo "download of $MB MiB took $(awk -v a="$START" -v b="$END" 'BEGIN {printf "%.1f", b - a}') s"
echo "bare: libraries loaded into sleep: VmHWM $BARE_LIBS kB; kytoupdate idle: VmHWM $BARE_DRIVER kB"
KYTO_MAX=0
for p in "${!PEAK[@]}"; do
    role=${NAME[$p]}
    [ "$p" = "$main" ] && role="kytoupdate (display)"
    [ "${NAME[$p]}" = kytoupdate ] && [ "$p" != "$main" ] && role="kytoupdate (download process)"
    echo "$role pid $p: VmHWM ${PEAK[$p]} kB"
    if [ "${NAME[$p]}" = kytoupdate ] && [ "${PEAK[$p]}" -gt $KYTO_MAX ]; then KYTO_MAX=${PEAK[$p]}; fi
done
ratio() { awk -v a="$1" -v b="$2" 'BEGIN {printf "%.2f", a / b}'; }
echo "ratio: kytoupdate peak / libraries in sleep = $(ratio $KYTO_MAX $BARE_LIBS)," \
    "kytoupdate peak / kytoupdate idle = $(ratio $KYTO_MAX $BARE_DRIVER)"
