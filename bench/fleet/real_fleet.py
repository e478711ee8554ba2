#!/usr/bin/env python3
"""A fleet of real zeparelayd processes against one local server.

Each daemon gets its own staged system root (scripts/stage_appliance.sh,
copied) with its own serial, token and alias, all pointing at one local
server (tools/localserver): the control server on its HTTPS port, the alias
server on its HTTP port. The server asks for a heartbeat every --heartbeat
seconds and marks every serial reachable (no tunnels: no openvpn runs).

Timeline, as the fleet simulator's: the daemons start one by one, evenly
over one heartbeat period (so that their heartbeats are spread as in a fleet
that booted long ago); a steady window of one heartbeat period; then the
control server's port refuses every connection for --outage seconds
(POST /_control/refuse, the server stays up for the alias server and the
control API) and comes back; the run ends --after seconds later.

What is measured comes from the server's own records (every request with its
arrival time and answer) and its refusal times: written as CSV for
fleet_sim --records, which computes the same figures as for a simulated
fleet. Each daemon's memory (RSS and PSS from /proc/PID/smaps_rollup) is
taken at the end; the daemons' status files give a second view of the
recovery. Progress goes to standard error.
"""

import argparse
import json
import math
import os
import shutil
import signal
import subprocess
import sys
import tempfile
import time
import urllib.error
import urllib.parse
import urllib.request

SRC = os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__))))
REGISTERED_STATES = (4, 5, 6)  # direct_connect, connected, connected_alt


def say(text):
    sys.stderr.write("%s %s\n" % (time.strftime("%H:%M:%S"), text))
    sys.stderr.flush()


class Fail(Exception):
    pass


class Server:
    def __init__(self, work, max_records):
        self.ready = os.path.join(work, "server.json")
        self.log = open(os.path.join(work, "server.log"), "w")
        self.proc = subprocess.Popen(
            [sys.executable, os.path.join(SRC, "tools/localserver/zepa_localserver.py"), "--ready-file", self.ready,
             "--cert-dir", os.path.join(work, "certs"), "--owner-pid", str(os.getpid()),
             "--max-records", str(max_records)],
            stdout=self.log, stderr=subprocess.STDOUT)
        for _ in range(300):
            if os.path.exists(self.ready) or self.proc.poll() is not None:
                break
            time.sleep(0.1)
        if not os.path.exists(self.ready):
            raise Fail("the local server did not start (see %s)" % self.log.name)
        with open(self.ready) as f:
            info = json.load(f)
        self.http_port, self.https_port, self.ca_file = info["http_port"], info["https_port"], info["ca_file"]
        self.pid = info["pid"]

    def call(self, method, path, body=None):
        data = None if body is None else json.dumps(body).encode()
        req = urllib.request.Request("http://127.0.0.1:%d%s" % (self.http_port, path), data=data, method=method)
        try:
            with urllib.request.urlopen(req, timeout=30) as r:
                return json.load(r)
        except (urllib.error.URLError, OSError, ValueError) as exc:
            raise Fail("control call %s %s failed: %s" % (method, path, exc))

    def stop(self):
        if self.proc.poll() is None:
            self.proc.terminate()
            try:
                self.proc.wait(20)
            except subprocess.TimeoutExpired:
                self.proc.kill()
                self.proc.wait()


def stage(work, n, server, log_level):
    template = os.path.join(work, "template")
    subprocess.run([os.path.join(SRC, "scripts/stage_appliance.sh"), template], check=True,
                   stdout=subprocess.DEVNULL)
    roots = []
    for i in range(n):
        root = os.path.join(work, "roots", "d%04d" % i)
        shutil.copytree(template, root, symlinks=True)
        serial = "2150FLT%06d" % i
        with open(os.path.join(root, "etc/zepa/hubtoken.conf"), "w") as f:
            f.write('serial="%s"\ntoken="%032x"\n' % (serial, 0x5EED0000 + i))
        conf = {
            "server_control": {"protocol": "https", "host": "127.0.0.1", "port": server.https_port},
            "server_alias": {"alias": "fleet-%04d" % i, "url": "http://127.0.0.1:%d" % server.http_port},
            "service": [{"id": "nos"}, {"id": "nos_https"}],
            "log_level": log_level,
            "log_file": "/var/log/zeparelayd.log",
        }
        with open(os.path.join(root, "usr/zepa/etc/zeparelayd/zeparelayd.conf"), "w") as f:
            json.dump(conf, f, indent=3)
        server.call("POST", "/relay/admin/reachable", {"serial": serial, "reachable": True})
        roots.append(root)
        if (i + 1) % 50 == 0 or i + 1 == n:
            say("staged %d/%d roots" % (i + 1, n))
    return roots


def daemon_pid(root):
    try:
        with open(os.path.join(root, "var/run/zeparelayd.pid")) as f:
            pid = int(f.read().strip())
        with open("/proc/%d/comm" % pid) as f:
            return pid if f.read().strip().startswith("zeparelayd") else None
    except (OSError, ValueError):
        return None


