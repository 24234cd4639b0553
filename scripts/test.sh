#!/usr/bin/env bash
# Builds the project and runs every test, each test case in its own sandbox root
# (tests/sandbox/kyto-sandbox).  Run as root on a Debian machine:
#
#   bash scripts/test.sh              build/, install + consumer check, all tests
#   bash scripts/test.sh --sanitize   build-asan/ with AddressSanitizer and
#                                          UndefinedBehaviorSanitizer, all tests
#
# Afterwards the host's appliance paths are checked: a test run must not create any of them
# on the real root.
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
source scripts/deps.sh
kyto_require_root

SANITIZE=0
for arg in "$@"; do
    case "$arg" in
    --sanitize) SANITIZE=1 ;;
    -h | --help)
        sed -n '2,10p' "$0"
        exit 0
        ;;
    *)
        echo "$0: unknown option $arg" >&2
        exit 2
        ;;
    esac
done

START=$SECONDS
JOBS=$(nproc)
MODE=$([ $SANITIZE -eq 1 ] && echo "sanitizer run" || echo "test run")
STEP="start"
step() {
    STEP=$1
    echo "== $1"
}
trap 'echo "test.sh: $MODE FAILED at step \"$STEP\" after $((SECONDS - START))s" >&2' ERR

# Appliance paths that must never appear on the host because of a test run.
HOST_PATHS=(/autoupd@te.info /passive_upd@te.info /etc.defaults /smallupd@te /@smallupd@te_deb
    /flashUpd@teTempFolder /smallUpd@teTempFolder /.upgrade_vol /usr/kyto
    /var/run/downloadVYX.status /var/run/applySmallUpd@te.status /var/run/downloadVYX.pid
    /var/run/downloadprogress /var/log/kytoupdate.log /var/log/dpkg_upgrade.log
    /var/log/kytoevent.log /var/log/kyto-calls.log)
declare -A EXISTED_BEFORE=()
for p in "${HOST_PATHS[@]}"; do
    if [ -e "$p" ] || [ -L "$p" ]; then EXISTED_BEFORE[$p]=1; fi
done

step "packages"
kyto_install_packages "${KYTO_BUILD_PACKAGES[@]}" "${KYTO_TEST_PACKAGES[@]}"
# The update page's test: nginx and fcgiwrap (their services not started) and Chromium.
kyto_install_packages_without_services "${KYTO_DEMO_PACKAGES[@]}" "${KYTO_PAGE_TEST_PACKAGES[@]}"

# Entries of the host folders a leaking test would write into, taken after the package
# step (apt writes logs of its own) and compared after the run.
snapshot_host() {
    local d
    for d in / /etc /run /var/log /var/lib/dpkg/info /usr /usr/local/bin; do
        find "$d" -mindepth 1 -maxdepth 1 -printf "$d/%f\n" 2>/dev/null || true
    done | sort
}
SNAPSHOT_BEFORE=$(snapshot_host)

if [ $SANITIZE -eq 1 ]; then
    BUILD=$ROOT/build-asan
    export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1
    export UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
    step "configure $BUILD (AddressSanitizer + UndefinedBehaviorSanitizer)"
    cmake -S . -B "$BUILD" -DCMAKE_BUILD_TYPE=Debug -DKYTO_SANITIZE=ON -DKYTO_BUILD_TESTS=ON \
        -DKYTO_WERROR=ON >/dev/null
else
    BUILD=$ROOT/build
    step "configure $BUILD"
    cmake -S . -B "$BUILD" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DKYTO_SANITIZE=OFF \
        -DKYTO_BUILD_TESTS=ON -DKYTO_WERROR=ON >/dev/null
fi
if [ $SANITIZE -eq 0 ] && git -C "$ROOT" rev-parse --git-dir >/dev/null 2>&1; then
    # Every C and C++ file as .clang-format lays it out (clang-format -i FILE mends one).
    step "clang-format check"
    git -C "$ROOT" ls-files -z '*.c' '*.cpp' '*.h' | xargs -0 clang-format --dry-run -Werror
fi

step "build (-j$JOBS)"
cmake --build "$BUILD" -j"$JOBS"

