#!/usr/bin/env bash
# Cross-builds the library, the SDK stand-in, the daemon, the control tool and
# the tests for an ARM target and runs the tests under qemu-user through CTest.
#   usage: scripts/cross.sh arm64|armhf [--no-test] [--packages] [--figures] [--jobs N] [--setup-only]
# --packages also builds and checks the target's Debian packages (the test
# package.debian_packages, left out otherwise). --figures prints the stripped
# sizes of the library, the SDK, the daemon and the control tool and, after
# the tests, the daemon's memory once connected (scripts/daemon_footprint.sh).
# Installs what it needs (as root; idempotent): the cross compilers
# (crossbuild-essential-ARCH) and qemu-user-static. The target's libraries
# come from Debian's ARCH packages unpacked into a sysroot
# (build/cross-ARCH/sysroot) with a private apt state: the build machine's own
# packages stay untouched, and no version has to match theirs.
# Exit status: 0 built and all tests passed; 1 build or tests failed;
# 2 usage; 3 prerequisites could not be installed (missing packages or an
# out-of-sync mirror: the message says which); 4 built, but binfmt_misc is not
# available, so tests that start ARM programs cannot run (the message says
# why); tests were not run.
set -euo pipefail
src=$(cd "$(dirname "$0")/.." && pwd)
cd "$src"

arch=${1:-}
shift || true
run_tests=1
figures=0
setup_only=0
packages=0
jobs=$(nproc 2>/dev/null || echo 2)
while [ $# -gt 0 ]; do
  case $1 in
    --no-test) run_tests=0 ;;
    --setup-only) setup_only=1 ;;
    --packages) packages=1 ;;
    --figures) figures=1 ;;
    --jobs) jobs=$2; shift ;;
    *) echo "cross.sh: unknown option $1" >&2; exit 2 ;;
  esac
  shift
done
case $arch in
  arm64) triplet=aarch64-linux-gnu; qemu=qemu-aarch64-static; binfmt=qemu-aarch64; machine=AArch64 ;;
  armhf) triplet=arm-linux-gnueabihf; qemu=qemu-arm-static; binfmt=qemu-arm; machine=ARM ;;
  *) echo "usage: scripts/cross.sh arm64|armhf [--no-test] [--figures] [--jobs N] [--setup-only] [--packages]" >&2; exit 2 ;;
esac

step() { printf '\n==> [%s] %s\n' "$arch" "$*"; }
fail() { printf '\ncross.sh [%s]: %s\n' "$arch" "$*" >&2; exit "${2:-1}"; }
is_root() { [ "$(id -u)" -eq 0 ]; }

build=$src/build/cross-$arch
sysroot=$build/sysroot
aptdir=$build/apt
mkdir -p "$build"

# --- build machine packages -------------------------------------------------
step "Build machine packages"
./scripts/install-deps.sh || fail "installing the native dependencies failed: run scripts/install-deps.sh as root" 3
host_pkgs=(crossbuild-essential-"$arch" qemu-user-static)
missing=()
for p in "${host_pkgs[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  is_root || fail "missing packages: ${missing[*]}; run this script as root or install them with apt-get" 3
  echo "installing ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  ok=0
  for wait in 0 10 30; do
    sleep "$wait"
    apt-get update -qq || true
    if apt-get install -y -qq --no-install-recommends "${missing[@]}"; then ok=1; break; fi
    echo "apt-get install failed; retrying after a fresh apt-get update (the mirror may be syncing)"
  done
  [ $ok = 1 ] || fail "could not install ${missing[*]} (apt-get output above)" 3
else
  echo "present: ${host_pkgs[*]}"
fi

# --- target sysroot -----------------------------------------------------------
# Libraries the build and the tests need for the target, with their runtime
# dependencies; the C library and libstdc++ are what qemu loads.
target_pkgs=(libjsoncpp-dev libcurl4-openssl-dev libssl-dev libdaemon-dev libsystemd-dev libboost-dev
  libgtest-dev libgmock-dev libc6 libstdc++6 libgcc-s1)
stamp=$sysroot/.zepa-packages
want="2 $arch ${target_pkgs[*]}"
if [ -f "$stamp" ] && [ "$(cat "$stamp")" = "$want" ]; then
  step "Sysroot $sysroot is up to date"
