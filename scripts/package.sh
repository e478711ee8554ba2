#!/usr/bin/env bash
# Builds the Debian packages (libzepasdk1, libzeparelayd1, libzeparelayd-dev,
# zeparelayd) with CPack from a build configured for the prefix /usr, and runs
# lintian on them when it is installed.
#   usage: scripts/package.sh [--arch arm64|armhf] [BUILD_DIR]
# The packages land in BUILD_DIR/packages (default build/package, or
# build/package-ARCH for a cross build). With --arch the build is a cross build
# (scripts/cross.sh --setup-only installs the compilers and the sysroot).
set -euo pipefail
src=$(cd "$(dirname "$0")/.." && pwd)
arch=
if [ "${1:-}" = "--arch" ]; then
  arch=${2:-}
  shift 2 || true
  case $arch in
    arm64) triplet=aarch64-linux-gnu ;;
    armhf) triplet=arm-linux-gnueabihf ;;
    *) echo "usage: scripts/package.sh [--arch arm64|armhf] [BUILD_DIR]" >&2; exit 2 ;;
  esac
fi
build=${1:-$src/build/package${arch:+-$arch}}
mkdir -p "$build"
build=$(cd "$build" && pwd)
out=$build/packages
jobs=$(nproc 2>/dev/null || echo 2)

step() { printf '\n==> %s\n' "$*"; }
fail() { printf '\npackage.sh: %s\n' "$*" >&2; exit "${2:-1}"; }

command -v dpkg-deb >/dev/null || fail "dpkg-deb is missing: run scripts/install-deps.sh as root"
command -v dpkg-shlibdeps >/dev/null || fail "dpkg-shlibdeps is missing (package dpkg-dev): run scripts/install-deps.sh as root"

launcher=()
if command -v ccache >/dev/null; then
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi

cross=()
if [ -n "$arch" ]; then
  step "Cross compilers and the $arch sysroot (scripts/cross.sh $arch --setup-only)"
  rc=0
  "$src/scripts/cross.sh" "$arch" --setup-only || rc=$?
  [ $rc -eq 0 ] || fail "scripts/cross.sh $arch --setup-only failed (above)" $rc
  sysroot=$src/build/cross-$arch/sysroot
  cross=(-DCMAKE_TOOLCHAIN_FILE="$src/cmake/toolchains/$arch.cmake" -DZEPA_CROSS_SYSROOT="$sysroot")
  export DEB_HOST_ARCH=$arch
fi

# Debian's hardening flags (stack protector, fortify, relro, bind now), as a
# distribution build would use them.
eval "$(DEB_BUILD_MAINT_OPTIONS=hardening=+all dpkg-buildflags --export=sh)"
export CFLAGS="$CFLAGS $CPPFLAGS" CXXFLAGS="$CXXFLAGS $CPPFLAGS"

step "Configure $build (prefix /usr, no tests or benchmarks)"
cmake -S "$src" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DCMAKE_INSTALL_PREFIX=/usr \
  -DZEPA_BUILD_TESTS=OFF -DZEPA_BUILD_BENCH=OFF "${launcher[@]}" "${cross[@]}" >/dev/null \
  || fail "cmake configure of $build failed"

step "Build"
cmake --build "$build" -j "$jobs" || fail "build of $build failed (see the compiler output above)"

# What dpkg-shlibdeps does natively: each library a binary needs, named by
# the shlibs line of the target's package that ships it.
shlibs_of() {
  local f soname name ver line
  for f in "$@"; do "$triplet-readelf" -d "$f" | sed -n 's/.*(NEEDED).*\[\(.*\)\]/\1/p'; done | sort -u |
    while read -r soname; do
      case $soname in libzepasdk.so.* | libzeparelayd.so.*) continue ;; esac
      name=${soname%%.so*}
      ver=${soname#*.so.}
      line=$(awk -v n="$name" -v v="$ver" '$1 == n && $2 == v { $1 = ""; $2 = ""; sub(/^ +/, ""); print; exit }' \
        "$sysroot/.zepa-shlibs")
      [ -n "$line" ] || { echo "package.sh: no shlibs entry for $soname in $sysroot" >&2; echo "?"; continue; }
      echo "$line"
    done | sort -u | paste -sd, - | sed 's/,/, /g'
}
if [ -n "$arch" ]; then
  step "Dependencies from the $arch shlibs files"
  sdk=$(shlibs_of "$build/sdk/libzepasdk.so.1")
  runtime=$(shlibs_of "$build/src/libzeparelayd.so.1")
  daemon=$(shlibs_of "$build/tools/zeparelayd/zeparelayd" "$build/tools/zeparelayctl/zeparelayctl")
  case "$sdk$runtime$daemon" in *'?'*) fail "a library of the binaries has no shlibs entry (above)" ;; esac
  printf '  libzepasdk1: %s\n  libzeparelayd1: %s\n  zeparelayd: %s\n' "$sdk" "$runtime" "$daemon"
  cmake "$build" -DZEPA_DEB_SHLIBS_SDK="$sdk" -DZEPA_DEB_SHLIBS_RUNTIME="$runtime" -DZEPA_DEB_SHLIBS_DAEMON="$daemon" \
    >/dev/null || fail "cmake could not take the dependencies"
fi

step "Package"
rm -rf "$out"
(cd "$build" && cpack -G DEB -B "$out") || fail "cpack failed (output above; 'cpack --verbose' in $build tells more)"
rm -rf "$out/_CPack_Packages"
ls -l "$out"/*.deb

if command -v lintian >/dev/null; then
  step "lintian"
  lintian --fail-on error,warning "$out"/*.deb || fail "lintian found problems in the packages (listed above)"
  echo "lintian: no errors or warnings"
else
  step "lintian is not installed: packages not checked (scripts/install-deps.sh installs it)"
fi
step "Packages in $out"
