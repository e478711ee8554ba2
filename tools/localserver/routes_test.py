"""Generic routes under /test/ for the request tests."""

import json

from zepa_localserver import Reply, json_reply, text_reply


def register(server):
    server.route("/test/json", lambda req: json_reply({"errno": 0, "message": "ok", "list": [1, 2, 3]}))
    server.route("/test/text", lambda req: text_reply("hello, world\n"))
    server.route("/test/nonjson", lambda req: text_reply("<html>not json</html>"))
    server.route("/test/redirect", lambda req: Reply(302, "moved\n", {"Location": "/test/text"}))
    server.route("/test/notfound", lambda req: json_reply({"errno": 3, "message": "no such api"}, 404))
    server.route("/test/busy", lambda req: json_reply({"errno": 1}, 503))
    server.route("/test/cookie", _cookie)
    server.route("/test/echo", _echo)
    server.route("/test/hang", _hang)
    server.route("/test/big", _big)


def _cookie(req):
    """Every query parameter becomes a cookie; names starting "h_" are HttpOnly."""
    headers = []
    for name, value in req.params().items():
        text = "%s=%s; Path=/" % (name, value)
        if name.startswith("h_"):
            text += "; HttpOnly"
        headers.append(("Set-Cookie", text))
    return Reply(200, json.dumps({"set": len(headers)}), headers, content_type="application/json")


def _echo(req):
    # What the client sent; the arrival time would make two equal requests differ.
    rec = req.record()
    rec.pop("time", None)
    return json_reply(rec)


def _hang(req):
    """Waits ?seconds= (default 30), then closes without an answer."""
    return Reply(action="hang", seconds=float(req.params().get("seconds", "30")))


def _big(req):
    """?size= bytes (default 10 MiB) of a repeating pattern."""
    size = int(req.params().get("size", str(10 * 1024 * 1024)))
    pattern = b"abcdef0123456789"
    body = pattern * (size // len(pattern)) + pattern[: size % len(pattern)]
    return Reply(200, body, content_type="application/octet-stream")
