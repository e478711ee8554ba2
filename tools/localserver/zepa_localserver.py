#!/usr/bin/env python3
"""Local HTTP and HTTPS server for tests and demos (loopback only).

Serves plain HTTP and HTTPS on 127.0.0.1, each on a port chosen by the
kernel, with a certificate signed by a throwaway CA made at start-up with the
openssl command line tool. Once both are listening it writes

    {"http_port": N, "https_port": M, "ca_file": "...", "pid": P}

to the --ready-file (written to a temporary name, then renamed).

Routes come from every routes_*.py module beside this file (or in
--routes-dir). A module either defines register(server), which calls
server.route(path, handler, methods=None), or a table ROUTES = {path: handler}.
A handler takes a Req and returns a Reply (see below); route modules import
them with "from zepa_localserver import Req, Reply, json_reply, text_reply".
A handler may keep state in server.state (a dict, guarded by server.lock when
needed), register reset hooks with server.on_reset(func), and sleep with
server.wait(seconds), which returns True early when the server stops.

Control API (never recorded):
  GET  /_control/ping                  -> {"ok": true}
  POST /_control/script                -> queue scripted answers for a path, body:
         {"path": "/x", "count": 1, "status": 503, "body": "text",
          "body_base64": "...", "json": {...}, "headers": {"K": "V"},
          "action": "reply" | "hang" | "close" | "reset" | "stream",
          "seconds": 0.5, "size": 1073741824}
       "hang" waits `seconds` (default 30, cut short by shutdown), then closes
       without an answer; "close" closes at once without an answer; "reset"
       closes with a TCP reset; "reply" (the default) answers after `seconds`
       (default 0); "stream" answers `size` bytes: the body given, repeated,
       written piece by piece so that a gigabyte costs the server nothing
       (it stops when the client hangs up).
  GET  /_control/requests[?path=/x][&since=SEQ]
                                       -> {"requests": [record, ...], "dropped": D, "refusals": [...]}
                                          in arrival order (records after SEQ only, when given)
  POST /_control/reset                 -> forgets records and scripts, runs reset hooks
  POST /_control/refuse {"scheme": "https" | "http", "on": bool, "seconds": S}
       stops listening on that port while keeping it bound, so that every
       connection is refused (as by a server that is down), until called
       with "on": false or, when given, for S seconds; answers the time it
       took effect. The other port (and its control API) keeps serving.

A record: {"seq", "scheme", "method", "target" (the raw request target),
"path", "query", "has_query", "request_line_base64" (the request line's
exact bytes), "version", "headers": [[name, value], ...] in wire order
(latin-1),
"body_base64", "body_latin1", "body_length", "client_port", "time" (arrival,
Unix seconds), and once answered "answer_time", "answer_status" (the HTTP
status, or the action: "hang", "close", "reset") and "answer_latin1" (the
first 512 bytes of the answer's body)}. At most --max-records are kept (the
oldest go first; "dropped" counts them).

SIGTERM and SIGINT stop the server cleanly (exit status 0).
"""

import argparse
import base64
import collections
import glob
import importlib.util
import json
import os
import signal
import socket
import ssl
import struct
import subprocess
import sys
import tempfile
import threading
import time
import urllib.parse
from http.server import BaseHTTPRequestHandler, ThreadingHTTPServer

# Route modules are loaded from the source tree: leave no bytecode there.
sys.dont_write_bytecode = True

CONTROL_PREFIX = "/_control/"
# Records kept for the control API: a fleet of daemons runs for hours, the
# server must not grow without bound.
DEFAULT_MAX_RECORDS = 50000
# Pending connections the kernel holds for each listener: a fleet that
# connects at the same moment must not see dropped handshakes.
LISTEN_BACKLOG = 1024
ANSWER_EXCERPT = 512


