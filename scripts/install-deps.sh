#!/usr/bin/env bash
# Installs every build, test and demo dependency from Debian's packages.
# Idempotent: when everything is present it installs nothing and says so.
set -euo pipefail

PACKAGES=(
  g++ cmake ninja-build pkg-config make
  libjsoncpp-dev libcurl4-openssl-dev libssl-dev libdaemon-dev libboost-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  python3 openssl ca-certificates procps iproute2 clang-format clang-tidy
  libsystemd-dev systemd dpkg-dev file lintian
  openvpn strace valgrind
  python3-matplotlib
)

missing=()
for p in "${PACKAGES[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed'; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  echo "install-deps: all ${#PACKAGES[@]} packages already present, nothing to do"
  exit 0
fi

if [ "$(id -u)" -ne 0 ]; then
  echo "install-deps: missing packages: ${missing[*]}" >&2
  echo "install-deps: run this script as root (or install them with apt-get) and try again" >&2
  exit 1
fi

echo "install-deps: installing ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
apt-get install -y -qq --no-install-recommends "${missing[@]}"
echo "install-deps: done"
