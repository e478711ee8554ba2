#!/usr/bin/env python3
"""Figures of what the relay exists for, each against its floor or its peer.

Stages an appliance in a temporary root, starts the local relay/alias server
and the real daemon, and measures (medians of interleaved runs, min..max):
status probe, zeparelayctl status, debug query under a hanging registration,
alias exchange vs the curl command line, service-list generation vs rule
count, daemon footprint and idle wake-ups, status cost vs services.
"""
import argparse
import json
import math
import os
import resource
import shutil
import signal
import statistics
import subprocess
import sys
import tempfile
import time
import urllib.request

ROWS = []  # (figure, ours, reference, ratio, target, verdict)
BENCH_SMOKE = [False]  # a smoke run judges nothing


def say(text):
    print("bench: " + text, file=sys.stderr, flush=True)


def fail(text):
    print("bench: FAILED: " + text, file=sys.stderr, flush=True)
    sys.exit(1)


def med(values):
    return statistics.median(values) if values else float("nan")


def fmt(value, unit):
    if unit == "ns":
        if value >= 1e6:
            return "%.2f ms" % (value / 1e6)
        return "%.1f us" % (value / 1e3)
    if unit == "kb":
        return "%.0f KB" % value
    if unit == " Ir":
        return "%.2f M Ir" % (value / 1e6)
    if unit == "mb":
        return "%.2f MB" % value
    return "%.3g%s" % (value, unit)


def line(name, ours, ref, unit, target=None, check=None, note=""):
    """One figure: lists of per-round values of ours and the reference."""
    o, r = med(ours), med(ref) if ref else None
    text = "%s: ours %s (%s..%s)" % (name, fmt(o, unit), fmt(min(ours), unit), fmt(max(ours), unit))
    ratio = None
    if ref:
        ratios = [a / b for a, b in zip(ours, ref) if b > 0]
        text += ", reference %s (%s..%s)" % (fmt(r, unit), fmt(min(ref), unit), fmt(max(ref), unit))
        if ratios:
            ratio = med(ratios)
            text += ", ratio %.2f (%.2f..%.2f)" % (ratio, min(ratios), max(ratios))
        else:
            text += ", ratio -"
    if note:
        text += "  [%s]" % note
    print(text, flush=True)
    verdict = "-"
    if check is not None and BENCH_SMOKE[0]:
        verdict = "(smoke)"
    elif check is not None:
        verdict = "met" if check(o, ratio) else "MISSED"
    ROWS.append((name, fmt(o, unit), fmt(r, unit) if r is not None else "-",
                 "%.2f" % ratio if ratio is not None else "-", target or "-", verdict))


