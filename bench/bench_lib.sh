# Shared by the benchmark scripts (sourced, not run).
#
# kyto_bench_enter_sandbox SCRIPT "TARGETS" ARGS...: builds the Release tree build-bench/ with
# the sandbox launcher and TARGETS, then re-runs SCRIPT as "SCRIPT --inside BUILD ARGS..."
# inside a test sandbox, so that no fixed appliance path of this machine is touched.  Does not
# return.
kyto_bench_enter_sandbox() {
    local script=$1 targets=$2
    shift 2
    local build="$SRC/build-bench"
    cmake -S "$SRC" -B "$build" -DCMAKE_BUILD_TYPE=Release -DKYTO_BUILD_BENCH=ON >/dev/null
    # shellcheck disable=SC2086
    cmake --build "$build" -j2 --target kyto-sandbox $targets >/dev/null
    exec "$build/tests/kyto-sandbox" /bin/bash "$script" --inside "$build" "$@"
}
