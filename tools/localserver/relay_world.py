"""The relay's VPN side on one machine, for tests and the demo (needs root).

Two network namespaces joined by a veth pair stand for the relay and the
appliance's own network:

    <name>-r  relay:      veth "relay0" 10.213.0.1/30 (the relay's address,
                          relay_ip), openvpn servers on port 443, UDP and TCP
    <name>-a  appliance:  veth "wan0" 10.213.0.2/30, the appliance's web
                          service on port 5000 (appliance_web.py); the
                          staged appliance's openvpn client runs here

The VPN servers accept a client by user name and password only (no client
certificate): --auth-user-pass-verify runs a script that compares the pair
with the credentials this object handed out (one file per user below the work
folder). On connect a script records the client's tunnel address per user,
on disconnect it removes it; the reverse proxy of routes_relay.py reads that
table to reach an appliance through its tunnel. The certificates come from a
throwaway CA made with the openssl command at start, inside the work folder.

Facts of Debian's openvpn 2.6 this set-up follows:
  * the client's "--cipher none" is ignored: the data cipher is negotiated
    (AES-256-GCM), so the servers keep their default cipher list;
  * the client sends with LZO framing ("--comp-lzo adaptive"): a server
    without "--comp-lzo" drops every data packet ("unknown IP version=15")
    although the client's up script runs, so the servers use
    "--comp-lzo adaptive" with "--allow-compression asym";
  * the servers push their own tun MTU, so they use the client's 1400;
  * a UDP server sends an exit notice to its clients when stopped
    ("--explicit-exit-notify"), which ends a client at once instead of
    after its 10-second "--ping-exit";
  * "--keepalive 10 60" pushes "ping 10" and "ping-restart 60", which take
    the place of the client's own "--ping-exit 10": a client rides out a
    link lost for 30 s (with "ping-restart 30" it would leave at about the
    moment the link came back).
"""

import ctypes
import os
import re
import secrets
import shutil
import signal
import subprocess
import sys
import threading
import time

CLONE_NEWNET = 0x40000000
RELAY_IP = "10.213.0.1"
APPLIANCE_WAN_IP = "10.213.0.2"
VPN_PORT = 443
POOLS = {"udp": "10.214.0.0", "tcp": "10.214.1.0"}
WEB_PORT = 5000

_libc = ctypes.CDLL(None, use_errno=True)
_NAME = re.compile(r"^[a-z0-9][a-z0-9-]{0,23}$")
_USER = re.compile(r"^[A-Za-z0-9_-]{1,64}$")


class RelayWorldError(Exception):
    pass


