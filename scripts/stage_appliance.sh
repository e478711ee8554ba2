#!/usr/bin/env bash
# Creates a sample appliance below a staging root: the system key/value files,
# firewall service definitions, router rules, the device identity, the
# administrators' notifier stand-in and the folders the daemon writes into.
#
#   scripts/stage_appliance.sh ROOT
#
# The relay configuration itself is written by the caller (it names the
# servers). Everything here is plain files in the formats of sdk/README.md.
set -euo pipefail

root=${1:?usage: stage_appliance.sh ROOT}
mkdir -p "$root"
root=$(cd "$root" && pwd)

mkdir -p "$root/etc" "$root/etc.defaults" "$root/tmp" "$root/var/run" "$root/var/log" \
  "$root/usr/zepa/etc/zeparelayd" "$root/usr/zepa/etc/fw_services" "$root/usr/zepa/etc/router" \
  "$root/usr/zepa/etc/services.d" "$root/usr/zepa/bin" "$root/var/packages"

# System switches: the relay is on, the management UI also answers on HTTPS.
cat >"$root/etc/zepainfo.conf" <<'CONF'
runrelayd="yes"
timezone="Europe/Berlin"
runHTTPS="yes"
runWebHTTPS="no"
external_port_nos_https="5001"
CONF
cat >"$root/etc.defaults/zepainfo.conf" <<'CONF'
upnpmodelname="ZS-220"
CONF

# Firewall definitions of the services the relay can offer.
fw() { # name ports title subtitle
  printf 'name="%s"\ntitle="%s"\nsubtitle="%s"\nprotocol="tcp"\nports="%s"\n' "$1" "$3" "$4" "$2" \
    >"$root/usr/zepa/etc/fw_services/$1.conf"
}
fw nso 5000 Management HTTP
fw nso_https 5001 Management HTTPS
fw http 80 "Web Server" HTTP
fw https 443 "Web Server" HTTPS

# The router forwards the management ports.
cat >"$root/usr/zepa/etc/router/portforward.conf" <<'CONF'
[management]
s_port="5000,5001"
r_port="5000,5001"
protocol name="tcp"
enabled="1"
CONF

# Which groups of services the owner lets through the relay.
cat >"$root/usr/zepa/etc/zeparelayd/services.conf" <<'CONF'
[
   { "id" : "mobile_apps", "enabled" : true },
   { "id" : "file_sharing", "enabled" : true }
]
CONF

# The administrators' notifier: records each notice below the root.
cat >"$root/usr/zepa/bin/zepanosnotify" <<'SH'
#!/bin/sh
root=$(cd "$(dirname "$0")/../../.." && pwd)
echo "$*" >>"$root/var/log/zepanosnotify.log"
SH
chmod 755 "$root/usr/zepa/bin/zepanosnotify"

# Device identity as the manufacturing step leaves it: serial and token, and
# the API key of the cloud service registration.
mkdir -p "$root/etc/zepa"
cat >"$root/etc/zepa/hubtoken.conf" <<'CONF'
serial="2150ZSN012345"
token="5f0c2a9e8d7b41c3a6e0f9b2d4c8e1a7"
CONF
cat >"$root/etc/zepa/cloudservice.conf" <<'CONF'
api_key="3b8f1e6c0a9d47e2b5c1f8a04d7e9b2c6a1f3e8d0b4c7a92e5f1d8b3c6a0e4f7"
CONF

# The tunnel's programs. The appliance ships its own build of the VPN program,
# which knows the option "--zepa-no-verify"; Debian's openvpn refuses every
# option it does not know and exits at once ("Unrecognized option"), so the
# staged /usr/sbin/openvpn drops that one option and runs the real program.
# The real client still checks the relay's certificate chain against --ca.
# The staged appliance's network is a network namespace when
# etc/zepa/appliance_netns names one (the local relay creates it): the real
# program then runs inside it, through exec, so the tunnel's pid stays the
# VPN program's own. Its messages go to var/log/openvpn.log.
mkdir -p "$root/usr/sbin" "$root/usr/zepa/etc.defaults/zeparelayd/scripts" "$root/usr/zepa/etc/zeparelayd/ca"
cat >"$root/usr/sbin/openvpn" <<'SH'
#!/bin/sh
root=$(cd "$(dirname "$0")/../.." && pwd)
real=/usr/sbin/openvpn
if [ "$root/usr/sbin/openvpn" -ef "$real" ]; then
  echo "staged openvpn: refusing to run itself as the real program" >&2
  exit 1
