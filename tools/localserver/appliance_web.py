"""The appliance's web UI, as far as the relay tests need it.

    python3 appliance_web.py --port 5000 --ready-file FILE [--name NAME]

Serves, on every address of its network namespace:
  GET /            a small HTML page naming the appliance
  GET /big?size=N  N bytes (at most 64 MiB, 1 MiB by default), for throughput
  GET /echo...     the request line and headers as text
Anything else answers 404. Writes "ready" to the ready file once listening;
SIGTERM stops it.
"""

import argparse
import os
import signal
import sys
import threading
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer
from urllib.parse import parse_qs, urlsplit

PAGE = ("<!DOCTYPE html>\n<html><head><title>%(name)s - Management</title></head>\n"
        "<body><h1>%(name)s</h1><p>appliance web UI: you reached the management page.</p></body></html>\n")
MAX_BIG = 64 << 20


class Handler(BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"
    server_version = "ZepaApplianceWeb/1.0"

    def log_message(self, fmt, *args):
        pass

    def do_GET(self):
        url = urlsplit(self.path)
        if url.path == "/":
            self._send(200, (PAGE % {"name": self.server.appliance_name}).encode(), "text/html; charset=utf-8")
        elif url.path == "/big":
            try:
                size = int(parse_qs(url.query).get("size", ["1048576"])[0])
            except ValueError:
                size = -1
            if size < 0 or size > MAX_BIG:
                self._send(400, b"bad size\n", "text/plain")
                return
            self._send_big(size)
        elif url.path.startswith("/echo"):
            text = self.requestline + "\n" + "".join("%s: %s\n" % kv for kv in self.headers.items())
            self._send(200, text.encode("latin-1", "replace"), "text/plain")
        else:
            self._send(404, b"not found\n", "text/plain")

    def _send(self, status, body, ctype):
        self.send_response(status)
        self.send_header("Content-Type", ctype)
        self.send_header("Content-Length", str(len(body)))
        self.end_headers()
        self.wfile.write(body)

    def _send_big(self, size):
        self.send_response(200)
        self.send_header("Content-Type", "application/octet-stream")
        self.send_header("Content-Length", str(size))
        self.end_headers()
        chunk = b"z" * 65536
        left = size
        while left > 0:
            n = min(left, len(chunk))
            self.wfile.write(chunk[:n])
            left -= n


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__.split("\n")[0])
    parser.add_argument("--port", type=int, default=5000)
    parser.add_argument("--ready-file", required=True)
    parser.add_argument("--name", default="ZS-220 staged appliance")
    args = parser.parse_args(argv)

    server = ThreadingHTTPServer(("0.0.0.0", args.port), Handler)
    server.daemon_threads = True
    server.appliance_name = args.name
    stop = threading.Event()
    signal.signal(signal.SIGTERM, lambda *a: stop.set())
    signal.signal(signal.SIGINT, lambda *a: stop.set())
    thread = threading.Thread(target=server.serve_forever, kwargs={"poll_interval": 0.1}, daemon=True)
    thread.start()
    tmp = args.ready_file + ".tmp"
    with open(tmp, "w") as f:
        f.write("ready\n")
    os.rename(tmp, args.ready_file)
    while not stop.wait(0.2):
        pass
    server.shutdown()
    server.server_close()
    return 0


if __name__ == "__main__":
    sys.exit(main())
