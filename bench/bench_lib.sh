# shellcheck shell=bash
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

# kyto_bench_start_server ROOT: serves ROOT with the tests' update server on loopback (inside
# the sandbox), sets SERVER_PID and PORT.  kyto_bench_stop_server stops it (for an EXIT trap).
kyto_bench_start_server() {
    local port_file
    port_file=$(mktemp)
    python3 "$SRC/tests/support/update_server.py" "$1" >"$port_file" &
    SERVER_PID=$!
    for _ in $(seq 100); do
        [ -s "$port_file" ] && break
        sleep 0.1
    done
    # shellcheck disable=SC2034 # read by the sourcing script
    PORT=$(head -n1 "$port_file")
    rm -f "$port_file"
}

kyto_bench_stop_server() {
    kill "$SERVER_PID" 2>/dev/null
    wait "$SERVER_PID" 2>/dev/null || true
}
