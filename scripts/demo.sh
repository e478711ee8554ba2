#!/usr/bin/env bash
# The relay daemon end to end, on this machine, without touching the system:
# builds the project, stages a sample appliance in a private folder, starts a
# local relay/alias server on loopback (HTTPS with a throwaway CA), runs
# zeparelayd against it and drives it with zeparelayctl. As root it also
# runs the relay's VPN side (network namespaces, real openvpn servers, the
# appliance's web UI) and ends by fetching the appliance's page from outside
# through the relay and the daemon's tunnel.
#
#   ./scripts/demo.sh            (as root on a fresh machine: installs packages first)
#   ZEPA_DEMO_BUILD=DIR ZEPA_DEMO_PREBUILT=1 ./scripts/demo.sh
#                                (use the programs already built in DIR)
#
# Everything it starts is stopped again on exit, also on Ctrl-C, which ends
# it at once ("interrupted", exit status 130).
set -euo pipefail

src=$(cd "$(dirname "$0")/.." && pwd)
build=${ZEPA_DEMO_BUILD:-$src/build-demo}
stage=${ZEPA_DEMO_STAGE:-$build/demo-root}
bin_d=$build/tools/zeparelayd/zeparelayd
bin_c=$build/tools/zeparelayctl/zeparelayctl

# Colour only for a terminal.
if [ -t 1 ]; then bold=$'\033[1m' plain=$'\033[0m'; else bold="" plain=""; fi
step() { printf '\n%s==> %s%s\n' "$bold" "$*" "$plain"; }
say() { printf '    %s\n' "$*"; }
ctl() { "$bin_c" --root "$stage" "$@"; }

# Python helpers die of SIGINT like any program, without a traceback.
py() {
  local code=$1
  shift
  python3 -c "import signal; signal.signal(signal.SIGINT, signal.SIG_DFL)
$code" "$@"
}