class Req:
    """One received request, as handlers see it."""

    def __init__(self, handler, scheme, body):
        self.method = handler.command
        self.target = handler.path
        split = urllib.parse.urlsplit(handler.path)
        self.path = split.path
        self.query = split.query
        self.has_query = "?" in handler.path
        self.version = handler.request_version
        self.headers = [[k, v] for k, v in handler.headers.items()]
        self.body = body
        self.scheme = scheme
        self.time = time.time()
        self.client_port = handler.client_address[1]
        # The request line as received, for byte-exact checks of the target.
        self.request_line = handler.raw_requestline.rstrip(b"\r\n")

    def header(self, name, default=None):
        lname = name.lower()
        for k, v in self.headers:
            if k.lower() == lname:
                return v
        return default

    def params(self):
        """Query parameters as a dict of last values."""
        return dict(urllib.parse.parse_qsl(self.query, keep_blank_values=True))

    def form(self):
        """Form-encoded body as a dict of last values."""
        text = self.body.decode("latin-1")
        return dict(urllib.parse.parse_qsl(text, keep_blank_values=True))

    def json(self):
        return json.loads(self.body.decode("utf-8"))

    def record(self):
        return {
            "scheme": self.scheme,
            "method": self.method,
            "target": self.target,
            "path": self.path,
            "query": self.query,
            "has_query": self.has_query,
            "request_line_base64": base64.b64encode(self.request_line).decode("ascii"),
            "version": self.version,
            "headers": self.headers,
            "body_base64": base64.b64encode(self.body).decode("ascii"),
            "body_latin1": self.body.decode("latin-1"),
            "body_length": len(self.body),
            "client_port": self.client_port,
            "time": self.time,
        }


class Reply:
    """An answer: status, body (bytes, str or a JSON-able object), headers.

    action: "reply", "hang" (wait `seconds`, then close without answering),
    "close" (close without answering) or "reset" (close with a TCP reset).
    For "reply", `seconds` delays the answer.
    """

    def __init__(self, status=200, body=b"", headers=None, action="reply", seconds=0.0, content_type=None,
                 size=0):
        self.status = status
        self.size = size
        if isinstance(body, (dict, list)):
            body = json.dumps(body).encode("utf-8")
            content_type = content_type or "application/json"
        elif isinstance(body, str):
            body = body.encode("utf-8")
        self.body = body
        self.headers = list((headers or {}).items()) if isinstance(headers, dict) else list(headers or [])
        self.action = action
        self.seconds = seconds
        if content_type and not any(k.lower() == "content-type" for k, _ in self.headers):
            self.headers.append(("Content-Type", content_type))


def json_reply(obj, status=200, headers=None):
    return Reply(status, json.dumps(obj).encode("utf-8"), headers, content_type="application/json")


def text_reply(text, status=200, headers=None):
    return Reply(status, text, headers, content_type="text/plain")


def _script_reply(plan):
    body = b""
    if "json" in plan:
        body = json.dumps(plan["json"]).encode("utf-8")
    elif "body_base64" in plan:
        body = base64.b64decode(plan["body_base64"])
    elif "body" in plan:
        body = plan["body"].encode("utf-8")
    action = plan.get("action", "reply")
    seconds = float(plan.get("seconds", 30.0 if action == "hang" else 0.0))
    return Reply(int(plan.get("status", 200)), body, plan.get("headers") or {}, action, seconds,
                 size=int(plan.get("size", 0)))