def daemon_state(root):
    try:
        with open(os.path.join(root, "tmp/.zeparelayd.status")) as f:
            return int(json.load(f).get("state", 0))
    except (OSError, ValueError, AttributeError, TypeError):
        return 0


def memory(pid):
    """(RSS, PSS) in KiB from smaps_rollup."""
    rss = pss = None
    try:
        with open("/proc/%d/smaps_rollup" % pid) as f:
            for line in f:
                if line.startswith("Rss:"):
                    rss = int(line.split()[1])
                elif line.startswith("Pss:"):
                    pss = int(line.split()[1])
    except OSError:
        pass
    return rss, pss


def stop_daemons(roots, grace=10):
    """SIGTERM to the daemon of each root (only a live zeparelayd named by its
    PID file), SIGKILL to those left after grace seconds."""
    for sig, wait in ((signal.SIGTERM, grace), (signal.SIGKILL, 0)):
        for r in roots:
            pid = daemon_pid(r)
            if pid is not None:
                try:
                    os.kill(pid, sig)
                except OSError:
                    pass
        deadline = time.time() + wait
        while time.time() < deadline and any(daemon_pid(r) is not None for r in roots):
            time.sleep(0.1)


def watch(owner, roots_dir):
    """Stops the fleet once the run that started it is gone, also when it was
    killed outright (a time-out): the daemons do not outlive their run."""
    while True:
        try:
            with open("/proc/%d/stat" % owner) as f:
                state = f.read().rsplit(")", 1)[1].split()[0]
        except (OSError, IndexError):
            state = "gone"
        if state in ("Z", "X", "gone"):
            break
        time.sleep(1)
    try:
        roots = [os.path.join(roots_dir, d) for d in sorted(os.listdir(roots_dir))]
    except OSError:
        return 0
    stop_daemons(roots, 5)
    return 0


def classify(rec):
    """(kind, serial) of a recorded request, or None for other traffic."""
    if rec["path"] == "/Serv.php":
        try:
            body = json.loads(rec["body_latin1"])
            return "register", body["identity"]["serial"]
        except (ValueError, KeyError, TypeError):
            return None
    if rec["path"] == "/alias_update.php":
        form = dict(urllib.parse.parse_qsl(rec["body_latin1"], keep_blank_values=True))
        kind = {"map_alias": "alias_map", "keep_alive_alias": "alias_keep_alive"}.get(form.get("action"))
        return (kind, form.get("serial", "")) if kind else None
    return None


def answered_ok(rec, kind):
    if rec.get("answer_status") != 200:
        return False
    text = rec.get("answer_latin1", "")
    if kind == "register":
        try:
            return json.loads(text).get("errno") == 0
        except ValueError:
            return False
    return text.strip() == "good"


