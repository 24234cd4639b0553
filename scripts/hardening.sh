#!/usr/bin/env bash
# Hardening checks in a short mode, for CI (run as root on a Debian machine):
#   1. every fuzz target (fuzz/, clang + libFuzzer under AddressSanitizer and
#      UndefinedBehaviorSanitizer) for a short while from its seed corpus;
#   2. the torn-read stress (tests/stress/torn_reads) with a few thousand rewrites;
#   3. a few kill -9 trials of each kind (tests/stress/crash_trials);
#   4. a leak run: the torn-read stress and one crash trial of each kind under Valgrind's
#      memcheck (the suite itself runs under LeakSanitizer in test.sh --sanitize).
# Everything that touches the appliance's paths runs inside the test sandbox.
#
#   bash scripts/hardening.sh [--fuzz-seconds=S]     (default 20 s per target)
#
# Long runs by hand: scripts/fuzz.sh for the fuzz targets; for the stress programs
#   build-stress/kyto-sandbox $PWD/build-stress/torn_reads --rewrites=100000 --pollers=3
#   build-stress/kyto-sandbox $PWD/build-stress/crash_trials --trials=100
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
source scripts/deps.sh
kyto_require_root

FUZZ_SECONDS=20
for arg in "$@"; do
    case "$arg" in
    --fuzz-seconds=*) FUZZ_SECONDS=${arg#*=} ;;
    -h | --help)
        sed -n '2,15p' "$0"
        exit 0
        ;;
    *)
        echo "$0: unknown option $arg" >&2
        exit 2
        ;;
    esac
done
STRESS=${KYTO_STRESS_BUILD:-$ROOT/build-stress}
export KYTO_FUZZ_BUILD=${KYTO_FUZZ_BUILD:-$ROOT/build-fuzz}

START=$SECONDS
STEP="start"
step() {
    STEP=$1
    echo "== $1"
}
trap 'echo "hardening.sh: FAILED at step \"$STEP\" after $((SECONDS - START))s" >&2' ERR

step "packages"
kyto_install_packages "${KYTO_BUILD_PACKAGES[@]}" "${KYTO_TEST_PACKAGES[@]}" \
    "${KYTO_HARDENING_PACKAGES[@]}"

step "fuzz targets, ${FUZZ_SECONDS}s each"
bash scripts/fuzz.sh -max_total_time="$FUZZ_SECONDS"

step "build the stress programs in $STRESS"
cmake -S tests/stress -B "$STRESS" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$STRESS" -j"$(nproc)" >/dev/null
SANDBOX=$STRESS/kyto-sandbox

step "torn reads (short)"
"$SANDBOX" "$STRESS/torn_reads" --rewrites=4000 --pollers=2

step "kill -9 trials (short)"
"$SANDBOX" "$STRESS/crash_trials" --trials=3

step "leak run under valgrind memcheck"
VALGRIND=(valgrind --quiet --leak-check=full --errors-for-leak-kinds=definite,indirect
    --error-exitcode=99 --suppressions="$ROOT/tests/stress/valgrind.supp")
"$SANDBOX" "${VALGRIND[@]}" "$STRESS/torn_reads" --rewrites=300 --pollers=1
"$SANDBOX" "${VALGRIND[@]}" "$STRESS/crash_trials" --trials=1

echo "hardening.sh: PASSED in $((SECONDS - START))s"
