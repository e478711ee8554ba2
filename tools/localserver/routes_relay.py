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
  * otherwise                                          -> {"errno": 0, "serverID": "<id>"}

The server id of a serial is made on its first registration and kept;
POST /relay/admin/reassign {"serial": S} gives S a fresh id (as when the relay
moves a device), which the next registration hands out. GET
/relay/admin/devices lists what each serial registered last (no secrets).
Failures such as other errno values, HTTP errors or hanging connections come
from the core's scripted answers (POST /_control/script), which take
precedence. State lives in memory until POST /_control/reset.
"""

import json
import sys

PAGE = "/Serv.php"


class RelayBook:
    def __init__(self):
        self.reset()

    def reset(self):
        self.ids = {}
        self.tokens = {}
        self.devices = {}
        self.counter = 0

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
            return core.json_reply(_register(book, body))

    def reassign(req):
        serial = req.json().get("serial", "")
        with server.lock:
            return core.json_reply({"ok": True, "serverID": book.new_id(serial)})

    def devices(req):
        with server.lock:
            return core.json_reply({"devices": book.devices})

    server.route(PAGE, serv, methods=["POST"])
    server.route("/relay/admin/reassign", reassign, methods=["POST"])
    server.route("/relay/admin/devices", devices, methods=["GET"])
