#!/usr/bin/python3
"""Loopback update server for the tests.

Usage: update_server.py ROOT

Listens on 127.0.0.1 on a port chosen by the kernel and prints that port on its own line
on stdout once it accepts connections.  Serves the files under ROOT (the query string is
ignored when a path is matched).  Two files in ROOT steer it:

  .control.json  re-read on every request:
                 {"fail": {"/path": {"status": 503, "times": 2}},   # times < 0: always
                  "slow": {"/path": 4096},                          # bytes per second
                  "truncate": {"/path": 10},   # send 10 body bytes, then close
                  "stall": {"/path": 10}}      # send 10 body bytes, hang, then close
  .requests.log  one JSON object per request, appended before the answer is sent:
                 {"method", "path", "query", "user_agent", "status"}

Every answer carries Content-Length.  Bodies are streamed from disk in blocks, so large
files never sit in memory; slow paths are sent in small flushed chunks so that a client
can be stopped in the middle of a transfer.  "Range: bytes=N-[M]" is honoured.
"""

import json
import os
import re
import sys
import threading
import time
import urllib.parse
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer

CONTROL = ".control.json"
REQUEST_LOG = ".requests.log"
BLOCK = 1 << 16
STALL_SECONDS = 3  # a hung server that finally drops the connection

_lock = threading.Lock()


def _read_control(root):
    try:
        with open(os.path.join(root, CONTROL), "r", encoding="utf-8") as f:
            return json.load(f)
    except (OSError, ValueError):
        return {}


def _write_control(root, control):
    tmp = os.path.join(root, CONTROL + ".srv.tmp")
    with open(tmp, "w", encoding="utf-8") as f:
        json.dump(control, f)
    os.replace(tmp, os.path.join(root, CONTROL))


class Handler(BaseHTTPRequestHandler):
    server_version = "KytoTestUpdateServer/1.0"

    def log_message(self, fmt, *args):  # keep the test output clean
        pass

    def do_GET(self):
        self._serve(send_body=True)

    def do_HEAD(self):
        self._serve(send_body=False)

    # ---- helpers ------------------------------------------------------------------------

    def _record(self, path, query, status):
        entry = {
            "method": self.command,
            "path": path,
            "query": query,
            "user_agent": self.headers.get("User-Agent", ""),
            "status": status,
        }
        line = json.dumps(entry) + "\n"
        with _lock:
            with open(os.path.join(self.server.root, REQUEST_LOG), "a", encoding="utf-8") as f:
                f.write(line)

    def _forced_status(self, path):
        """Status override for path, counting down its remaining uses."""
        with _lock:
            control = _read_control(self.server.root)
            rule = control.get("fail", {}).get(path)
            if not rule:
                return None
            times = int(rule.get("times", -1))
            if times == 0:
                return None
            if times > 0:
                rule["times"] = times - 1
                _write_control(self.server.root, control)
            return int(rule.get("status", 500))

    def _send_simple(self, status, text, send_body):
        body = text.encode("utf-8")
        self.send_response(status)
        self.send_header("Content-Type", "text/plain")
        self.send_header("Content-Length", str(len(body)))
        self.end_headers()
        if send_body:
            self.wfile.write(body)

    def _serve(self, send_body):
        split = urllib.parse.urlsplit(self.path)
        path = urllib.parse.unquote(split.path)
        query = split.query

        forced = self._forced_status(path)
        if forced is not None:
            self._record(path, query, forced)
            self._send_simple(forced, "forced status %d\n" % forced, send_body)
            return

        local = os.path.normpath(os.path.join(self.server.root, path.lstrip("/")))
        if not local.startswith(self.server.root + os.sep) or not os.path.isfile(local):
            self._record(path, query, 404)
            self._send_simple(404, "not found\n", send_body)
            return

        size = os.path.getsize(local)
        start, end, status = 0, size - 1, 200
        rng = self.headers.get("Range")
        m = re.fullmatch(r"bytes=(\d+)-(\d*)", rng.strip()) if rng else None
        if m:
            start = int(m.group(1))
            if m.group(2):
                end = min(int(m.group(2)), size - 1)
            if start >= size or start > end:
                self._record(path, query, 416)
                self.send_response(416)
                self.send_header("Content-Range", "bytes */%d" % size)
                self.send_header("Content-Length", "0")
                self.end_headers()
                return
            status = 206
        length = end - start + 1 if size else 0

        control = _read_control(self.server.root)
        rate = control.get("slow", {}).get(path)
        cut = control.get("truncate", {}).get(path)
        stall = control.get("stall", {}).get(path)
        self._record(path, query, status)
        self.send_response(status)
        self.send_header("Content-Type", "application/octet-stream")
        self.send_header("Content-Length", str(length))
        if status == 206:
            self.send_header("Content-Range", "bytes %d-%d/%d" % (start, end, size))
        self.end_headers()
        if not send_body:
            return
        try:
            with open(local, "rb") as f:
                f.seek(start)
                if cut is not None or stall is not None:
                    # The announced length is never reached: a broken or hung server.
                    self._stream(f, min(length, int(cut if cut is not None else stall)), rate)
                    self.wfile.flush()
                    if stall is not None:
                        time.sleep(STALL_SECONDS)
                    self.close_connection = True
                    return
                self._stream(f, length, rate)
        except (BrokenPipeError, ConnectionResetError):
            pass  # the client went away (cancelled download)

    def _stream(self, f, length, rate):
        if rate and int(rate) > 0:
            rate = int(rate)
            # Twenty chunks a second, at least one byte each.
            chunk = max(1, rate // 20)
            pause = chunk / float(rate)
        else:
            chunk, pause = BLOCK, 0.0
        left = length
        while left > 0:
            data = f.read(min(chunk, left))
            if not data:
                break
            self.wfile.write(data)
            self.wfile.flush()
            left -= len(data)
            if pause:
                time.sleep(pause)


class Server(ThreadingHTTPServer):
    daemon_threads = True
    allow_reuse_address = True


def main():
    if len(sys.argv) != 2:
        sys.stderr.write("usage: update_server.py ROOT\n")
        return 2
    root = os.path.realpath(sys.argv[1])
    server = Server(("127.0.0.1", 0), Handler)
    server.root = root
    sys.stdout.write("%d\n" % server.server_address[1])
    sys.stdout.flush()
    server.serve_forever(poll_interval=0.2)
    return 0


if __name__ == "__main__":
    sys.exit(main())
