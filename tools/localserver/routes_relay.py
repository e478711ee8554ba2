"""Relay control server routes for the local test server.

The daemon registers itself with one JSON POST to the control server's page
(/Serv.php, the default page of a server section):

  {"command": "register", "serverID": "<id the device knows, may be empty>",
   "identity": {"serial", "mac", "model", "token", "key", "timezone"},
   "services": [{"id": "...", "name": "...", "port": N, "ext_port": M}, ...]}

Answers are JSON objects with an "errno" (the relay server's error numbers):

  * body not a JSON object, or no "command"            -> {"errno": 9}  (INPUT)
  * a command other than "register"                    -> {"errno": 3}  (NO_SUCH_API)
  * identity serial or token missing/empty, or
    "services" not a list                              -> {"errno": 9}  (INPUT)
  * the first token seen for a serial is that serial's
    token; a different token later                     -> {"errno": 2}  (AUTH)
  * otherwise                                          -> {"errno": 0, "serverID": "<id>", ...}

How the appliance is to be reached rides on the success answer:

  * the serial was marked reachable (POST /relay/admin/reachable)
        -> "connect": "direct"            (the daemon's state 4, no tunnel)
  * the relay's VPN side runs (--relay) and the serial is not reachable
        -> "connect": "tunnel", "tunnel": {"relay_ip", "relay_user", "relay_pass"}
           (the Tunnel section's JSON: the daemon opens a VPN tunnel to
           relay_ip, port 443, with that user and password; state 6 while up)
  * neither: no "connect" member (registered only, state 5)
  With a "connect" member (or once POST /relay/admin/heartbeat set one) the
  answer also carries "heartbeat": seconds until the daemon registers again.
  The relay user of a serial is "zr" + its id's digits and letters; its
  password is made on the first tunnel answer and kept until reset.

Reverse proxy (needs --relay): a request for /<alias>/<rest> (or any path
with a Host header whose first label is an alias) goes through the alias's
tunnel to the appliance's web service (port 5000) as /<rest>. The alias maps
to a serial through the alias server's book (routes_alias.py: the alias the
appliance mapped), or to a user directly through POST /relay/admin/grant; the
serial to its relay user; the user to the tunnel address its VPN client got
(recorded by the VPN server's connect script); an alias of a reachable
serial goes to the appliance's own address, no tunnel. Unknown alias: 404; an alias
without a tunnel: 502 "appliance not connected"; no answer through the
tunnel: 504.

Admin calls for tests and demos:
  POST /relay/admin/reachable {"serial", "reachable": bool}
  POST /relay/admin/heartbeat {"seconds": N}       (0: none)
  POST /relay/admin/grant {"user", "alias"?}       -> {"relay_ip", "relay_user", "relay_pass"}
  POST /relay/admin/grant {"alias", "direct": true}  the alias leads to the appliance's own
                                                   address, no tunnel (for comparisons)
  POST /relay/admin/block_udp {"on": bool}         UDP to the VPN port dropped
  POST /relay/admin/silence {"on": bool}           the VPN servers' answers dropped (silent relay)
  POST /relay/admin/link {"up": bool, "side"}      the link cut or restored at the "relay" end
                                                   (default; the appliance loses its carrier) or
                                                   the "appliance" end (it loses its route)
  POST /relay/admin/refuse {"on": bool}            the VPN servers refuse every password
  POST /relay/admin/vpn {"action": "stop" | "start"}   the VPN servers
  GET  /relay/admin/tunnels                        -> {"tunnels": {user: address}, "aliases": {...}}

The server id of a serial is made on its first registration and kept;
POST /relay/admin/reassign {"serial": S} gives S a fresh id (as when the relay
moves a device), which the next registration hands out. GET
/relay/admin/devices lists what each serial registered last (no secrets).
Failures such as other errno values, HTTP errors or hanging connections come
from the core's scripted answers (POST /_control/script), which take
precedence. State lives in memory until POST /_control/reset.
"""

import http.client
import json
import re
import socket
import sys

HOP_BY_HOP = {"connection", "keep-alive", "proxy-connection", "transfer-encoding", "upgrade", "te",
              "trailer", "host", "content-length", "server", "date"}
MAX_PROXIED = 80 << 20

PAGE = "/Serv.php"