class LocalServer:
    """Route table, scripts and request records shared by both listeners."""

    def __init__(self):
        self.lock = threading.Lock()
        self.routes = {}
        self.scripts = {}
        self.records = collections.deque()
        self.max_records = DEFAULT_MAX_RECORDS
        self.dropped = 0
        self.next_seq = 1
        # When a listener refused connections: [{"scheme", "from", "to"}].
        self.refusals = []
        self.listeners = {}
        self.state = {}
        self.reset_hooks = []
        self.stopping = threading.Event()
        self.http_port = 0
        self.https_port = 0
        self.ca_file = ""
        self.fallbacks = []
        # The relay's VPN side (relay_world.RelayWorld) when started with --relay.
        self.relay = None
        # Seconds added to the time in every Date header (--clock-offset).
        self.clock_offset = 0.0

    # ---- extension interface ------------------------------------------------
    def route(self, path, handler, methods=None):
        """Serve path (exact match, no query) with handler(req) -> Reply."""
        self.routes[path] = (handler, set(m.upper() for m in methods) if methods else None)

    def fallback(self, handler):
        """handler(req) -> Reply or None, asked in order for a path no route serves."""
        self.fallbacks.append(handler)

    def on_reset(self, func):
        """func() runs on POST /_control/reset."""
        self.reset_hooks.append(func)

    def wait(self, seconds):
        """Sleeps up to seconds; returns early (True) when the server stops."""
        return self.stopping.wait(seconds)

    def requests(self, path=None, since=0):
        with self.lock:
            return [dict(r) for r in self.records
                    if (path is None or r["path"] == path) and r["seq"] > since]

    # ---- dispatch -----------------------------------------------------------
    def record(self, req):
        with self.lock:
            rec = req.record()
            rec["seq"] = self.next_seq
            self.next_seq += 1
            self.records.append(rec)
            while len(self.records) > self.max_records:
                self.records.popleft()
                self.dropped += 1
            return rec

    def answered(self, rec, reply):
        """Notes on the record what the request got."""
        if rec is None:
            return
        with self.lock:
            rec["answer_time"] = time.time()
            rec["answer_status"] = reply.status if reply.action in ("reply", "stream") else reply.action
            body = reply.body if isinstance(reply.body, bytes) else b""
            rec["answer_latin1"] = body[:ANSWER_EXCERPT].decode("latin-1")

    def refuse(self, scheme, on, seconds=0.0):
        """Stops (or resumes) accepting on the listener of scheme; the time it took effect."""
        listener = self.listeners.get(scheme)
        if listener is None:
            return None
        with listener.refuse_lock:
            if on and not listener.refusing:
                listener.stop_listening()
                with self.lock:
                    self.refusals.append({"scheme": scheme, "from": time.time(), "to": None})
            elif not on and listener.refusing:
                with self.lock:
                    for r in self.refusals:
                        if r["scheme"] == scheme and r["to"] is None:
                            r["to"] = time.time()
                listener.resume_listening()
            listener.refuse_generation += 1
            generation = listener.refuse_generation
            took_effect = time.time()
        if on and seconds > 0:
            def back():
                if not self.wait(seconds):
                    with listener.refuse_lock:
                        if listener.refuse_generation != generation:
                            return
                    self.refuse(scheme, False)
            threading.Thread(target=back, daemon=True).start()
        return took_effect

    def take_script(self, path):
        with self.lock:
            queue = self.scripts.get(path)
            if not queue:
                return None
            plan = queue[0]
            plan["count"] -= 1
            if plan["count"] <= 0:
                queue.pop(0)
            return _script_reply(plan)

    def dispatch(self, req):
        if req.path.startswith(CONTROL_PREFIX):
            return self.control(req)
        self.record(req)
        return self.route_reply(req)

    def route_reply(self, req):
        scripted = self.take_script(req.path)
        if scripted is not None:
            return scripted
        entry = self.routes.get(req.path)
        if entry is None:
            for handler in self.fallbacks:
                reply = handler(req)
                if reply is not None:
                    return reply
            return text_reply("no route for %s\n" % req.path, 404)
        handler, methods = entry
        if methods is not None and req.method not in methods:
            return text_reply("method not allowed\n", 405)
        return handler(req)

    def control(self, req):
        name = req.path[len(CONTROL_PREFIX):]
        if name == "ping":
            return json_reply({"ok": True})
        if name == "script" and req.method == "POST":
            plan = req.json()
            if "path" not in plan:
                return json_reply({"ok": False, "error": "path missing"}, 400)
            plan["count"] = int(plan.get("count", 1))
            with self.lock:
                self.scripts.setdefault(plan["path"], []).append(plan)
            return json_reply({"ok": True})
        if name == "requests":
            params = req.params()
            try:
                since = int(params.get("since", "0"))
            except ValueError:
                return json_reply({"ok": False, "error": "since is a record number"}, 400)
            records = self.requests(params.get("path"), since)
            with self.lock:
                return json_reply({"requests": records, "dropped": self.dropped,
                                   "refusals": [dict(r) for r in self.refusals]})
        if name == "refuse" and req.method == "POST":
            try:
                plan = req.json()
                seconds = float(plan.get("seconds", 0))
            except (ValueError, TypeError, AttributeError):
                return json_reply({"ok": False, "error": "body is {\"scheme\", \"on\", \"seconds\"}"}, 400)
            took_effect = self.refuse(plan.get("scheme"), bool(plan.get("on")), seconds)
            if took_effect is None:
                return json_reply({"ok": False, "error": "no listener for that scheme"}, 400)
            return json_reply({"ok": True, "time": took_effect})
        if name == "reset" and req.method == "POST":
            with self.lock:
                self.records.clear()
                self.dropped = 0
                self.refusals = []
                self.scripts = {}
            for hook in self.reset_hooks:
                hook()
            return json_reply({"ok": True})
        return json_reply({"ok": False, "error": "unknown control " + name}, 404)


