#!/usr/bin/env bash
# Builds the fuzz targets (fuzz/, clang + libFuzzer, AddressSanitizer and
# UndefinedBehaviorSanitizer) in build-fuzz/ ($KYTO_FUZZ_BUILD when set) and runs each
# inside the test sandbox, starting from the seed corpus in fuzz/corpus/<target>.  As root:
#
#   bash scripts/fuzz.sh [-runs=N | -max_total_time=S] [target ...]
#
# Default: 10,000,000 executions per target, every target.  Each run prints its
# libFuzzer statistics; the summary gives executions, time and executions per second per
# target.  A finding stops that target's run with its crash report (libFuzzer prints the
# input; the sandbox's files, crash files included, vanish with the run) and makes the
# script exit non-zero.
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
BUILD=${KYTO_FUZZ_BUILD:-$ROOT/build-fuzz}
ALL=(feed_line feed_file patch_list info_file keyvalue download_status apply_stage signature)

LIMIT=-runs=10000000
TARGETS=()
for arg in "$@"; do
    case "$arg" in
    -runs=* | -max_total_time=*) LIMIT=$arg ;;
    -h | --help)
        sed -n '2,12p' "$0"
        exit 0
        ;;
    *) TARGETS+=("$arg") ;;
    esac
done
[ ${#TARGETS[@]} -gt 0 ] || TARGETS=("${ALL[@]}")

if [ "$(id -u)" -ne 0 ]; then
    echo "$0: must run as root (the sandbox needs it)" >&2
    exit 1
fi
CC=clang CXX=clang++ cmake -S fuzz -B "$BUILD" >/dev/null
cmake --build "$BUILD" -j2 >/dev/null

# Longest input per target: a feed line up to the 4096-character value and a little more.
max_len() {
    case "$1" in
    feed_line) echo 4400 ;;
    feed_file) echo 16384 ;;
    *) echo 4096 ;;
    esac
}

export ASAN_OPTIONS=abort_on_error=1:detect_leaks=1
export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
FAILED=()
SUMMARY=()
for t in "${TARGETS[@]}"; do
    echo "== fuzz $t ($LIMIT)"
    LOG=$(mktemp /tmp/kyto-fuzz-$t.XXXXXX)
    START=$SECONDS
    RC=0
    "$BUILD/kyto-sandbox" "$BUILD/${t}_fuzz" "$LIMIT" -max_len="$(max_len "$t")" \
        -print_final_stats=1 -timeout=10 -rss_limit_mb=1024 "$ROOT/fuzz/corpus/$t" \
        >"$LOG" 2>&1 || RC=$?
    ELAPSED=$((SECONDS - START))
    tail -n 25 "$LOG"
    RUNS=$(sed -n 's/^stat::number_of_executed_units: *//p' "$LOG" | tail -n1)
    RUNS=${RUNS:-?}
    RATE=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$LOG" | tail -n1)
    if [ $RC -ne 0 ]; then
        FAILED+=("$t")
        SUMMARY+=("$t: FINDING (exit $RC) after ${RUNS} executions, ${ELAPSED}s; log $LOG")
    else
        SUMMARY+=("$t: ${RUNS} executions, ${ELAPSED}s, ${RATE:-?} exec/s, no finding")
        rm -f "$LOG"
    fi
done
echo "== summary"
printf '%s\n' "${SUMMARY[@]}"
[ ${#FAILED[@]} -eq 0 ] || {
    echo "fuzz.sh: findings in ${FAILED[*]}" >&2
    exit 1
}