class RelayBook:
    def __init__(self):
        self.reset()

    def reset(self):
        self.ids = {}
        self.tokens = {}
        self.devices = {}
        self.counter = 0
        self.reachable = {}
        self.passwords = {}
        self.users = {}
        self.granted_aliases = {}
        self.direct_aliases = set()
        self.heartbeat = None

    def new_id(self, serial):
        self.counter += 1
        self.ids[serial] = "ZR%04d-%s" % (self.counter, serial[-6:])
        return self.ids[serial]


def _register(book, body):
    identity = body.get("identity")
    services = body.get("services")
    if not isinstance(identity, dict) or not isinstance(services, list):
        return {"errno": 9}
    serial, token = identity.get("serial"), identity.get("token")
    if not serial or not token or not isinstance(serial, str):
        return {"errno": 9}
    if book.tokens.setdefault(serial, token) != token:
        return {"errno": 2}
    server_id = book.ids.get(serial) or book.new_id(serial)
    book.devices[serial] = {
        "serverID": server_id,
        "known_id": body.get("serverID", ""),
        "mac": identity.get("mac", ""),
        "model": identity.get("model", ""),
        "services": services,
    }
    return {"errno": 0, "serverID": server_id}


def relay_user_of(server_id):
    return "zr" + re.sub(r"[^A-Za-z0-9]", "", server_id)[:40]


def _connect_plan(server, book, serial, answer):
    relay = server.relay
    if book.reachable.get(serial):
        answer["connect"] = "direct"
    elif relay is not None:
        user = relay_user_of(answer["serverID"])
        if user not in book.passwords:
            book.passwords[user] = relay.grant(user)
        book.users[serial] = user
        answer["connect"] = "tunnel"
        answer["tunnel"] = {"relay_ip": relay.info()["ip"], "relay_user": user,
                            "relay_pass": book.passwords[user]}
    if "connect" in answer or book.heartbeat:
        if book.heartbeat != 0:
            answer["heartbeat"] = book.heartbeat or 300
    book.devices[serial]["connect"] = answer.get("connect", "")
    return answer


def _alias_user(server, book, alias):
    """The relay user behind an alias, "" for an appliance reached directly,
    None for an alias the relay does not know."""
    if alias in book.direct_aliases:
        return ""
    user = book.granted_aliases.get(alias)
    if user:
        return user
    aliases = server.state.get("alias")
    entry = getattr(aliases, "aliases", {}).get(alias) if aliases is not None else None
    if entry:
        if book.reachable.get(entry.get("serial")):
            return ""
        return book.users.get(entry.get("serial"))
    return None


def _proxy(server, book, core, req):
    relay = server.relay
    if relay is None:
        return None
    alias, rest = None, None
    host = (req.header("Host") or "").split(":")[0]
    first = host.split(".")[0] if "." in host else ""
    with server.lock:
        if first and _alias_user(server, book, first) is not None:
            alias, rest = first, req.target
        else:
            parts = req.target.split("/", 2)
            if len(parts) >= 2 and parts[1]:
                name = parts[1].split("?")[0]
                if _alias_user(server, book, name) is not None:
                    alias = name
                    rest = "/" + (parts[2] if len(parts) > 2 else "")
                    if "?" in parts[1]:
                        rest = "/?" + parts[1].split("?", 1)[1]
        if alias is None:
            return None
        user = _alias_user(server, book, alias)
    # A directly reachable appliance is reached at its own address, no tunnel.
    address = relay.info()["appliance_ip"] if user == "" else relay.tunnel_address(user)
    if address is None:
        return core.text_reply("appliance not connected\n", 502)
    import relay_world
    try:
        with relay_world.InNamespace(relay.relay_ns):
            # A tunnel entry outlives its client by a few seconds (the
            # server's delayed exit): do not wait long for a dead one.
            sock = socket.create_connection((address, relay.info()["web_port"]), timeout=3)
        sock.settimeout(10)
    except OSError as exc:
        return core.text_reply("tunnel unreachable: %s\n" % exc, 504)
    conn = http.client.HTTPConnection(address, relay.info()["web_port"], timeout=10)
    conn.sock = sock
    try:
        headers = {k: v for k, v in req.headers if k.lower() not in HOP_BY_HOP}
        headers["Host"] = "%s:%d" % (address, relay.info()["web_port"])
        headers["Connection"] = "close"
        headers["X-Forwarded-Host"] = req.header("Host") or ""
        conn.request(req.method, rest, body=req.body or None, headers=headers)
        resp = conn.getresponse()
        body = resp.read(MAX_PROXIED)
        out = [(k, v) for k, v in resp.getheaders() if k.lower() not in HOP_BY_HOP]
        out.append(("X-Relay-Tunnel", address))
        return core.Reply(resp.status, body, out)
    except (OSError, http.client.HTTPException) as exc:
        return core.text_reply("no answer through the tunnel: %s\n" % exc, 504)
    finally:
        conn.close()