def main():
    if len(sys.argv) == 4 and sys.argv[1] == "--watch":
        return watch(int(sys.argv[2]), sys.argv[3])
    p = argparse.ArgumentParser(description=__doc__.split("\n")[0])
    p.add_argument("--daemon", required=True, help="the zeparelayd program")
    p.add_argument("-n", "--appliances", type=int, default=200)
    p.add_argument("--heartbeat", type=int, default=300, help="seconds the control server asks for (default 300)")
    p.add_argument("--outage", type=int, default=60, help="seconds the control server refuses (default 60)")
    p.add_argument("--after", type=int, default=330, help="seconds measured after the return (default 330)")
    p.add_argument("--work", help="work folder (default: a temporary one, removed at the end)")
    p.add_argument("--records", required=True, help="CSV of the requests the server saw, for fleet_sim --records")
    p.add_argument("--log-level", type=int, default=5, help="the daemons' log level (default 5, notice)")
    args = p.parse_args()
    if args.appliances < 1 or args.heartbeat < 10 or args.outage < 1 or args.after < 60:
        p.error("wants -n >= 1, --heartbeat >= 10, --outage >= 1, --after >= 60")

    temp = None
    work = args.work
    if work is None:
        temp = tempfile.mkdtemp(prefix="zepa_fleet_")
        work = temp
    os.makedirs(work, exist_ok=True)
    stop = {"now": False}

    def on_signal(signum, frame):
        stop["now"] = True

    signal.signal(signal.SIGTERM, on_signal)
    signal.signal(signal.SIGINT, on_signal)

    n, beat = args.appliances, args.heartbeat
    server = None
    watcher = None
    roots = []
    try:
        say("local server and %d staged roots in %s" % (n, work))
        server = Server(work, max(50000, n * 50))
        server.call("POST", "/relay/admin/heartbeat", {"seconds": beat})
        roots = stage(work, n, server, args.log_level)
        watcher = subprocess.Popen([sys.executable, os.path.abspath(__file__), "--watch", str(os.getpid()),
                                    os.path.join(work, "roots")], start_new_session=True)
        server.call("POST", "/_control/reset")
        server.call("POST", "/relay/admin/heartbeat", {"seconds": beat})
        for i in range(n):
            server.call("POST", "/relay/admin/reachable", {"serial": "2150FLT%06d" % i, "reachable": True})

        t0 = time.time()
        boot_end = t0 + beat
        event = boot_end + beat
        plan_return = event + args.outage
        end = plan_return + args.after
        say("boots over %d s, steady %d s, outage %d s from %s, measured until %s (%.1f min in all)"
            % (beat, beat, args.outage, time.strftime("%H:%M:%S", time.localtime(event)),
               time.strftime("%H:%M:%S", time.localtime(end)), (end - t0) / 60))
        starters = []
        started = 0
        outage_on = outage_off = None
        status_track = []  # (time, registered by status files)
        last_progress = 0
        while not stop["now"]:
            now = time.time()
            while started < n and now >= t0 + started * beat / n:
                starters.append(subprocess.Popen([args.daemon, "--root", roots[started], "--ca-file",
                                                  server.ca_file], stdout=subprocess.DEVNULL,
                                                 stderr=subprocess.PIPE))
                started += 1
            for s in starters[:]:
                if s.poll() is not None:
                    starters.remove(s)
                    if s.returncode != 0:
                        raise Fail("a daemon did not start (exit %d): %s" % (s.returncode,
                                                                             s.stderr.read().decode()[-300:]))
            if outage_on is None and now >= event:
                outage_on = server.call("POST", "/_control/refuse", {"scheme": "https", "on": True})["time"]
                say("outage: the control server refuses connections")
            if outage_on is not None and outage_off is None and now >= outage_on + args.outage:
                outage_off = server.call("POST", "/_control/refuse", {"scheme": "https", "on": False})["time"]
                say("return: the control server accepts again")
            if outage_off is not None and now >= outage_off + args.after:
                break
            if now - last_progress >= 2:
                last_progress = now
                registered = sum(1 for r in roots[:started] if daemon_state(r) in REGISTERED_STATES)
                status_track.append((now, registered))
                if int(now - t0) % 20 < 2 or outage_on is not None and outage_off is not None and \
                        now - outage_off < 330 and int(now - outage_off) % 10 < 2:
                    phase = ("booting" if now < boot_end else "steady" if outage_on is None else
                             "outage" if outage_off is None else "after the return")
                    seen = server.call("GET", "/_control/requests?since=999999999")
                    say("%5.0f s  %-16s started %d/%d, registered (status files) %d, refusals %d"
                        % (now - t0, phase, started, n, registered, len(seen["refusals"])))
            time.sleep(0.2)
        if stop["now"]:
            raise Fail("interrupted")

        # Memory of every daemon, then the records.
        mem = [memory(pid) for pid in (daemon_pid(r) for r in roots) if pid is not None]
        alive = len(mem)
        records = server.call("GET", "/_control/requests")
        if records["dropped"]:
            raise Fail("the server dropped %d records: raise --max-records" % records["dropped"])
        refusal = [r for r in records["refusals"] if r["scheme"] == "https"][-1]
        ev, back = refusal["from"], refusal["to"]
        rows = []
        for rec in records["requests"]:
            c = classify(rec)
            if c is None:
                continue
            kind, serial = c
            try:
                idx = int(serial[-6:])
            except ValueError:
                continue
            rows.append((rec["time"] - ev, kind, idx, 1 if answered_ok(rec, kind) else 0))
        with open(args.records, "w") as f:
            f.write("# real fleet: appliances %d heartbeat %d boot_spread %d steady %.3f outage %.3f after %d\n"
                    % (n, beat, beat, ev - t0 - beat, back - ev, args.after))
            f.write("# boot_start %.3f\n" % (t0 - ev))
            rss = [m[0] for m in mem if m[0] is not None]
            pss = [m[1] for m in mem if m[1] is not None]
            if rss and pss:
                f.write("# memory_kib alive %d rss_mean %.0f rss_max %d pss_mean %.0f pss_max %d\n"
                        % (alive, sum(rss) / len(rss), max(rss), sum(pss) / len(pss), max(pss)))
            need = [math.ceil(0.5 * n), math.ceil(0.99 * n), n]
            reached = []
            for k in need:
                t = next((tt - back for tt, c in status_track if tt >= back and c >= k), -1)
                reached.append(t)
            f.write("# status_files recover50 %.1f recover99 %.1f recover100 %.1f\n" % tuple(reached))
            f.write("seconds_from_event,kind,appliance,ok\n")
            for r in sorted(rows):
                f.write("%.3f,%s,%d,%d\n" % r)
        say("%d requests recorded, %d daemons alive at the end; records in %s" % (len(rows), alive, args.records))
        if alive != n:
            raise Fail("%d of %d daemons ended during the run (logs below %s/roots)" % (n - alive, n, work))
        return 0
    except Fail as exc:
        sys.stderr.write("real_fleet: %s\n" % exc)
        return 1
    finally:
        stop_daemons(roots)
        if watcher is not None:
            watcher.terminate()
            watcher.wait()
        if server is not None:
            server.stop()
        if temp is not None:
            shutil.rmtree(temp, ignore_errors=True)


if __name__ == "__main__":
    sys.exit(main())
