#!/bin/bash
# Reader benchmarks (run by hand, not by CI): the status polls and the release feed reader.
#
# Builds a Release tree in build-bench/ and runs, inside the test sandbox (so no fixed
# appliance path of this machine is touched):
#   status_poll_bench  both engines' GetDownloadStatus and GetApplyStage against one
#                      open+read+close of the file each reads.  For the full-release reader a
#                      real download runs meanwhile: wget fetches a 1 GiB image from the
#                      loopback update server at 2 MiB/s, its progress log in
#                      /var/run/downloadprogress and its pid in /var/run/downloadVYX.pid, as
#                      the library starts it;
#   feed_bench         VyxUpdate::ParseRssFile on a generated 107 MB feed against
#                      grep -c '<model>' over the same file.
# Each prints its ratios at the end.  "check" runs instead the differential check of the
# feed reader against its plain reference (bench/feed_reader_check.cpp) on FEEDS feeds.
#
# Usage: bench/reader_bench.sh [polls|feed|all] [Google Benchmark options...]   (needs root)
#        bench/reader_bench.sh check [FEEDS [SEED]]
set -euo pipefail

SRC=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
source "$SRC/bench/bench_lib.sh"

if [ "${1:-}" != "--inside" ]; then
    WHAT=${1:-all}
    shift || true
    case "$WHAT" in polls | feed | all | check) ;; *)
        echo "usage: $0 [polls|feed|all] [benchmark options...] | check [FEEDS [SEED]]" >&2
        exit 2
        ;;
    esac
    kyto_bench_enter_sandbox "$SRC/bench/reader_bench.sh" \
        "status_poll_bench feed_bench feed_reader_check" "$WHAT" "$@"
fi

# ---- inside the sandbox ----------------------------------------------------------------
BUILD=$2
WHAT=$3
shift 3
cd /

if [ "$WHAT" = check ]; then
    exec "$BUILD/bench/feed_reader_check" "$@"
fi

if [ "$WHAT" != feed ]; then
    mkdir -p /volume1 /srv/bench
    mount -t tmpfs -o size=1200m tmpfs /volume1
    mount -t tmpfs -o size=1100m tmpfs /srv/bench
    mkdir -p /srv/bench/images /volume1/@autoupdate
    truncate -s 1G /srv/bench/images/vyx.img
    echo '{"slow": {"/images/vyx.img": 2097152}}' >/srv/bench/.control.json

    kyto_bench_start_server /srv/bench
    WGET_PID=
    trap 'kill $WGET_PID $SERVER_PID 2>/dev/null; wait 2>/dev/null || true' EXIT
    URL="http://127.0.0.1:$PORT/images/vyx.img"
    # The library's own wget command line, its progress log and its pid file.
    /usr/kyto/bin/wget -O /volume1/@autoupdate/vyx.img "$URL" --timeout=15 --tries=1 \
        --no-dns-cache >/dev/null 2>/var/run/downloadprogress &
    WGET_PID=$!
    echo "$WGET_PID" >/var/run/downloadVYX.pid
    sleep 3
    echo "download running: pid $WGET_PID, $(stat -c %s /volume1/@autoupdate/vyx.img) bytes" \
        "so far, progress log $(wc -l </var/run/downloadprogress) lines"
    "$BUILD/bench/status_poll_bench" "$@"
    kill "$WGET_PID" 2>/dev/null || true
fi

if [ "$WHAT" != polls ]; then
    "$BUILD/bench/feed_bench" "$@"
fi