def register(server):
    core = sys.modules[type(server).__module__]
    book = RelayBook()
    server.state["relay"] = book
    server.on_reset(book.reset)

    def serv(req):
        try:
            body = json.loads(req.body.decode("utf-8"))
        except ValueError:
            return core.json_reply({"errno": 9})
        if not isinstance(body, dict) or "command" not in body:
            return core.json_reply({"errno": 9})
        if body["command"] != "register":
            return core.json_reply({"errno": 3})
        with server.lock:
            answer = _register(book, body)
            if answer.get("errno") == 0:
                answer = _connect_plan(server, book, body["identity"]["serial"], answer)
            return core.json_reply(answer)

    def reassign(req):
        serial = req.json().get("serial", "")
        with server.lock:
            return core.json_reply({"ok": True, "serverID": book.new_id(serial)})

    def devices(req):
        with server.lock:
            return core.json_reply({"devices": book.devices})

    def reachable(req):
        body = req.json()
        with server.lock:
            book.reachable[body.get("serial", "")] = bool(body.get("reachable"))
        return core.json_reply({"ok": True})

    def heartbeat(req):
        with server.lock:
            book.heartbeat = int(req.json().get("seconds", 0))
        return core.json_reply({"ok": True})

    def needs_relay():
        return core.json_reply({"ok": False, "error": "the relay's VPN side does not run (--relay)"}, 409)

    def grant(req):
        if server.relay is None:
            return needs_relay()
        body = req.json()
        user = body.get("user", "")
        with server.lock:
            if body.get("direct") and body.get("alias"):
                book.direct_aliases.add(body["alias"])
                return core.json_reply({"ok": True})
            book.passwords[user] = server.relay.grant(user)
            if body.get("alias"):
                book.granted_aliases[body["alias"]] = user
            return core.json_reply({"relay_ip": server.relay.info()["ip"], "relay_user": user,
                                    "relay_pass": book.passwords[user]})

    def block_udp(req):
        if server.relay is None:
            return needs_relay()
        server.relay.block_udp(bool(req.json().get("on")))
        return core.json_reply({"ok": True})

    def silence(req):
        if server.relay is None:
            return needs_relay()
        server.relay.silence(bool(req.json().get("on")))
        return core.json_reply({"ok": True})

    def link(req):
        if server.relay is None:
            return needs_relay()
        body = req.json()
        side = body.get("side", "relay")
        if side not in ("relay", "appliance"):
            return core.json_reply({"ok": False, "error": "side: relay or appliance"}, 400)
        server.relay.link(bool(body.get("up")), side)
        return core.json_reply({"ok": True})

    def refuse(req):
        if server.relay is None:
            return needs_relay()
        server.relay.refuse_all(bool(req.json().get("on")))
        return core.json_reply({"ok": True})

    def vpn(req):
        if server.relay is None:
            return needs_relay()
        action = req.json().get("action")
        if action == "stop":
            server.relay.stop_servers()
        elif action == "start":
            for proto in ("udp", "tcp"):
                server.relay.start_server(proto)
        else:
            return core.json_reply({"ok": False, "error": "action is stop or start"}, 400)
        return core.json_reply({"ok": True})

    def tunnels(req):
        if server.relay is None:
            return needs_relay()
        with server.lock:
            aliases = dict(book.granted_aliases)
        return core.json_reply({"tunnels": server.relay.tunnels(), "aliases": aliases})

    server.fallback(lambda req: _proxy(server, book, core, req))
    server.route("/relay/admin/reachable", reachable, methods=["POST"])
    server.route("/relay/admin/heartbeat", heartbeat, methods=["POST"])
    server.route("/relay/admin/grant", grant, methods=["POST"])
    server.route("/relay/admin/block_udp", block_udp, methods=["POST"])
    server.route("/relay/admin/vpn", vpn, methods=["POST"])
    server.route("/relay/admin/refuse", refuse, methods=["POST"])
    server.route("/relay/admin/link", link, methods=["POST"])
    server.route("/relay/admin/silence", silence, methods=["POST"])
    server.route("/relay/admin/tunnels", tunnels, methods=["GET"])
    server.route(PAGE, serv, methods=["POST"])
    server.route("/relay/admin/reassign", reassign, methods=["POST"])
    server.route("/relay/admin/devices", devices, methods=["GET"])