class Bench:
    def __init__(self, args):
        self.args = args
        self.smoke = args.smoke
        self.build = os.path.abspath(args.build)
        self.src = os.path.abspath(args.src)
        self.work = tempfile.mkdtemp(prefix="zepa-bench-%d-" % os.getpid())
        self.root = os.path.join(self.work, "root")
        self.server = None
        self.min_daemon = None
        self.daemon_bin = os.path.join(self.build, "tools/zeparelayd/zeparelayd")
        self.ctl_bin = os.path.join(self.build, "tools/zeparelayctl/zeparelayctl")
        self.fig = os.path.join(self.build, "bench/figures/zepa_figures")
        self.floor = os.path.join(self.build, "bench/figures/zepa_status_floor")
        self.min_daemon_bin = os.path.join(self.build, "bench/figures/zepa_min_daemon")
        for p in (self.daemon_bin, self.ctl_bin, self.fig, self.floor, self.min_daemon_bin):
            if not os.access(p, os.X_OK):
                fail("%s is missing: build the targets first (scripts/bench.sh does)" % p)

    # --- set-up -------------------------------------------------------------
    def stage(self, root):
        subprocess.run([os.path.join(self.src, "scripts/stage_appliance.sh"), root], check=True,
                       stdout=subprocess.DEVNULL)

    def start_server(self):
        ready = os.path.join(self.work, "server.json")
        self.server = subprocess.Popen(
            [sys.executable, os.path.join(self.src, "tools/localserver/zepa_localserver.py"),
             "--ready-file", ready, "--cert-dir", os.path.join(self.work, "certs")],
            stdout=subprocess.DEVNULL, stderr=open(os.path.join(self.work, "server.log"), "w"))
        for _ in range(300):
            if os.path.exists(ready):
                break
            time.sleep(0.1)
        else:
            fail("the local server did not start (see %s/server.log)" % self.work)
        with open(ready) as f:
            info = json.load(f)
        self.http_port, self.https_port, self.ca = info["http_port"], info["https_port"], info["ca_file"]
        self.base = "https://127.0.0.1:%d" % self.https_port

    def control(self, path, body=None):
        url = "http://127.0.0.1:%d/_control/%s" % (self.http_port, path)
        data = json.dumps(body).encode() if body is not None else None
        with urllib.request.urlopen(urllib.request.Request(url, data=data), timeout=10) as r:
            return json.load(r)

    def write_conf(self, root, services):
        conf = {
            "server_control": {"protocol": "https", "host": "127.0.0.1", "port": self.https_port},
            "server_alias": {"alias": "bench-box", "url": self.base},
            "service": [{"id": s} for s in services],
            "log_level": 5,
            "log_file": "/var/log/zeparelayd.log",
        }
        with open(os.path.join(root, "usr/zepa/etc/zeparelayd/zeparelayd.conf"), "w") as f:
            json.dump(conf, f, indent=3)

    def ctl(self, *args):
        return subprocess.run([self.ctl_bin, "--root", self.root] + list(args), capture_output=True, text=True)

    def start_daemon(self, wait_for="state: connected"):
        rc = subprocess.run([self.daemon_bin, "--root", self.root, "--ca-file", self.ca]).returncode
        if rc != 0:
            fail("zeparelayd did not start (exit %d); log: %s/var/log/zeparelayd.log" % (rc, self.root))
        for _ in range(300):
            if wait_for is None or wait_for in self.ctl("status").stdout:
                with open(os.path.join(self.root, "var/run/zeparelayd.pid")) as f:
                    return int(f.read().strip())
            time.sleep(0.1)
        fail("the daemon never reported '%s'" % wait_for)

    def stop_daemon(self):
        self.ctl("stop")
        pidfile = os.path.join(self.root, "var/run/zeparelayd.pid")
        for _ in range(100):
            if not os.path.exists(pidfile):
                return
            time.sleep(0.1)

    def cleanup(self):
        try:
            if os.path.exists(os.path.join(self.root, "var/run/zeparelayd.pid")):
                self.stop_daemon()
        finally:
            for p in (self.min_daemon, self.server):
                if p is not None and p.poll() is None:
                    p.terminate()
                    try:
                        p.wait(10)
                    except subprocess.TimeoutExpired:
                        p.kill()
            shutil.rmtree(self.work, ignore_errors=True)

    def figures(self, *args):
        out = subprocess.run([self.fig] + [str(a) for a in args], capture_output=True, text=True)
        if out.returncode != 0:
            fail("zepa_figures %s: exit %d: %s" % (" ".join(map(str, args)), out.returncode, out.stderr))
        return {d["name"]: d for d in (json.loads(l) for l in out.stdout.splitlines() if l.startswith("{"))}

    def instructions(self, function, *args):
        """Instructions executed inside function, per call (4 calls: warm-up and 3)."""
        out = os.path.join(self.work, "callgrind.out")
        subprocess.run(["valgrind", "--tool=callgrind", "--callgrind-out-file=" + out, "--toggle-collect=" + function,
                        self.fig] + [str(a) for a in args], check=True, stdout=subprocess.DEVNULL,
                       stderr=subprocess.DEVNULL)
        with open(out) as f:
            for l in f:
                if l.startswith("totals:") or l.startswith("summary:"):
                    return int(l.split()[1]) / 4.0
        fail("no totals in the callgrind output of %s" % function)

    @staticmethod
    def timed_run(argv):
        """Wall and CPU (user+system of the child) of one process, in ns."""
        before = resource.getrusage(resource.RUSAGE_CHILDREN)
        t0 = time.perf_counter_ns()
        subprocess.run(argv, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        wall = time.perf_counter_ns() - t0
        after = resource.getrusage(resource.RUSAGE_CHILDREN)
        cpu = (after.ru_utime - before.ru_utime + after.ru_stime - before.ru_stime) * 1e9
        return wall, cpu

    # --- figures ------------------------------------------------------------
    def footprint(self, pid):
        idle = 1 if self.smoke else 10
        self.min_daemon = subprocess.Popen([self.min_daemon_bin, self.base + "/alias_update.php", self.ca],
                                           stdout=subprocess.PIPE, text=True)
        if self.min_daemon.stdout.readline().strip() != "connected":
            fail("the minimal C daemon could not reach the local server")
        say("figure 5: both daemons connected; %d s idle" % idle)

        def switches(p):
            with open("/proc/%d/status" % p) as f:
                d = dict(l.split(":", 1) for l in f)
            return int(d["voluntary_ctxt_switches"]) + int(d["nonvoluntary_ctxt_switches"])

        def mem(p):
            with open("/proc/%d/smaps_rollup" % p) as f:
                d = {}
                for l in f:
                    parts = l.split()
                    if len(parts) >= 2 and parts[0].endswith(":"):
                        d[parts[0][:-1]] = int(parts[1])
            return d

        s0, m0 = switches(pid), switches(self.min_daemon.pid)
        time.sleep(idle)
        s1, m1 = switches(pid), switches(self.min_daemon.pid)
        ours, ref = mem(pid), mem(self.min_daemon.pid)
        for key, target in (("Rss", 3.0), ("Pss", None), ("Anonymous", 1.5)):
            o, r = ours[key] / 1024.0, ref[key] / 1024.0
            tgt = "<= +%.1f MB" % target if target else None
            line("footprint %s after connected + %d s idle" % (key, idle), [o], [r], "mb", tgt,
                 (lambda o_, ratio, r=r, t=target: o_ - r <= t) if target else None,
                 "ours - reference = %+.2f MB" % (o - r))
        line("idle wake-ups per second", [(s1 - s0) / idle], [(m1 - m0) / idle], "/s", "<= 0.1/s",
             lambda o, ratio: o <= 0.1)
        self.min_daemon.terminate()
        self.min_daemon.wait()
        self.min_daemon = None

        lib = None
        libdir = os.path.join(self.build, "src")
        for name in sorted(os.listdir(libdir)):
            if name.startswith("libzeparelayd.so.") and not os.path.islink(os.path.join(libdir, name)):
                lib = os.path.join(libdir, name)
        if lib is None:
            fail("libzeparelayd.so.* not found in %s" % libdir)
        stripped = os.path.join(self.work, "stripped.so")
        subprocess.run(["strip", "--strip-unneeded", "-o", stripped, lib], check=True)
        line("stripped library size", [os.path.getsize(stripped) / 1024.0], None, "kb", "<= 200 KB",
             lambda o, ratio: o <= 200)

    def status_probe(self):
        rounds, iters = (1, 200) if self.smoke else (7, 20000)
        say("figure 1: status probe, %d interleaved rounds of %d calls" % (rounds, iters))
        js, words, floor = [], [], []
        for _ in range(rounds):
            js.append(self.figures("probe", self.root, "json", iters)["probe_json"]["median_ns"])
            floor.append(self.figures("probe", self.root, "floor", iters)["probe_floor"]["median_ns"])
            words.append(self.figures("probe", self.root, "words", iters)["probe_words"]["median_ns"])
        line("status probe GetStatus(Json::Value&) per call", js, floor, "ns", "<= 1.5x",
             lambda o, r: r <= 1.5)
        line("status probe GetStatus(words) per call", words, floor, "ns", "<= 1.5x", lambda o, r: r <= 1.5)

        pairs = 2 if self.smoke else 20
        say("figure 1: zeparelayctl status vs a minimal C program, %d interleaved pairs" % pairs)
        ow, oc, rw, rc, vw, vc = [], [], [], [], [], []
        for _ in range(pairs):
            w, c = self.timed_run([self.ctl_bin, "--root", self.root, "status"])
            ow.append(w)
            oc.append(c)
            w, c = self.timed_run([self.floor, self.root])
            rw.append(w)
            rc.append(c)
            w, c = self.timed_run([self.ctl_bin, "--version"])
            vw.append(w)
            vc.append(c)
        line("zeparelayctl status process, wall", ow, rw, "ns", "<= 3x", lambda o, r: r <= 3)
        line("zeparelayctl status process, cpu", oc, rc, "ns", "<= 3x", lambda o, r: r <= 3)
        line("zeparelayctl --version (loading only), wall", vw, rw, "ns", None, None,
             "what the tool pays before it reads any file")

    def alias_exchange(self):
        rounds, n = (1, 2) if self.smoke else (5, 20)
        say("figure 3: alias map exchange, %d interleaved rounds of %d exchanges" % (rounds, n))
        body = ("action=map_alias&alias=bench-box&id=bench-id&key=%s&mac=00%%3A11%%3A32%%3A00%%3A00%%3A01"
                "&model=ZS-220&serial=2150ZSN012345&token=5f0c2a9e8d7b41c3a6e0f9b2d4c8e1a7") % ("3b8f" * 16)
        curl = ["curl", "-s", "-o", "/dev/null", "--cacert", self.ca, "-d", body, self.base + "/alias_update.php"]
        ow, oc, rw, rc, first = [], [], [], [], []
        for _ in range(rounds):
            d = self.figures("alias", self.root, self.base, self.ca, n)
            ow.append(d["alias_map"]["median_ns"])
            oc.append(d["alias_map"]["cpu_ns"])
            first.append(d["alias_first"]["median_ns"])
            w, c = [], []
            for _ in range(n):
                a, b = self.timed_run(curl)
                w.append(a)
                c.append(b)
            rw.append(med(w))
            rc.append(med(c))
        note = "first exchange of a process (trust store load) %s; connections never reused" % fmt(med(first), "ns")
        line("alias exchange, wall", ow, rw, "ns", "<= 0.5x", lambda o, r: r <= 0.5, note)
        line("alias exchange, cpu", oc, rc, "ns", "<= 0.5x", lambda o, r: r <= 0.5)

    def rules_root(self, n):
        root = os.path.join(self.work, "gen-%d" % n)
        self.stage(root)
        self.write_conf(root, ["nos", "nos_https", "http"])
        rules = os.path.join(root, "usr/zepa/etc/router/portforward.conf")
        with open(rules, "w") as f:
            for i in range(n - 1):
                p = 20000 + i % 40000
                f.write('[rule%d]\ns_port="%d"\nr_port="%d"\nprotocol name="tcp"\nenabled="1"\n\n' % (i, p, p))
            f.write('[management]\ns_port="5000,5001"\nr_port="5000,5001"\nprotocol name="tcp"\nenabled="1"\n')
        return root, rules

    def gen_service_conf(self):
        counts = [1, 100] if self.smoke else [1, 100, 1000, 10000]
        rounds = 1 if self.smoke else 3
        say("figure 4: GenServiceConf vs one parse of the rule file, rules %s" % counts)
        roots = {n: self.rules_root(n) for n in counts}
        # Files younger than 2 s are checked by content on every look-up; an
        # appliance's rule file is older than that.
        time.sleep(0 if self.smoke else 2.1)
        medians = {}
        for n in counts:
            root, rules = roots[n]
            iters = max(3, min(200, 20000 // (n * 4 + 50))) if not self.smoke else 2
            ours, ref = [], []
            for _ in range(rounds):
                ours.append(self.figures("gen", root, iters)["gen_service_conf"]["median_ns"])
                ref.append(self.figures("parse", rules, max(iters, 5))["parse_rules"]["median_ns"])
            medians[n] = med(ours)
            tgt, chk = (("<= 10x", lambda o, r: r <= 10) if n == 1000 else (None, None))
            line("GenServiceConf with %d router rules" % n, ours, ref, "ns", tgt, chk)
        # Wall and CPU time of bigger files suffer most from other processes
        # sharing the caches; instruction counts do not (system calls excluded).
        if not self.smoke and shutil.which("valgrind"):
            ours, ref = [], []
            for n in (100, 1000):
                root, rules = roots[n]
                ours.append(self.instructions("*GenServiceConf*", "gen", root, 3))
                ref.append(self.instructions("*Parse*lambda*", "parse", rules, 3))
                line("GenServiceConf with %d router rules, instructions (callgrind)" % n, [ours[-1]], [ref[-1]],
                     " Ir", None, None, "system calls (one stat per look-up) not counted")
        if 100 in medians and 10000 in medians:
            exp = math.log(medians[10000] / medians[100]) / math.log(100)
            print("GenServiceConf growth exponent 100..10000 rules: %.2f" % exp, flush=True)
            ROWS.append(("GenServiceConf growth exponent", "%.2f" % exp, "1.00", "-", "<= 1.1",
                         "(smoke)" if self.smoke else "met" if exp <= 1.1 else "MISSED"))

    def debug_under_load(self):
        calls = 50 if self.smoke else 1000
        say("figure 2: %d DebugStatus calls while a registration hangs at the server" % calls)
        self.stop_daemon()
        before = len(self.control("requests?path=/Serv.php")["requests"])
        self.control("script", {"path": "/Serv.php", "action": "hang", "seconds": 120, "count": 1})
        self.start_daemon(wait_for=None)
        for _ in range(300):
            if len(self.control("requests?path=/Serv.php")["requests"]) > before:
                break
            time.sleep(0.1)
        else:
            fail("the daemon sent no registration")
        d = self.figures("debug", self.root, calls)["debug_query"]
        still = len(self.control("requests?path=/Serv.php")["requests"]) == before + 1
        print("debug query under a hanging registration: answered %d, busy(11) %d, other %d of %d; "
              "p50 %s, p99 %s, max %s%s" % (d["answered"], d["busy"], d["other"], calls, fmt(d["p50_ns"], "ns"),
                                            fmt(d["p99_ns"], "ns"), fmt(d["max_ns"], "ns"),
                                            "" if still else " (registration no longer hanging!)"), flush=True)
        ROWS.append(("debug query answered under load", "%d/%d" % (d["answered"], calls), "-", "-",
                     "%d/%d" % (calls, calls),
                     "(smoke)" if self.smoke else "met" if d["answered"] == calls and still else "MISSED"))
        self.stop_daemon()

    def status_growth(self):
        iters = 5 if self.smoke else 200
        say("figure 6: status record per loop round and status-file rewrite vs services")
        base = {}
        for n in (1, 24, 1000):
            d = self.figures("grow", self.root, n, iters if n < 1000 else max(3, iters // 10))
            for kind in ("round", "rewrite"):
                v = d["%s_%d" % (kind, n)]["median_ns"]
                base.setdefault(kind, v)
                line("status %s with %d services" % ("build+compare per loop round" if kind == "round"
                                                      else "file rewrite", n), [v], [base[kind]], "ns",
                     None, None, "reference: the same with 1 service")

    def summary(self):
        print("\nSummary")
        widths = [max(len(str(r[i])) for r in ROWS + [("figure", "ours", "reference", "ratio", "target",
                                                           "verdict")]) for i in range(6)]
        head = ("figure", "ours", "reference", "ratio", "target", "verdict")
        for row in [head] + ROWS:
            print("  ".join(str(c).ljust(w) for c, w in zip(row, widths)).rstrip())


def main():
    ap = argparse.ArgumentParser(description=__doc__)
    ap.add_argument("--build", required=True, help="build folder with the daemon, the tool and bench/figures")
    ap.add_argument("--src", required=True, help="source folder")
    ap.add_argument("--smoke", action="store_true", help="one short repetition, no thresholds")
    args = ap.parse_args()
    BENCH_SMOKE[0] = args.smoke
    b = Bench(args)
    try:
        say("staging an appliance in %s" % b.root)
        b.stage(b.root)
        say("starting the local relay/alias server")
        b.start_server()
        b.write_conf(b.root, ["nos", "nos_https", "http"])
        say("starting zeparelayd and waiting for \"connected\"")
        pid = b.start_daemon()
        b.footprint(pid)
        b.status_probe()
        b.alias_exchange()
        b.status_growth()
        b.gen_service_conf()
        b.debug_under_load()
        b.summary()
    finally:
        b.cleanup()
    return 0


if __name__ == "__main__":
    sys.exit(main())