else
  step "Sysroot: $arch packages from Debian's mirror into $sysroot"
  rm -rf "$sysroot" "$aptdir"
  mkdir -p "$aptdir"/lists/partial "$aptdir"/cache/archives/partial "$aptdir"/sources "$aptdir"/prefs
  : >"$aptdir/status"
  # The machine's Debian sources, without third-party repositories.
  n=0
  for f in /etc/apt/sources.list /etc/apt/sources.list.d/*.list /etc/apt/sources.list.d/*.sources; do
    [ -f "$f" ] || continue
    case $f in
      *.list) grep -E '^[[:space:]]*deb[[:space:]].*debian' "$f" >"$aptdir/sources/$n.list" || true ;;
      *.sources) if grep -q 'debian-archive-keyring\|debian\.org' "$f"; then cp "$f" "$aptdir/sources/$n.sources"; fi ;;
    esac
    n=$((n + 1))
  done
  aptopt=(-o Dir::State="$aptdir" -o Dir::State::status="$aptdir/status" -o Dir::State::Lists="$aptdir/lists"
    -o Dir::Cache="$aptdir/cache" -o Dir::Etc::SourceList=/dev/null -o Dir::Etc::SourceParts="$aptdir/sources"
    -o Dir::Etc::Preferences=/dev/null -o Dir::Etc::PreferencesParts="$aptdir/prefs"
    -o APT::Architecture="$arch" -o APT::Architectures::="$arch" -o Debug::NoLocking=1
    -o APT::Sandbox::User=root -o Acquire::Retries=3)
  # An index that is being synced on the mirror fails its size or hash check;
  # retry, then go on with the indexes that did arrive and say which did not.
  index_errors=
  for wait in 0 5 10; do
    sleep "$wait"
    if apt-get "${aptopt[@]}" update -q >"$aptdir/update.log" 2>&1; then index_errors=; break; fi
    index_errors=$(grep -E '^(E|W):' "$aptdir/update.log" || true)
    echo "apt-get update for $arch reported errors; retrying (the mirror may be syncing):"
    echo "$index_errors" | sed 's/^/    /'
  done
  if [ -n "$index_errors" ]; then
    echo "WARNING: some $arch indexes are still out of sync on the mirror; the sysroot takes the versions of the"
    echo "         indexes that did arrive (for building and testing only; the packages built need no exact version):"
    echo "$index_errors" | sed 's/^/    /'
  fi
  if ! apt-get "${aptopt[@]}" install --download-only -y -q --no-install-recommends "${target_pkgs[@]}" \
    >"$aptdir/download.log" 2>&1; then
    cat "$aptdir/download.log" >&2
    fail "could not fetch the $arch packages ${target_pkgs[*]} from the mirror (apt-get output above; an
index still out of sync on the mirror is the usual cause: try again later)" 3
  fi
  mkdir -p "$sysroot"
  count=0
  # The packages' shlibs lines tell scripts/package.sh --arch what the
  # binaries' dependencies are.
  : >"$sysroot/.zepa-shlibs"
  for deb in "$aptdir"/cache/archives/*.deb; do
    dpkg-deb -x "$deb" "$sysroot"
    dpkg-deb --ctrl-tarfile "$deb" | tar -xO ./shlibs 2>/dev/null >>"$sysroot/.zepa-shlibs" || true
    count=$((count + 1))
  done
  # Absolute links (libfoo.so -> /lib/...) must point into the sysroot.
  find "$sysroot" -type l -lname '/*' | while read -r link; do
    target=$(readlink "$link")
    ln -sfn "$sysroot$target" "$link"
  done
  # qemu looks up every absolute path in the sysroot first: keep only what
  # the loader and the linker need there.
  rm -rf "$sysroot"/usr/share/doc "$sysroot"/usr/share/man "$sysroot"/usr/share/lintian "$sysroot"/etc \
    "$sysroot"/usr/share/locale "$sysroot"/usr/bin "$sysroot"/usr/sbin "$sysroot"/bin "$sysroot"/sbin
  echo "$want" >"$stamp"
  echo "unpacked $count packages ($(du -sh "$sysroot" | cut -f1))"
fi

# --- binfmt_misc ---------------------------------------------------------------
# Tests start programs (the daemon, the control tool, themselves after fork);
# an emulated process can exec another ARM program only when the kernel knows
# to hand it to qemu. F opens qemu at registration, so it works in any root.
step "binfmt_misc entry $binfmt"
binfmt_ok=1
binfmt_why=
entry=/proc/sys/fs/binfmt_misc/$binfmt
if [ -f "$entry" ] && grep -qx enabled "$entry" && grep -q '^flags:.*F' "$entry"; then
  echo "registered: $(grep '^interpreter' "$entry")"
elif ! is_root; then
  binfmt_ok=0; binfmt_why="$binfmt is not registered in binfmt_misc and registering it needs root"
else
  if [ ! -f /proc/sys/fs/binfmt_misc/register ]; then
    mount -t binfmt_misc binfmt_misc /proc/sys/fs/binfmt_misc 2>/dev/null || true
  fi
  if [ ! -f /proc/sys/fs/binfmt_misc/register ]; then
    binfmt_ok=0; binfmt_why="binfmt_misc cannot be mounted here (mount -t binfmt_misc failed)"
  else
    conf=/usr/lib/binfmt.d/$binfmt.conf
    [ -f "$conf" ] || fail "$conf is missing (package qemu-user-static)" 3
    line=$(grep -v '^#' "$conf" | head -n 1)
    case ${line##*:} in *F*) ;; *) line="${line}F" ;; esac
    [ -f "$entry" ] && echo -1 >"$entry"
    if printf '%s' "$line" >/proc/sys/fs/binfmt_misc/register 2>/dev/null; then
      echo "registered $binfmt with flags ${line##*:}"
    else
      binfmt_ok=0; binfmt_why="registering $binfmt in binfmt_misc failed"
    fi
  fi
fi

if [ $setup_only = 1 ]; then
  step "Set up: compilers, qemu and the sysroot $sysroot"
  exit 0
fi

# --- configure and build -------------------------------------------------------
launcher=()
if command -v ccache >/dev/null; then
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi
step "Configure $build/obj ($triplet, toolchain cmake/toolchains/$arch.cmake)"
cmake -S . -B "$build/obj" -G Ninja -DCMAKE_TOOLCHAIN_FILE="$src/cmake/toolchains/$arch.cmake" \
  -DZEPA_CROSS_SYSROOT="$sysroot" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZEPA_WERROR=ON -DZEPA_BUILD_BENCH=OFF \
  "${launcher[@]}" >"$build/configure.log" 2>&1 || { cat "$build/configure.log" >&2; fail "cmake configure failed (output above)"; }
step "Build (-j$jobs)"
export QEMU_LD_PREFIX=$sysroot
t0=$(date +%s)
cmake --build "$build/obj" -j "$jobs" || fail "cross build failed (see the compiler output above)"
echo "built in $(($(date +%s) - t0)) s"

# --- figures -------------------------------------------------------------------
print_sizes() {
  local strip=$triplet-strip tmp
  tmp=$(mktemp -d)
  echo "stripped sizes ($arch):"
  for f in src/libzeparelayd.so.1 sdk/libzepasdk.so.1 tools/zeparelayd/zeparelayd tools/zeparelayctl/zeparelayctl; do
    local path=$build/obj/$f
    path=$(readlink -f "$path")
    "$strip" --strip-unneeded -o "$tmp/x" "$path"
    printf '  %-16s %8d bytes  (%s)\n' "$(basename "$f")" "$(stat -c %s "$tmp/x")" \
      "$(file -b "$tmp/x" | cut -d, -f1-2)"
  done
  rm -rf "$tmp"
}
[ $figures = 1 ] && print_sizes

[ $run_tests = 1 ] || { step "Tests not run (--no-test)"; exit 0; }
if [ $binfmt_ok = 0 ]; then
  printf '\ncross.sh [%s]: built; tests NOT run: %s.\n' "$arch" "$binfmt_why" >&2
  printf 'Run as root on a machine where binfmt_misc can be mounted to run them.\n' >&2
  exit 4
fi

# --- tests ---------------------------------------------------------------------
step "Tests under $qemu (-j$jobs)"
t0=$(date +%s)
set +e
# The real fleet (label real_fleet) is a plain-build test: minutes of waiting.
exclude=(-LE real_fleet)
[ $packages = 1 ] || exclude+=(-E '^package\.')
(cd "$build/obj" && ctest -j "$jobs" --output-on-failure --timeout 300 "${exclude[@]}") | tee "$build/ctest.log"
rc=${PIPESTATUS[0]}
set -e
echo "tests took $(($(date +%s) - t0)) s under qemu ($arch)"
grep -E '^[[:space:]]*[0-9]+% tests passed' "$build/ctest.log" | sed "s/^/[$arch] /" || true
[ "$rc" -eq 0 ] || fail "tests failed under qemu (output above)"
if [ $figures = 1 ]; then
  step "Footprint of the daemon under $qemu"
  "$src/scripts/daemon_footprint.sh" "$build/obj" || fail "measuring the daemon failed (above)"
fi
step "All tests passed under qemu ($arch)"