fi
# Asking for the version starts no tunnel and writes no log.
if [ "$#" -eq 1 ] && [ "$1" = "--version" ]; then
  exec "$real" --version
fi
for arg do
  shift
  [ "$arg" = "--zepa-no-verify" ] || set -- "$@" "$arg"
done
set -- "$@" --verb 3 --log-append "$root/var/log/openvpn.log"
# What it says before the log option takes effect goes there too.
exec >>"$root/var/log/openvpn.log" 2>&1
netns=""
[ -f "$root/etc/zepa/appliance_netns" ] && netns=$(cat "$root/etc/zepa/appliance_netns")
if [ -n "$netns" ]; then
  exec nsenter --net="/run/netns/$netns" "$real" "$@"
fi
exec "$real" "$@"
SH
chmod 755 "$root/usr/sbin/openvpn"

# Route-up script: openvpn runs it with the daemon's pid once the tunnel's
# routes are set. It publishes the relay's end of the tunnel ("peer_ip") and
# the appliance's own tunnel address, then wakes the daemon with SIGUSR2.
cat >"$root/usr/zepa/etc.defaults/zeparelayd/scripts/up.sh" <<'SH'
#!/bin/sh
root=$(cd "$(dirname "$0")/../../../../.." && pwd)
info="$root/tmp/.zepa_farlink_tunnel_info"
peer=${ifconfig_remote:-${route_vpn_gateway:-}}
tmp="$info.$$"
printf 'peer_ip="%s"\nlocal_ip="%s"\ndev="%s"\n' "$peer" "${ifconfig_local:-}" "${dev:-}" >"$tmp" &&
  mv -f "$tmp" "$info"
echo "up pid=$1 peer=$peer local=${ifconfig_local:-}" >>"$root/var/log/tunnel-scripts.log"
case "$1" in
  ''|*[!0-9]*|0) exit 0 ;;
esac
kill -USR2 "$1"
SH
# Down script: the tunnel is gone, so is what the up script published.
cat >"$root/usr/zepa/etc.defaults/zeparelayd/scripts/down.sh" <<'SH'
#!/bin/sh
root=$(cd "$(dirname "$0")/../../../../.." && pwd)
rm -f "$root/tmp/.zepa_farlink_tunnel_info"
echo "down $*" >>"$root/var/log/tunnel-scripts.log"
SH
chmod 755 "$root/usr/zepa/etc.defaults/zeparelayd/scripts/up.sh" \
  "$root/usr/zepa/etc.defaults/zeparelayd/scripts/down.sh"

# The module tool loads and unloads the tunnel's kernel modules on the
# appliance. A developer's machine keeps its own modules: the stand-in only
# records each call.
cat >"$root/usr/zepa/bin/iptablestool" <<'SH'
#!/bin/sh
root=$(cd "$(dirname "$0")/../../.." && pwd)
echo "$*" >>"$root/var/log/iptablestool.log"
SH
chmod 755 "$root/usr/zepa/bin/iptablestool"
# The kernel's tun device, as openvpn finds it on the appliance: the staged
# path leads to this machine's device.
mkdir -p "$root/dev/net"
[ -e "$root/dev/net/tun" ] || [ -L "$root/dev/net/tun" ] || ln -s /dev/net/tun "$root/dev/net/tun"

# The relay's CA certificate ships with the appliance. A placeholder until a
# local relay puts its own there (see tools/localserver/README.md): a
# throwaway self-signed certificate whose key is thrown away at once.
ca="$root/usr/zepa/etc/zeparelayd/ca/ca.crt"
if [ ! -e "$ca" ]; then
  key=$(mktemp)
  openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -keyout "$key" \
    -out "$ca" -days 3650 -subj "/CN=Staged Relay Placeholder CA" 2>/dev/null
  rm -f "$key"
fi

echo "staged a sample appliance in $root"