def _run(*cmd):
    done = subprocess.run(list(cmd), stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
    if done.returncode != 0:
        raise RelayWorldError("%s failed: %s" % (" ".join(cmd), done.stderr.strip()))
    return done.stdout


def check_prerequisites():
    """None when this machine can host the relay world, else the reason."""
    if os.geteuid() != 0:
        return "needs root (network namespaces and tun devices)"
    if not os.path.exists("/dev/net/tun"):
        return "no /dev/net/tun"
    for tool in ("/usr/sbin/openvpn", "openssl", "ip", "nsenter"):
        if shutil.which(tool) is None:
            return "%s not installed (scripts/install-deps.sh)" % tool
    return None


class InNamespace:
    """Moves the calling thread (only it) into a named network namespace, so
    that the sockets it opens belong there; the thread's old namespace comes
    back on exit."""

    def __init__(self, name):
        self.name = name

    def __enter__(self):
        self.back = os.open("/proc/thread-self/ns/net", os.O_RDONLY)
        fd = os.open("/run/netns/" + self.name, os.O_RDONLY)
        try:
            if _libc.setns(fd, CLONE_NEWNET) != 0:
                err = ctypes.get_errno()
                os.close(self.back)
                raise OSError(err, "setns " + self.name)
        finally:
            os.close(fd)
        return self

    def __exit__(self, *exc):
        _libc.setns(self.back, CLONE_NEWNET)
        os.close(self.back)
        return False


class RelayWorld:
    def __init__(self, name, work_dir, verbose=False):
        if not _NAME.match(name):
            raise RelayWorldError("bad relay name %r (a-z, 0-9, '-', at most 24)" % name)
        self.name = name
        self.relay_ns = "zepa-%s-r" % name
        self.appliance_ns = "zepa-%s-a" % name
        self.work = os.path.abspath(work_dir)
        self.verbose = verbose
        self.lock = threading.Lock()
        self.servers = {}
        self.web = None
        self.udp_blocked = False
        self.silenced = False
        self.created = []

    # ---- set-up and teardown -------------------------------------------
    def start(self):
        reason = check_prerequisites()
        if reason:
            raise RelayWorldError(reason)
        for sub in ("users", "tunnels", "tmp", "pki"):
            os.makedirs(os.path.join(self.work, sub), mode=0o700, exist_ok=True)
        self._namespaces()
        # The web service's interpreter starts while the certificates are made.
        self._start_web()
        self._pki()
        self._scripts()
        for proto in ("udp", "tcp"):
            self.start_server(proto)
        self._wait_web()

    def _namespaces(self):
        for ns in (self.relay_ns, self.appliance_ns):
            if os.path.exists("/run/netns/" + ns):
                raise RelayWorldError("network namespace %s exists already" % ns)
        self.created = [self.relay_ns, self.appliance_ns]
        # One ip process per namespace. Both veth ends are created inside
        # their namespaces: nothing appears in ours.
        self._ip_batch(None, ["netns add " + self.relay_ns, "netns add " + self.appliance_ns,
                              "link add relay0 netns %s type veth peer name wan0 netns %s"
                              % (self.relay_ns, self.appliance_ns)])
        for ns, dev, addr in ((self.relay_ns, "relay0", RELAY_IP), (self.appliance_ns, "wan0", APPLIANCE_WAN_IP)):
            self._ip_batch(ns, ["addr add %s/30 dev %s" % (addr, dev), "link set %s up" % dev, "link set lo up"])

    @staticmethod
    def _ip_batch(ns, lines):
        cmd = ["ip"] + (["-n", ns] if ns else []) + ["-batch", "-"]
        done = subprocess.run(cmd, input="\n".join(lines) + "\n", stdout=subprocess.PIPE, stderr=subprocess.PIPE,
                              text=True)
        if done.returncode != 0:
            raise RelayWorldError("setting up the namespaces failed: " + done.stderr.strip())

    def _pki(self):
        pki = os.path.join(self.work, "pki")
        ec = ["-newkey", "ec", "-pkeyopt", "ec_paramgen_curve:prime256v1", "-nodes"]
        self.ca_file = os.path.join(pki, "ca.crt")
        _run("openssl", "req", "-x509", *ec, "-keyout", os.path.join(pki, "ca.key"), "-out", self.ca_file,
             "-days", "2", "-subj", "/CN=zepa test relay CA")
        _run("openssl", "req", *ec, "-keyout", os.path.join(pki, "server.key"), "-out",
             os.path.join(pki, "server.csr"), "-subj", "/CN=relay-vpn")
        ext = os.path.join(pki, "server.ext")
        with open(ext, "w") as f:
            f.write("basicConstraints=CA:FALSE\nkeyUsage=digitalSignature,keyEncipherment\n"
                    "extendedKeyUsage=serverAuth\n")
        _run("openssl", "x509", "-req", "-in", os.path.join(pki, "server.csr"), "-CA", self.ca_file, "-CAkey",
             os.path.join(pki, "ca.key"), "-set_serial", str(secrets.randbits(63)), "-out",
             os.path.join(pki, "server.crt"), "-days", "2", "-extfile", ext)

    def _scripts(self):
        users = os.path.join(self.work, "users")
        tunnels = os.path.join(self.work, "tunnels")
        name_check = "case \"$1\" in ''|*[!A-Za-z0-9_-]*) exit 1 ;; esac\n"
        scripts = {
            # $1: a file holding the user name and the password, one per line.
            "verify.sh": "#!/bin/sh\n"
                         "user=$(sed -n 1p \"$1\"); pass=$(sed -n 2p \"$1\")\n"
                         "set -- \"$user\"\n" + name_check +
                         "[ -f '%s/refuse_all' ] && exit 1\n"
                         "[ -f '%s'/\"$user\" ] || exit 1\n"
                         "[ \"$(cat '%s'/\"$user\")\" = \"$pass\" ]\n" % (self.work, users, users),
            "connect.sh": "#!/bin/sh\nset -- \"$common_name\"\n" + name_check +
                          "printf '%%s' \"$ifconfig_pool_remote_ip\" >'%s'/\"$1\".tmp && "
                          "mv -f '%s'/\"$1\".tmp '%s'/\"$1\"\n" % (tunnels, tunnels, tunnels),
            # A later connection of the same user (the other protocol) keeps its entry.
            "disconnect.sh": "#!/bin/sh\nset -- \"$common_name\"\n" + name_check +
                             "[ \"$(cat '%s'/\"$1\" 2>/dev/null)\" = \"$ifconfig_pool_remote_ip\" ] && "
                             "rm -f '%s'/\"$1\"\nexit 0\n" % (tunnels, tunnels),
        }
        for name, text in scripts.items():
            path = os.path.join(self.work, name)
            with open(path, "w") as f:
                f.write(text)
            os.chmod(path, 0o700)

    def start_server(self, proto):
        with self.lock:
            if proto in self.servers and self.servers[proto].poll() is None:
                return
            pki = os.path.join(self.work, "pki")
            log = os.path.join(self.work, "openvpn-%s.log" % proto)
            if os.path.exists(log):
                os.unlink(log)
            cmd = ["nsenter", "--net=/run/netns/" + self.relay_ns, "/usr/sbin/openvpn",
                   "--server", POOLS[proto], "255.255.255.0", "--topology", "p2p",
                   "--proto", "udp" if proto == "udp" else "tcp-server",
                   "--local", RELAY_IP, "--port", str(VPN_PORT), "--dev", "tun", "--tun-mtu", "1400",
                   "--ca", self.ca_file, "--cert", os.path.join(pki, "server.crt"),
                   "--key", os.path.join(pki, "server.key"), "--dh", "none",
                   "--verify-client-cert", "none", "--username-as-common-name",
                   "--script-security", "2", "--tmp-dir", os.path.join(self.work, "tmp"),
                   "--auth-user-pass-verify", os.path.join(self.work, "verify.sh"), "via-file",
                   "--client-connect", os.path.join(self.work, "connect.sh"),
                   "--client-disconnect", os.path.join(self.work, "disconnect.sh"),
                   "--comp-lzo", "adaptive", "--allow-compression", "asym",
                   "--keepalive", "10", "60", "--verb", "3", "--log", log]
            if proto == "udp":
                # Both ways: a stopped server tells its clients, a stopped
                # client tells the server (its proxy entry goes at once).
                cmd += ["--explicit-exit-notify", "1", "--push", "explicit-exit-notify 1"]
            self.servers[proto] = subprocess.Popen(cmd, stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL,
                                                   stderr=subprocess.DEVNULL)
        self._wait_for_log(log, "Initialization Sequence Completed", self.servers[proto], proto)

    def _wait_for_log(self, log, text, proc, what):
        deadline = time.monotonic() + 10
        while time.monotonic() < deadline:
            if proc.poll() is not None:
                raise RelayWorldError("openvpn %s server exited at start (see %s)" % (what, log))
            try:
                with open(log, errors="replace") as f:
                    if text in f.read():
                        return
            except FileNotFoundError:
                pass
            time.sleep(0.02)
        raise RelayWorldError("openvpn %s server not ready after 10 s (see %s)" % (what, log))

    def stop_servers(self, extra=()):
        with self.lock:
            procs = list(self.servers.values()) + [p for p in extra if p is not None]
            self.servers = {}
        _stop_all(procs)

    def _start_web(self):
        web = os.path.join(os.path.dirname(os.path.abspath(__file__)), "appliance_web.py")
        ready = os.path.join(self.work, "web.ready")
        self.web_ready = ready
        self.web = subprocess.Popen(["nsenter", "--net=/run/netns/" + self.appliance_ns, sys.executable, web,
                                     "--port", str(WEB_PORT), "--ready-file", ready],
                                    stdin=subprocess.DEVNULL)

    def _wait_web(self):
        ready = self.web_ready
        deadline = time.monotonic() + 10
        while not os.path.exists(ready):
            if self.web.poll() is not None or time.monotonic() > deadline:
                raise RelayWorldError("the appliance's web service did not start")
            time.sleep(0.02)

    def close(self):
        # Everything is told at once: the local server's owner waits only so long.
        self.stop_servers(extra=[self.web])
        self.web = None
        if self.created:
            # What still runs inside (the appliance's own openvpn, say, when
            # its daemon was left behind) would keep a namespace alive.
            for ns in self.created:
                _kill_inside(ns)
            subprocess.run(["ip", "-force", "-batch", "-"], input="".join("netns del %s\n" % ns for ns in self.created),
                           stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL, text=True)
        self.created = []
        shutil.rmtree(os.path.join(self.work, "pki"), ignore_errors=True)

    # ---- what tests and the control server ask for ----------------------
    def grant(self, user):
        """A fresh password for user, accepted by the VPN servers from now on."""
        if not _USER.match(user):
            raise RelayWorldError("bad relay user %r" % user)
        password = secrets.token_hex(12)
        path = os.path.join(self.work, "users", user)
        with open(path + ".tmp", "w") as f:
            f.write(password)
        os.rename(path + ".tmp", path)
        return password

    def tunnel_address(self, user):
        if not _USER.match(user or ""):
            return None
        try:
            with open(os.path.join(self.work, "tunnels", user)) as f:
                return f.read().strip() or None
        except OSError:
            return None

    def tunnels(self):
        out = {}
        for user in sorted(os.listdir(os.path.join(self.work, "tunnels"))):
            if not user.endswith(".tmp"):
                out[user] = self.tunnel_address(user)
        return out

    def refuse_all(self, on):
        """Every password is refused while on (a relay that no longer knows
        the credentials it handed out)."""
        path = os.path.join(self.work, "refuse_all")
        if on:
            open(path, "w").close()
        elif os.path.exists(path):
            os.unlink(path)

    def block_udp(self, on):
        """Drops the appliance's UDP to the relay's VPN port, as a strict
        firewall would (the client's sends fail, nothing arrives)."""
        with self.lock:
            if on and not self.udp_blocked:
                _run("ip", "-n", self.appliance_ns, "rule", "add", "ipproto", "udp", "dport", str(VPN_PORT),
                     "blackhole", "pref", "10")
            elif not on and self.udp_blocked:
                _run("ip", "-n", self.appliance_ns, "rule", "del", "pref", "10")
            self.udp_blocked = on

    def link(self, up, side="relay"):
        """The link between appliance and relay cut (nothing passes either
        way) or restored, at one end of the veth pair: "relay" sets "relay0"
        down, so the appliance's "wan0" keeps its route and loses its carrier
        (as with a pulled cable); "appliance" sets "wan0" down, which takes
        its route away."""
        if side not in ("relay", "appliance"):
            raise RelayWorldError("bad side %r (relay or appliance)" % side)
        ns, dev = (self.relay_ns, "relay0") if side == "relay" else (self.appliance_ns, "wan0")
        with self.lock:
            _run("ip", "-n", ns, "link", "set", dev, "up" if up else "down")

    def silence(self, on):
        """Drops every answer of the relay's VPN servers (UDP and TCP, from
        the VPN port): the appliance's packets arrive, nothing comes back, as
        with a relay that hangs or a path that loses the return traffic."""
        with self.lock:
            if on and not self.silenced:
                _run("ip", "-n", self.relay_ns, "rule", "add", "sport", str(VPN_PORT), "blackhole", "pref", "11")
            elif not on and self.silenced:
                _run("ip", "-n", self.relay_ns, "rule", "del", "pref", "11")
            self.silenced = on

    def info(self):
        return {"ip": RELAY_IP, "port": VPN_PORT, "relay_netns": self.relay_ns,
                "appliance_netns": self.appliance_ns, "ca_file": self.ca_file, "web_port": WEB_PORT,
                "appliance_ip": APPLIANCE_WAN_IP, "work_dir": self.work}


def _kill_inside(ns):
    try:
        out = subprocess.run(["ip", "netns", "pids", ns], capture_output=True, text=True, timeout=5).stdout
    except (OSError, subprocess.SubprocessError):
        return
    for word in out.split():
        try:
            os.kill(int(word), signal.SIGKILL)
        except (ValueError, OSError):
            pass


def _stop_all(procs):
    for proc in procs:
        if proc.poll() is None:
            proc.send_signal(signal.SIGTERM)
    deadline = time.monotonic() + 3
    for proc in procs:
        try:
            proc.wait(max(0.0, deadline - time.monotonic()))
        except subprocess.TimeoutExpired:
            proc.kill()
            proc.wait()
