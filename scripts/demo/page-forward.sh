#!/bin/bash
# Brings the update page, which nginx serves on the appliance's own loopback inside the
# sandbox, to the host's loopback for a browser on this machine: socat listens on
# 127.0.0.1:PORT and hands each connection, through nsenter into the sandbox's network, to
# the page's port.  Waits for the page to answer first; runs until it is killed or the
# sandbox ends.  Run by demo.sh --page.
#   page-forward.sh SANDBOX_PID PORT
set -euo pipefail
PID=$1
PORT=$2
for _ in $(seq 1200); do
    kill -0 "$PID" 2>/dev/null || exit 1
    if [ "$(readlink /proc/"$PID"/ns/net)" != "$(readlink /proc/self/ns/net)" ] &&
        nsenter -t "$PID" -n bash -c "exec 3<>/dev/tcp/127.0.0.1/$PORT" 2>/dev/null; then
        echo "== the update page: open http://127.0.0.1:$PORT/ in a browser on this machine" \
            "(Ctrl-C ends the appliance)"
        exec socat TCP-LISTEN:"$PORT",bind=127.0.0.1,reuseaddr,fork \
            EXEC:"nsenter -t $PID -n socat STDIO TCP\\:127.0.0.1\\:$PORT"
    fi
    sleep 0.5
done
echo "page-forward.sh: the page did not answer in the sandbox" >&2
exit 1