class Handler(BaseHTTPRequestHandler):
    protocol_version = "HTTP/1.1"
    server_version = "ZepaLocal/1.0"
    scheme = "http"
    # Headers and body go out in separate writes: without TCP_NODELAY the body
    # waits for the client's delayed ACK (about 40 ms per answer).
    disable_nagle_algorithm = True

    def date_time_string(self, timestamp=None):
        if timestamp is None:
            timestamp = time.time()
        return super().date_time_string(timestamp + self.server.app.clock_offset)

    def log_message(self, fmt, *args):
        if self.server.app.verbose:
            sys.stderr.write("localserver: %s\n" % (fmt % args))

    def _read_body(self):
        length = self.headers.get("Content-Length")
        if length is not None:
            return self.rfile.read(int(length))
        if self.headers.get("Transfer-Encoding", "").lower() == "chunked":
            body = b""
            while True:
                size = int(self.rfile.readline().split(b";")[0].strip(), 16)
                if size == 0:
                    self.rfile.readline()
                    return body
                body += self.rfile.read(size)
                self.rfile.readline()
        return b""

    def _handle(self):
        app = self.server.app
        req = Req(self, self.scheme, self._read_body())
        rec = None
        try:
            if req.path.startswith(CONTROL_PREFIX):
                reply = app.control(req)
            else:
                rec = app.record(req)
                reply = app.route_reply(req)
        except Exception as exc:  # a broken route answers 500, the server lives on
            reply = text_reply("route failed: %r\n" % (exc,), 500)
        app.answered(rec, reply)
        self._send(reply)

    def _send(self, reply):
        app = self.server.app
        if reply.action == "hang":
            app.wait(reply.seconds)
            self.close_connection = True
            return
        if reply.action == "close":
            self.close_connection = True
            return
        if reply.action == "reset":
            # Linger 0 and an immediate close: a RST without a FIN before it.
            self.connection.setsockopt(socket.SOL_SOCKET, socket.SO_LINGER, struct.pack("ii", 1, 0))
            os.close(self.connection.detach())
            self.close_connection = True
            return
        if reply.seconds > 0 and app.wait(reply.seconds):
            self.close_connection = True
            return
        if reply.action == "stream":
            self._stream(reply)
            return
        self.send_response(reply.status)
        names = set()
        for k, v in reply.headers:
            self.send_header(k, v)
            names.add(k.lower())
        if "content-length" not in names:
            self.send_header("Content-Length", str(len(reply.body)))
        self.end_headers()
        if self.command != "HEAD":
            try:
                self.wfile.write(reply.body)
            except (BrokenPipeError, ConnectionResetError, ssl.SSLError):
                self.close_connection = True

    def _stream(self, reply):
        self.close_connection = True
        self.send_response(reply.status)
        for k, v in reply.headers:
            self.send_header(k, v)
        self.send_header("Content-Length", str(reply.size))
        self.end_headers()
        piece = (reply.body or b"x") * max(1, 65536 // max(1, len(reply.body or b"x")))
        left = reply.size
        try:
            while left > 0 and not self.server.app.stopping.is_set():
                chunk = piece[:left]
                self.wfile.write(chunk)
                left -= len(chunk)
        except (BrokenPipeError, ConnectionResetError, ssl.SSLError, OSError):
            pass

    do_GET = _handle
    do_POST = _handle
    do_PUT = _handle
    do_DELETE = _handle
    do_HEAD = _handle
    do_PATCH = _handle


class HttpsHandler(Handler):
    scheme = "https"


class Listener(ThreadingHTTPServer):
    daemon_threads = True
    allow_reuse_address = True
    request_queue_size = LISTEN_BACKLOG

    def __init__(self, app, handler, ssl_context=None):
        super().__init__(("127.0.0.1", 0), handler)
        self.app = app
        self.ssl_context = ssl_context
        self.refuse_lock = threading.Lock()
        self.refusing = False
        self.refuse_generation = 0
        self.thread = None

    def server_bind(self):
        # The port is bound by its number, not as "any port": a listener that
        # stops listening (refuse) keeps such a port, and gets it back.
        self.socket.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
        for _ in range(20):
            probe = socket.socket(socket.AF_INET, socket.SOCK_STREAM)
            probe.bind(("127.0.0.1", 0))
            port = probe.getsockname()[1]
            probe.close()
            try:
                self.socket.bind(("127.0.0.1", port))
                break
            except OSError:
                continue
        else:
            self.socket.bind(self.server_address)
        self.server_address = self.socket.getsockname()

    def start(self):
        self.thread = threading.Thread(target=self.serve_forever, kwargs={"poll_interval": 0.1}, daemon=True)
        self.thread.start()

    def stop_listening(self):
        """The accept loop ends and the socket stops listening (port kept):
        connections are refused. Those the kernel had queued are reset."""
        self.shutdown()
        self.socket.shutdown(socket.SHUT_RD)
        self.refusing = True

    def resume_listening(self):
        self.socket.listen(self.request_queue_size)
        self.refusing = False
        self.start()

    def get_request(self):
        sock, addr = super().get_request()
        if self.ssl_context is not None:
            # The handshake runs in the request thread, so a client that never
            # speaks TLS cannot block the listener.
            sock = self.ssl_context.wrap_socket(sock, server_side=True, do_handshake_on_connect=False)
        return sock, addr

    def finish_request(self, request, client_address):
        if isinstance(request, ssl.SSLSocket):
            try:
                request.settimeout(10)
                request.do_handshake()
                request.settimeout(None)
            except (ssl.SSLError, OSError):
                return
        super().finish_request(request, client_address)

    def handle_error(self, request, client_address):
        if self.app.verbose:
            super().handle_error(request, client_address)


def _openssl(*args):
    subprocess.run(["openssl"] + list(args), check=True, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE)


def make_certificates(cert_dir):
    """Throwaway CA and a server certificate for 127.0.0.1 and localhost."""
    os.makedirs(cert_dir, exist_ok=True)
    ca_key = os.path.join(cert_dir, "ca.key")
    ca_crt = os.path.join(cert_dir, "ca.crt")
    key = os.path.join(cert_dir, "server.key")
    csr = os.path.join(cert_dir, "server.csr")
    crt = os.path.join(cert_dir, "server.crt")
    ext = os.path.join(cert_dir, "server.ext")
    ec = ["-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:prime256v1", "-nodes"]
    _openssl("req", "-x509", *ec, "-keyout", ca_key, "-out", ca_crt, "-days", "2",
             "-subj", "/CN=Zepa Local Test CA",
             "-addext", "basicConstraints=critical,CA:TRUE",
             "-addext", "keyUsage=critical,keyCertSign,cRLSign")
    _openssl("req", "-new", *ec, "-keyout", key, "-out", csr, "-subj", "/CN=localhost")
    with open(ext, "w") as f:
        f.write("subjectAltName=IP:127.0.0.1,DNS:localhost\n"
                "basicConstraints=CA:FALSE\n"
                "keyUsage=critical,digitalSignature,keyEncipherment\n"
                "extendedKeyUsage=serverAuth\n")
    _openssl("x509", "-req", "-in", csr, "-CA", ca_crt, "-CAkey", ca_key, "-set_serial",
             str(int.from_bytes(os.urandom(8), "big")), "-days", "2", "-out", crt, "-extfile", ext)
    return ca_crt, crt, key


def load_routes(app, routes_dir):
    # Route modules import Reply and the helpers from "zepa_localserver": let
    # that name mean this very module when it runs as the program.
    sys.modules.setdefault("zepa_localserver", sys.modules[__name__])
    for path in sorted(glob.glob(os.path.join(routes_dir, "routes_*.py"))):
        name = "zepa_" + os.path.splitext(os.path.basename(path))[0]
        plan = importlib.util.spec_from_file_location(name, path)
        module = importlib.util.module_from_spec(plan)
        sys.modules[name] = module
        plan.loader.exec_module(module)
        if hasattr(module, "register"):
            module.register(app)
        for route_path, handler in getattr(module, "ROUTES", {}).items():
            app.route(route_path, handler)


def _watch_owner(pid, stop):
    """Sets stop once process pid is gone (or a zombie)."""
    while not stop.wait(0.2):
        try:
            with open("/proc/%d/stat" % pid) as f:
                state = f.read().rsplit(")", 1)[1].split()[0]
        except (OSError, IndexError):
            state = "gone"
        if state in ("Z", "X", "gone"):
            stop.set()


def write_ready(path, info):
    tmp = "%s.tmp.%d" % (path, os.getpid())
    with open(tmp, "w") as f:
        json.dump(info, f)
    os.rename(tmp, path)


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__.split("\n")[0])
    parser.add_argument("--ready-file", required=True, help="where the chosen ports are written as JSON")
    parser.add_argument("--cert-dir", help="where the throwaway CA and server certificate go "
                        "(default: a temporary folder removed at exit)")
    parser.add_argument("--routes-dir", default=os.path.dirname(os.path.abspath(__file__)),
                        help="folder of routes_*.py modules (default: beside this program)")
    parser.add_argument("--no-https", action="store_true", help="serve plain HTTP only")
    parser.add_argument("--verbose", action="store_true", help="log every request to standard error")
    parser.add_argument("--relay", metavar="NAME", help="also run the relay's VPN side (root): network "
                        "namespaces zepa-NAME-r and zepa-NAME-a, openvpn servers, the appliance's web service")
    parser.add_argument("--relay-dir", help="work folder of the relay's VPN side (default: a temporary "
                        "folder removed at exit)")
    parser.add_argument("--owner-pid", type=int, default=0, help="stop (as on SIGTERM) once this process is "
                        "gone, so that a test killed midway leaves no server, openvpn or namespace behind")
    parser.add_argument("--clock-offset", type=float, default=0.0, metavar="SECONDS",
                        help="shift the time of every Date header by SECONDS (a server with a wrong clock)")
    parser.add_argument("--max-records", type=int, default=DEFAULT_MAX_RECORDS, metavar="N",
                        help="request records kept for the control API; the oldest go first (default %(default)s)")
    args = parser.parse_args(argv)
    if args.max_records < 1:
        parser.error("--max-records wants at least 1")

    # A stop request may come at any moment, even while the certificates are
    # made: it ends the server quietly, never with a traceback.
    stop = threading.Event()

    def on_signal(signum, frame):
        stop.set()

    signal.signal(signal.SIGTERM, on_signal)
    signal.signal(signal.SIGINT, on_signal)
    if args.owner_pid > 0:
        threading.Thread(target=_watch_owner, args=(args.owner_pid, stop), daemon=True).start()

    app = LocalServer()
    app.verbose = args.verbose
    app.clock_offset = args.clock_offset
    app.max_records = args.max_records
    relay_temp = None
    if args.relay:
        import relay_world
        relay_dir = args.relay_dir
        if relay_dir is None:
            relay_temp = tempfile.TemporaryDirectory(prefix="zepa_relay_")
            relay_dir = relay_temp.name
        app.relay = relay_world.RelayWorld(args.relay, relay_dir, args.verbose)
        try:
            app.relay.start()
            if stop.is_set():
                raise relay_world.RelayWorldError("stopped during set-up")
        except (relay_world.RelayWorldError, OSError, subprocess.SubprocessError) as exc:
            app.relay.close()
            sys.stderr.write("localserver: the relay side could not start: %s\n" % exc)
            return 3
    load_routes(app, args.routes_dir)

    temp_dir = None
    cert_dir = args.cert_dir
    if cert_dir is None and not args.no_https:
        temp_dir = tempfile.TemporaryDirectory(prefix="zepa_localserver_")
        cert_dir = temp_dir.name

    listeners = [Listener(app, Handler)]
    if not args.no_https:
        ca_crt, crt, key = make_certificates(cert_dir)
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
        context.load_cert_chain(crt, key)
        listeners.append(Listener(app, HttpsHandler, context))
        app.ca_file = ca_crt
        app.https_port = listeners[1].server_address[1]
    app.http_port = listeners[0].server_address[1]
    app.listeners = {"http": listeners[0]}
    if len(listeners) > 1:
        app.listeners["https"] = listeners[1]
    for l in listeners:
        l.start()

    ready = {"http_port": app.http_port, "https_port": app.https_port, "ca_file": app.ca_file,
             "pid": os.getpid()}
    if app.relay is not None:
        ready["relay"] = app.relay.info()
    write_ready(args.ready_file, ready)
    while not stop.wait(0.2):
        pass

    app.stopping.set()
    for l in listeners:
        with l.refuse_lock:
            if not l.refusing:
                l.shutdown()
            l.server_close()
    if app.relay is not None:
        app.relay.close()
    if relay_temp is not None:
        relay_temp.cleanup()
    if temp_dir is not None:
        temp_dir.cleanup()
    return 0


if __name__ == "__main__":
    try:
        sys.exit(main())
    except KeyboardInterrupt:  # before main() could take over SIGINT
        sys.exit(130)
