#!/usr/bin/env bash
# Starts the daemon of a build against the local relay in a staged appliance
# root, waits until it is connected and prints its resident memory; stops
# everything it started, also when interrupted.
#   usage: scripts/daemon_footprint.sh BUILD_DIR
# For a cross build the daemon runs under qemu-user (binfmt_misc; set
# QEMU_LD_PREFIX to the sysroot): its RSS is then the emulator process's, the
# program's memory plus qemu's own, which the emulator line shows apart.
set -euo pipefail
src=$(cd "$(dirname "$0")/.." && pwd)
build=$(cd "${1:?usage: scripts/daemon_footprint.sh BUILD_DIR}" && pwd)
daemon=$build/tools/zeparelayd/zeparelayd
ctl=$build/tools/zeparelayctl/zeparelayctl
[ -x "$daemon" ] && [ -x "$ctl" ] || { echo "daemon_footprint.sh: build $build has no daemon or control tool" >&2; exit 1; }

work=$(mktemp -d /tmp/zepa-footprint.XXXXXX)
root=$work/root
server=
cleanup() {
  "$ctl" --root "$root" stop >/dev/null 2>&1 || true
  [ -z "$server" ] || { kill "$server" 2>/dev/null; wait "$server" 2>/dev/null || true; }
  rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

bash "$src/scripts/stage_appliance.sh" "$root" >/dev/null
python3 "$src/tools/localserver/zepa_localserver.py" --ready-file "$work/ready.json" --cert-dir "$work/certs" \
  >/dev/null 2>"$work/server.log" &
server=$!
for _ in $(seq 300); do [ -s "$work/ready.json" ] && break; sleep 0.1; done
[ -s "$work/ready.json" ] || { echo "daemon_footprint.sh: the local server did not start" >&2; exit 1; }
read -r port ca < <(python3 -c 'import json,sys; d=json.load(open(sys.argv[1])); print(d["https_port"], d["ca_file"])' \
  "$work/ready.json")
cat >"$root/usr/zepa/etc/zeparelayd/zeparelayd.conf" <<EOF
{
   "server_control": {"protocol": "https", "host": "127.0.0.1", "port": $port},
   "server_alias": {"alias": "footprint-box", "url": "https://127.0.0.1:$port"},
   "service": [{"id": "nos"}, {"id": "nos_https"}],
   "log_level": 5,
   "log_file": "/var/log/zeparelayd.log"
}
EOF
"$daemon" --root "$root" --ca-file "$ca" || { echo "daemon_footprint.sh: zeparelayd did not start" >&2; exit 1; }
connected=0
for _ in $(seq 600); do
  if "$ctl" --root "$root" status 2>/dev/null | grep -qx 'state: connected'; then connected=1; break; fi
  sleep 0.1
done
[ $connected = 1 ] || { echo "daemon_footprint.sh: the daemon never connected" >&2; exit 1; }
pid=$(cat "$root/var/run/zeparelayd.pid")
rss=$(awk '/^VmRSS:/ {print $2}' "/proc/$pid/status")
hwm=$(awk '/^VmHWM:/ {print $2}' "/proc/$pid/status")
exe=$(readlink "/proc/$pid/exe" || true)
echo "daemon after connecting: RSS $rss KiB, peak $hwm KiB (process: $exe)"
case $exe in
  *qemu*)
    # What the emulator alone takes: a program that only prints its usage.
    base=$(python3 -c 'import resource, subprocess, sys
subprocess.run(sys.argv[1:], stdout=subprocess.DEVNULL)
print(resource.getrusage(resource.RUSAGE_CHILDREN).ru_maxrss)' "$ctl" --help)
    echo "emulator alone (zeparelayctl --help under qemu): peak $base KiB; the RSS above includes it"
    ;;
esac
