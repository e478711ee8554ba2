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
echo "staged a sample appliance in $root"
