#!/usr/bin/env bash
# Builds the Debian packages (libzepasdk1, libzeparelayd1, libzeparelayd-dev,
# zeparelayd) with CPack from a build configured for the prefix /usr, and runs
# lintian on them when it is installed.
#   usage: scripts/package.sh [BUILD_DIR]      (default: build/package)
# The packages land in BUILD_DIR/packages.
set -euo pipefail
src=$(cd "$(dirname "$0")/.." && pwd)
build=${1:-$src/build/package}
mkdir -p "$build"
build=$(cd "$build" && pwd)
out=$build/packages
jobs=$(nproc 2>/dev/null || echo 2)

step() { printf '\n==> %s\n' "$*"; }
fail() { printf '\npackage.sh: %s\n' "$*" >&2; exit 1; }

command -v dpkg-deb >/dev/null || fail "dpkg-deb is missing: run scripts/install-deps.sh as root"
command -v dpkg-shlibdeps >/dev/null || fail "dpkg-shlibdeps is missing (package dpkg-dev): run scripts/install-deps.sh as root"

launcher=()
if command -v ccache >/dev/null; then
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi

# Debian's hardening flags (stack protector, fortify, relro, bind now), as a
# distribution build would use them.
eval "$(DEB_BUILD_MAINT_OPTIONS=hardening=+all dpkg-buildflags --export=sh)"
export CFLAGS="$CFLAGS $CPPFLAGS" CXXFLAGS="$CXXFLAGS $CPPFLAGS"

step "Configure $build (prefix /usr, no tests or benchmarks)"
cmake -S "$src" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DCMAKE_INSTALL_PREFIX=/usr \
  -DZEPA_BUILD_TESTS=OFF -DZEPA_BUILD_BENCH=OFF "${launcher[@]}" >/dev/null \
  || fail "cmake configure of $build failed"

step "Build"
cmake --build "$build" -j "$jobs" || fail "build of $build failed (see the compiler output above)"

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
