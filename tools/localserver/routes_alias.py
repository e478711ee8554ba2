"""Alias server routes for the local test server.

Two form-POST scripts, as the appliance's alias client uses them:

  POST /alias_update.php   action = map_alias | delete_alias | keep_alive_alias
  POST /alias_query.php    action = query_alias

Aliases live in memory (server.state["alias"]) until POST /_control/reset.
Answers are text/plain server words followed by a line feed (the client trims
it), some with ":" and a detail; a query that finds its alias answers with a
JSON object. Rules, checked in this order:

  * unknown script/action pair, or "action" missing   -> "badparam:action"
  * a required field missing or empty                  -> "badparam:<field>"
      map/delete/keep-alive need alias, serial, token, id, mac
      (key and model are sent but not checked); query needs alias
  * update actions: the first token seen for a serial is that serial's
    token; a different token later                     -> "badauth:token does not match serial"
  * map_alias
      alias held by another serial                     -> "alias_inused"
      the serial already holds a different alias       -> "alias_self_inused:<held alias>"
        unless force is "true": the old alias is released and the new one mapped
      otherwise (new alias, or the same one again)     -> "good"
  * delete_alias / keep_alive_alias
      alias not mapped                                 -> "alias_not_found"
      alias held by another serial                     -> "alias_inused"
      otherwise                                        -> "good" (the alias is removed, or its
                                                          keep-alive count goes up)
  * query_alias
      alias not mapped                                 -> "alias_not_found"
      otherwise a JSON object {"alias", "id", "mac", "model", "myhub_account",
      "keep_alive"} (no serial, token or key)

Other server words ("911", "badsys", "badip", "api_key_expired"), odd bodies,
HTTP errors and hanging connections come from the core's scripted answers
(POST /_control/script), which take precedence over these routes.
"""

import sys

UPDATE_SCRIPT = "/alias_update.php"
QUERY_SCRIPT = "/alias_query.php"
UPDATE_ACTIONS = ("map_alias", "delete_alias", "keep_alive_alias")
UPDATE_FIELDS = ("alias", "serial", "token", "id", "mac")
MAP_EXTRAS = ("myhub_account", "myhub_password", "myhub_id", "auth_key", "force")


class AliasBook:
    """Aliases by name and the first token seen for each serial."""

    def __init__(self):
        self.aliases = {}
        self.tokens = {}

    def reset(self):
        self.aliases.clear()
        self.tokens.clear()

    def alias_of_serial(self, serial):
        for name, entry in self.aliases.items():
            if entry["serial"] == serial:
                return name
        return None


def _missing(form, fields):
    for field in fields:
        if not form.get(field):
            return field
    return None


def _token_fits(book, form):
    known = book.tokens.setdefault(form["serial"], form["token"])
    return known == form["token"]


def _map(book, form):
    name, serial = form["alias"], form["serial"]
    holder = book.aliases.get(name)
    if holder is not None and holder["serial"] != serial:
        return "alias_inused"
    held = book.alias_of_serial(serial)
    if held is not None and held != name:
        if form.get("force") != "true":
            return "alias_self_inused:" + held
        del book.aliases[held]
    entry = {"serial": serial, "keep_alive": 0}
    for field in ("id", "mac", "key", "model") + MAP_EXTRAS:
        entry[field] = form.get(field, "")
    if holder is not None:
        entry["keep_alive"] = holder["keep_alive"]
    book.aliases[name] = entry
    return "good"


def _owned_entry(book, form):
    """(entry, None) for the caller's own alias, else (None, answer)."""
    entry = book.aliases.get(form["alias"])
    if entry is None:
        return None, "alias_not_found"
    if entry["serial"] != form["serial"]:
        return None, "alias_inused"
    return entry, None


def _delete(book, form):
    entry, answer = _owned_entry(book, form)
    if entry is None:
        return answer
    del book.aliases[form["alias"]]
    return "good"


def _keep_alive(book, form):
    entry, answer = _owned_entry(book, form)
    if entry is None:
        return answer
    entry["keep_alive"] += 1
    return "good"


def _query(book, form):
    entry = book.aliases.get(form["alias"])
    if entry is None:
        return "alias_not_found"
    return {"alias": form["alias"], "id": entry["id"], "mac": entry["mac"], "model": entry["model"],
            "myhub_account": entry["myhub_account"], "keep_alive": entry["keep_alive"]}


def register(server):
    core = sys.modules[type(server).__module__]
    book = AliasBook()
    server.state["alias"] = book
    server.on_reset(book.reset)

    def answer(result):
        if isinstance(result, dict):
            return core.json_reply(result)
        return core.text_reply(result + "\n")

    def update(req):
        form = req.form()
        action = form.get("action")
        if action not in UPDATE_ACTIONS:
            return answer("badparam:action")
        field = _missing(form, UPDATE_FIELDS)
        if field is not None:
            return answer("badparam:" + field)
        with server.lock:
            if not _token_fits(book, form):
                return answer("badauth:token does not match serial")
            if action == "map_alias":
                return answer(_map(book, form))
            if action == "delete_alias":
                return answer(_delete(book, form))
            return answer(_keep_alive(book, form))

    def query(req):
        form = req.form()
        if form.get("action") != "query_alias":
            return answer("badparam:action")
        if not form.get("alias"):
            return answer("badparam:alias")
        with server.lock:
            return answer(_query(book, form))

    server.route(UPDATE_SCRIPT, update, methods=["POST"])
    server.route(QUERY_SCRIPT, query, methods=["POST"])