# Stops what the demo started: the steps, the daemon (only when its PID file
# names a zeparelayd) and the local server (only when the pid the steps noted
# is it). It runs in the supervising shell below, never in the steps' shell.
cleanup() {
  local rc=$?
  trap - EXIT INT TERM
  trap '' INT TERM
  if [ "$rc" -eq 130 ] || [ "$rc" -eq 143 ]; then
    echo
    echo "interrupted"
    rc=130
  fi
  local pid children
  if [ -n "$steps_pid" ]; then
    # The steps and what they run right now (a background shell's children
    # ignore Ctrl-C).
    children=$(cat /proc/"$steps_pid"/task/*/children 2>/dev/null || true)
    kill -TERM "$steps_pid" $children 2>/dev/null || true
    wait "$steps_pid" 2>/dev/null || true
  fi
  pid=$(cat "$stage/var/run/zeparelayd.pid" 2>/dev/null || true)
  if [ -n "$pid" ] && [ "$(cat "/proc/$pid/comm" 2>/dev/null)" = zeparelayd ]; then
    kill -TERM "$pid" 2>/dev/null || true
    for _ in $(seq 50); do kill -0 "$pid" 2>/dev/null || break; sleep 0.1; done
    kill -KILL "$pid" 2>/dev/null || true
  fi
  pid=$(cat "$stage/tmp/server.pid" 2>/dev/null || true)
  if [ -n "$pid" ] && grep -qa zepa_localserver.py "/proc/$pid/cmdline" 2>/dev/null; then
    # It stops its openvpn servers and namespaces itself.
    kill -TERM "$pid" 2>/dev/null || true
    for _ in $(seq 100); do kill -0 "$pid" 2>/dev/null || break; sleep 0.1; done
  fi
  exit "$rc"
}

# Ctrl-C: bash may run a trap while it is parsing a command substitution and
# then fail to parse the trap itself ("unexpected EOF while looking for
# matching `)'"), leaving the demo half stopped; and a shell without a trap
# may take a Ctrl-C that lands as a short command ends for that command's
# own and go on. So the steps run in a child shell, and this shell only
# waits for it, where its trap runs at once and cleanly, ends it and cleans up.
if [ -z "${ZEPA_DEMO_STEPS:-}" ]; then
  steps_pid=""
  interrupted() { exit 130; }
  trap cleanup EXIT
  trap interrupted INT TERM
  rm -f "$stage/tmp/server.pid"
  ZEPA_DEMO_STEPS=1 bash "$0" "$@" &
  steps_pid=$!
  set +e
  wait "$steps_pid"
  rc=$?
  set -e
  steps_pid=""
  exit "$rc"
fi

# Polls a command until its output contains a text (bounded wait).
wait_for() { # seconds text command...
  local seconds=$1 text=$2
  shift 2
  for _ in $(seq $((seconds * 10))); do
    if "$@" 2>/dev/null | grep -q -- "$text"; then return 0; fi
    sleep 0.1
  done
  echo "demo: gave up waiting for '$text' from: $*" >&2
  return 1
}

alias_requests() {
  py 'import json,sys,urllib.request as u; print(len(json.load(u.urlopen(
    "http://127.0.0.1:%s/_control/requests?path=/alias_update.php" % sys.argv[1]))["requests"]))' "$http_port"
}

# The debug dump for people: times as durations, absent values left out.
show_dump() {
  py '
import json, sys, time
def duration(ms):
    if ms < 0: return "none"
    s = ms / 1000.0
    if s < 60: return "%.1f s" % s
    m, s = divmod(int(s), 60)
    if m < 60: return "%d min %d s" % (m, s)
    h, m = divmod(m, 60)
    return "%d h %d min" % (h, m)
def tidy(v):
    if isinstance(v, dict):
        out = {}
        for k, x in v.items():
            if isinstance(x, int) and not isinstance(x, bool) and k.endswith("_ms"):
                out[k[:-3]] = duration(x)
            elif k == "rendered_at" and isinstance(x, int):
                out["rendered"] = duration((time.time() - x) * 1000) + " ago"
            elif isinstance(x, int) and not isinstance(x, bool) and x == -1:
                continue
            else:
                out[k] = tidy(x)
        return out
    if isinstance(v, list): return [tidy(x) for x in v]
    return v
print(json.dumps(tidy(json.load(sys.stdin)), indent=3))'
}

if [ -n "${ZEPA_DEMO_PREBUILT:-}" ]; then
  step "1-2. Programs already built in $build"
  [ -x "$bin_d" ] && [ -x "$bin_c" ] || { echo "demo: no zeparelayd/zeparelayctl in $build" >&2; exit 1; }
else
  step "1. Dependencies (Debian packages)"
  "$src/scripts/install-deps.sh"

  step "2. Build (library, daemon, control tool) in $build"
  cmake -S "$src" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DZEPA_BUILD_TESTS=OFF -DZEPA_BUILD_BENCH=OFF >/dev/null
  ninja -C "$build" zeparelayd_daemon zeparelayctl
fi

step "3. A sample appliance in a staging root"
rm -rf "$stage"
"$src/scripts/stage_appliance.sh" "$stage"
say "system files:      $stage/etc/zepainfo.conf (runrelayd=yes), firewall definitions, router rules"
say "every fixed path of the daemon (config, PID, log, status) lives below this root"

relay_args=()
relay_why=""
if [ "$(id -u)" -ne 0 ]; then
  relay_why="not root (network namespaces and tun devices need root)"
elif [ ! -e /dev/net/tun ]; then
  relay_why="no /dev/net/tun on this machine"
elif ! ip netns add "zepa-demo-probe-$$" 2>/dev/null; then
  relay_why="network namespaces cannot be created here"
else
  ip netns del "zepa-demo-probe-$$"
  relay_args=(--relay "demo$$" --relay-dir "$stage/relay-side")
fi

step "4. Local relay control and alias server (HTTPS on loopback, throwaway CA)"
python3 "$src/tools/localserver/zepa_localserver.py" --ready-file "$stage/tmp/server.json" \
  --cert-dir "$stage/certs" "${relay_args[@]}" &
echo "$!" >"$stage/tmp/server.pid"
for _ in $(seq 100); do [ -f "$stage/tmp/server.json" ] && break; sleep 0.1; done
[ -f "$stage/tmp/server.json" ] || { echo "demo: the local server did not start" >&2; exit 1; }
read -r http_port https_port ca_file < <(py \
  'import json,sys; d=json.load(open(sys.argv[1])); print(d["http_port"], d["https_port"], d["ca_file"])' \
  "$stage/tmp/server.json")
say "control server https://127.0.0.1:$https_port/Serv.php, alias server https://127.0.0.1:$https_port"
say "its CA ($ca_file) is trusted by the daemon through --ca-file (staging only)"
if [ ${#relay_args[@]} -gt 0 ]; then
  echo "zepa-demo$$-a" >"$stage/etc/zepa/appliance_netns"
  cp "$stage/relay-side/pki/ca.crt" "$stage/usr/zepa/etc/zeparelayd/ca/ca.crt"
  say "relay side: openvpn servers (UDP and TCP, port 443) at 10.213.0.1 in namespace zepa-demo$$-r,"
  say "the appliance's network is namespace zepa-demo$$-a with its web UI on port 5000;"
  say "the staged appliance's openvpn runs there and trusts the relay's throwaway VPN CA"
else
  say "relay side skipped: $relay_why; the daemon registers and keeps its alias, but opens no tunnel"
fi

step "5. The relay configuration points at the local server"
cat >"$stage/usr/zepa/etc/zeparelayd/zeparelayd.conf" <<CONF
{
   "server_control" : { "protocol" : "https", "host" : "127.0.0.1", "port" : $https_port },
   "server_alias" : { "alias" : "demo-box", "url" : "https://127.0.0.1:$https_port" },
   "service" : [ { "id" : "nos" }, { "id" : "nos_https" }, { "id" : "http" } ],
   "log_level" : 6,
   "log_file" : "/var/log/zeparelayd.log"
}
CONF
say "$(tr -s ' \n' ' ' <"$stage/usr/zepa/etc/zeparelayd/zeparelayd.conf")"
say "the services it relays (ports taken from the firewall definitions and router rules):"
ctl services | sed 's/^/      /'

step "6. Start the daemon (it forks; the exit status is the child's start-up word)"
set +e
"$bin_d" --root "$stage" --ca-file "$ca_file"
rc=$?
set -e
say "zeparelayd exited with $rc (0 = the daemon is up), PID $(cat "$stage/var/run/zeparelayd.pid")"
[ "$rc" -eq 0 ] || exit 1
say "a second start is refused while it runs:"
set +e
"$bin_d" --root "$stage" --ca-file "$ca_file" 2>&1 | sed 's/^/      /'
say "exit status ${PIPESTATUS[0]}"
set -e

step "7. It registers with the control server and maps its alias"
wait_for 20 "alias_status: good" ctl status
if [ ${#relay_args[@]} -gt 0 ]; then
  say "the control server answered \"connect\": \"tunnel\": the daemon opens a VPN tunnel (state 6 once up)"
  wait_for 60 "tunnel: READY" ctl status
fi
ctl status | sed 's/^/      /'
say "server id stored in the configuration: $(ctl server-id)"

step "8. Ask the doctor: every link checked, nothing changed"
set +e
ctl --timeout 2 doctor | sed 's/^/      /'
rc=${PIPESTATUS[0]}
set -e
say "zeparelayctl doctor exited with $rc (0 every check ok, 1 warnings, 2 a failure)"
if [ ${#relay_args[@]} -gt 0 ]; then
  say "the relay's VPN ports were probed from this machine's own network, which does not reach the"
  say "relay's namespace; on an appliance those two checks test its real path to the relay"
fi

step "9. Ask for an alias update now (SIGRTMIN+1)"
before=$(alias_requests)
ctl update-alias | sed 's/^/      /'
for _ in $(seq 100); do [ "$(alias_requests)" -gt "$before" ] && break; sleep 0.1; done
say "alias requests seen by the server: $before before, $(alias_requests) after"

step "10. The debug dump (SIGUSR1; written within milliseconds)"
# A busy machine may keep the daemon from answering within the query's few
# milliseconds (exit status 11): asking again is what any caller does.
dump=""
for _ in $(seq 20); do
  if dump=$(ctl status --debug); then break; fi
  dump=""
  sleep 0.1
done
[ -n "$dump" ] || { echo "demo: the daemon gave no debug dump" >&2; exit 1; }
printf '%s\n' "$dump" | show_dump | sed 's/^/      /'

step "11. Switch the relay off, then on again"
ctl disable | sed 's/^/      /'
wait_for 10 "state: logout" ctl status
ctl status | sed 's/^/      /'
ctl enable | sed 's/^/      /'
wait_for 20 "state: connected" ctl status
[ ${#relay_args[@]} -gt 0 ] && wait_for 60 "tunnel: READY" ctl status
ctl status | sed 's/^/      /'

step "12. The appliance's web UI from outside, through the relay"
if [ ${#relay_args[@]} -gt 0 ]; then
  url="https://127.0.0.1:$https_port/demo-box/"
  say "GET $url"
  say "(the relay's proxy looks up the alias demo-box, finds the tunnel address the appliance's"
  say " openvpn client got, and forwards the request through the tunnel to port 5000 of the appliance)"
  python3 - "$url" "$ca_file" <<'PY' | sed 's/^/      /'
import ssl, sys, urllib.request
ctx = ssl.create_default_context(cafile=sys.argv[2])
with urllib.request.urlopen(sys.argv[1], context=ctx, timeout=10) as r:
    print("HTTP %d, through tunnel address %s" % (r.status, r.headers.get("X-Relay-Tunnel")))
    print(r.read().decode("utf-8", "replace").strip())
PY
  say "that page was served by the staged appliance inside its own network namespace and reached"
  say "only through the daemon's VPN tunnel"
else
  say "skipped: $relay_why."
  say "as root this step fetches the staged appliance's page through the relay's VPN tunnel"
fi

step "13. Stop the daemon"
ctl stop | sed 's/^/      /'
set +e
ctl status | sed 's/^/      /'
set -e
say "log file: $stage/var/log/zeparelayd.log (last lines)"
tail -n 5 "$stage/var/log/zeparelayd.log" | sed 's/^/      /'

if [ ${#relay_args[@]} -gt 0 ]; then
  say "openvpn clients left: $(pgrep -fc -- "$stage/tmp/.tunnel." || true)"
fi

step "Done: everything started by the demo is stopped again"