if [ $SANITIZE -eq 0 ]; then
    # Install into a scratch prefix and build the same program against it from outside the
    # tree twice: through pkg-config, and through find_package(kytoinstallcpp).  Nothing
    # carries a run path, so both run with the prefix's library folder in LD_LIBRARY_PATH.
    STAGE=$(mktemp -d /tmp/kyto-install.XXXXXX)
    trap 'rm -rf "$STAGE"' EXIT
    step "install into $STAGE"
    cmake --install "$BUILD" --prefix "$STAGE/prefix" >/dev/null
    LIBDIR=$(dirname "$(find "$STAGE/prefix" -name 'libkytoinstallcpp.so' | head -n1)")
    for lib in "$LIBDIR"/libkytoinstallcpp.so "$LIBDIR"/libkytoplatform.so; do
        if readelf -d "$lib" | grep -qE 'RPATH|RUNPATH'; then
            echo "$lib carries a run path" >&2
            false
        fi
        # Internal helpers (namespace kyto) stay out of the dynamic symbol table.
        if nm -D -C --defined-only "$lib" | grep -q ' kyto::'; then
            echo "$lib exports internal symbols:" >&2
            nm -D -C --defined-only "$lib" | grep ' kyto::' | head -5 >&2
            false
        fi
    done
    step "build and run tests/consumer/app.cpp with pkg-config"
    cp tests/consumer/app.cpp tests/consumer/CMakeLists.txt "$STAGE/"
    (
        cd "$STAGE"
        export PKG_CONFIG_PATH=$LIBDIR/pkgconfig
        # shellcheck disable=SC2046
        g++ -std=c++17 -Wall -Wextra -Werror app.cpp -o app-pkgconfig \
            $(pkg-config --cflags --libs kytoinstallcpp)
        LD_LIBRARY_PATH=$LIBDIR ./app-pkgconfig
    )
    step "build and run tests/consumer/app.cpp with find_package(kytoinstallcpp)"
    cmake -S "$STAGE" -B "$STAGE/build" -DCMAKE_PREFIX_PATH="$STAGE/prefix" >/dev/null
    cmake --build "$STAGE/build" >/dev/null
    LD_LIBRARY_PATH=$LIBDIR "$STAGE/build/app"
fi

step "ctest (-j2)"
LOG=$BUILD/ctest.log
CTEST_RC=0
ctest --test-dir "$BUILD" --output-on-failure -j2 --timeout 900 2>&1 | tee "$LOG" || CTEST_RC=$?

FAILED=0
[ "$CTEST_RC" -eq 0 ] || FAILED=1
if [ $SANITIZE -eq 1 ] && grep -qE 'runtime error:|ERROR: AddressSanitizer|ERROR: LeakSanitizer' "$LOG"; then
    echo "== sanitizer reports found in $LOG:"
    grep -nE 'runtime error:|ERROR: AddressSanitizer|ERROR: LeakSanitizer' "$LOG" | head -20
    FAILED=1
fi

step "host root check"
NEW=()
for p in "${HOST_PATHS[@]}"; do
    if { [ -e "$p" ] || [ -L "$p" ]; } && [ -z "${EXISTED_BEFORE[$p]:-}" ]; then NEW+=("$p"); fi
done
SNAPSHOT_NEW=$(comm -13 <(echo "$SNAPSHOT_BEFORE") <(snapshot_host))
if [ -n "$SNAPSHOT_NEW" ]; then
    NEW+=($SNAPSHOT_NEW)
fi
if [ ${#NEW[@]} -ne 0 ]; then
    echo "host root changed: the run created ${NEW[*]}"
    FAILED=1
else
    echo "host root unchanged (${#HOST_PATHS[@]} appliance paths and the entries of / /etc /run /var/log /var/lib/dpkg/info /usr checked)"
fi

ELAPSED=$((SECONDS - START))
if [ $FAILED -eq 0 ]; then
    echo "test.sh: $MODE PASSED in ${ELAPSED}s (log: $LOG)"
else
    echo "test.sh: $MODE FAILED in ${ELAPSED}s (log: $LOG)"
    exit 1
fi
