#!/usr/bin/env bash
# Builds the Debian packages with scripts/package.sh (or takes them from
# $ZEPA_PACKAGE_DIR), checks what each one holds and declares, extracts them
# into a throwaway root with dpkg-deb -x and runs the installed programs and
# the systemd unit check from there.
# With ARCH (arm64, armhf) the packages are cross-built for it
# (scripts/package.sh --arch) and the programs run under qemu when binfmt_misc
# knows it (scripts/cross.sh registers it).
#   usage: check_packages.sh SOURCE_DIR PACKAGE_BUILD_DIR [ARCH]
set -euo pipefail
src=$1
build=$2
arch=${3:-}

if ! command -v dpkg-deb >/dev/null; then
  echo "SKIPPED: dpkg-deb is not installed (not a Debian system); the packages were not built or checked"
  exit 77
fi

fail() { echo "FAIL: $*" >&2; exit 1; }
work=$(mktemp -d /tmp/zepa-package.XXXXXX)
trap 'rm -rf "$work"' EXIT

if [ -n "${ZEPA_PACKAGE_DIR:-}" ]; then
  debs=$ZEPA_PACKAGE_DIR
  echo "== taking the packages from $debs"
else
  echo "== building the packages (scripts/package.sh ${arch:+--arch $arch }$build)"
  "$src/scripts/package.sh" ${arch:+--arch "$arch"} "$build"
  debs=$build/packages
fi

version=$(sed -n 's/^project(zeparelayd VERSION \([0-9.]*\).*/\1/p' "$src/CMakeLists.txt")
deb() { ls "$debs/$1"_"$version"-*_*.deb 2>/dev/null | head -n 1; }
field() { dpkg-deb -f "$(deb "$1")" "$2"; }
holds() {  # package, path: the package's file list has the path
  dpkg-deb -c "$(deb "$1")" | awk '{print $6}' | sed 's|^\./|/|' | grep -x "$2" >/dev/null || fail "$1 does not hold $2"
}
lacks() {  # package, pattern
  if dpkg-deb -c "$(deb "$1")" | awk '{print $6}' | grep "$2" >/dev/null; then fail "$1 holds $2"; fi
}

echo "== package set and relations"
for p in libzepasdk1 libzeparelayd1 libzeparelayd-dev zeparelayd; do
  [ -n "$(deb $p)" ] || fail "no package $p $version in $debs"
  [ "$(field $p Package)" = "$p" ] || fail "$p: wrong Package field"
done
full=$(field libzeparelayd1 Version)
field libzeparelayd1 Depends | grep "libzepasdk1 (= $full)" >/dev/null || fail "libzeparelayd1 does not depend on libzepasdk1 $full"
field libzeparelayd-dev Depends | grep "libzeparelayd1 (= $full)" >/dev/null || fail "libzeparelayd-dev does not depend on libzeparelayd1 $full"
field zeparelayd Depends | grep "libzeparelayd1 (= $full)" >/dev/null || fail "zeparelayd does not depend on libzeparelayd1 $full"
# Dependencies on the distribution's libraries come from the binaries.
field libzeparelayd1 Depends | grep "libjsoncpp" >/dev/null || fail "libzeparelayd1 lacks its jsoncpp dependency"
dpkg-deb --ctrl-tarfile "$(deb libzeparelayd1)" | tar -xO ./shlibs | grep -x "libzeparelayd 1 libzeparelayd1 (= $full)" >/dev/null \
  || fail "libzeparelayd1 has no shlibs entry for its SONAME"

echo "== architecture"
# The ELF machine every binary must be built for, as readelf names it.
case ${arch:-native} in
  arm64) machine=AArch64; triplet=aarch64-linux-gnu; qemu_entry=qemu-aarch64 ;;
  armhf) machine=ARM; triplet=arm-linux-gnueabihf; qemu_entry=qemu-arm ;;
  native)
    arch=$(dpkg --print-architecture)
    triplet=$(dpkg-architecture -qDEB_HOST_MULTIARCH 2>/dev/null || gcc -print-multiarch)
    machine=$(readelf -h "$(command -v dpkg-deb)" | sed -n 's/^ *Machine: *//p')
    qemu_entry= ;;
  *) fail "unknown architecture '$arch'" ;;
esac
for p in libzepasdk1 libzeparelayd1 libzeparelayd-dev zeparelayd; do
  [ "$(field $p Architecture)" = "$arch" ] || fail "$p: Architecture is '$(field $p Architecture)', not $arch"
done
echo "Architecture $arch, ELF machine $machine, multiarch $triplet"

echo "== contents"
multiarch=$(dpkg-deb -c "$(deb libzeparelayd1)" | awk '{print $6}' | sed -n 's|^\./usr/lib/\([^/]*\)/libzeparelayd\.so\.1$|\1|p')
[ -n "$multiarch" ] || fail "libzeparelayd1 has no usr/lib/<triplet>/libzeparelayd.so.1"
[ "$multiarch" = "$triplet" ] || fail "libzeparelayd1 puts its library in usr/lib/$multiarch, not usr/lib/$triplet"
lib=/usr/lib/$multiarch
holds libzepasdk1 "$lib/libzepasdk.so.1"
lacks libzepasdk1 'libzepasdk\.so$'
holds libzeparelayd1 "$lib/libzeparelayd.so.1"
lacks libzeparelayd1 'libzeparelayd\.so$\|include/'
for h in "$src"/include/zeparelayd/*.h; do holds libzeparelayd-dev "/usr/include/zeparelayd/$(basename "$h")"; done
for h in "$src"/sdk/include/zepasdk/*.h; do holds libzeparelayd-dev "/usr/include/zepasdk/$(basename "$h")"; done
for f in libzeparelayd.so libzepasdk.so pkgconfig/zeparelayd.pc pkgconfig/zepasdk.pc cmake/zeparelayd/zeparelaydConfig.cmake; do
  holds libzeparelayd-dev "$lib/$f"
done
for f in /usr/sbin/zeparelayd /usr/bin/zeparelayctl /usr/lib/systemd/system/zeparelayd.service \
         /etc/logrotate.d/zeparelayd /usr/share/man/man8/zeparelayd.8.gz /usr/share/man/man8/zeparelayctl.8.gz \
         /usr/share/man/man5/zeparelayd.conf.5.gz /usr/share/doc/zeparelayd/examples/zeparelayd.conf; do
  holds zeparelayd "$f"
done
dpkg-deb --ctrl-tarfile "$(deb zeparelayd)" | tar -xO ./conffiles | grep -x /etc/logrotate.d/zeparelayd >/dev/null \
  || fail "the logrotate file is not a conffile"
for p in libzepasdk1 libzeparelayd1 libzeparelayd-dev zeparelayd; do
  holds $p "/usr/share/doc/$p/copyright"
  holds $p "/usr/share/doc/$p/changelog.Debian.gz"
done

echo "== extract into a throwaway root"
root=$work/root
for p in libzepasdk1 libzeparelayd1 libzeparelayd-dev zeparelayd; do dpkg-deb -x "$(deb $p)" "$root"; done
soname=$(readelf -d "$root$lib/libzeparelayd.so.1" | sed -n 's/.*(SONAME).*\[\(.*\)\]/\1/p')
[ "$soname" = "libzeparelayd.so.1" ] || fail "SONAME is '$soname'"
elves=0
while IFS= read -r -d '' f; do
  [ "$(head -c 4 "$f" | od -An -c | tr -d ' ')" = '177ELF' ] || continue
  got=$(readelf -h "$f" | sed -n 's/^ *Machine: *//p')
  [ "$got" = "$machine" ] || fail "${f#"$root"} is built for '$got', not $machine"
  elves=$((elves + 1))
done < <(find "$root" -type f -print0)
[ "$elves" -ge 4 ] || fail "only $elves ELF files in the packages"
echo "$elves ELF files, all for $machine"

echo "== the installed programs run from there"
if [ -n "$qemu_entry" ] && ! grep -qx enabled "/proc/sys/fs/binfmt_misc/$qemu_entry" 2>/dev/null; then
  echo "SKIPPED part: $qemu_entry is not registered in binfmt_misc (scripts/cross.sh $arch registers it as root),"
  echo "so the $arch programs cannot run here"
  echo "package check passed"
  exit 0
fi
if [ -n "$qemu_entry" ]; then
  # The target's own libraries for qemu's loader.
  export QEMU_LD_PREFIX=$src/build/cross-$arch/sysroot
fi
# Their RUNPATH ($ORIGIN/../lib/<triplet>) finds the staged libraries of ours
# they need, not any the system may have.
for prog in usr/sbin/zeparelayd usr/bin/zeparelayctl; do
  needed=$(readelf -d "$root/$prog" | sed -n 's/.*(NEEDED).*\[\(libzep.*\)\]/\1/p')
  [ -n "$needed" ] || fail "$prog needs none of the packaged libraries"
  if [ -n "$qemu_entry" ]; then
    # ldd cannot look into a foreign program: its RUNPATH must name the
    # packaged folder, and the run below proves that the loader follows it.
    readelf -d "$root/$prog" | grep -qF "[\$ORIGIN/../lib/$triplet]" || fail "$prog has no RUNPATH \$ORIGIN/../lib/$triplet"
    continue
  fi
  loaded=$(ldd "$root/$prog")
  for so in $needed; do
    grep -qF "$so => $root/" <<<"$loaded" || { echo "$loaded"; fail "$prog does not load the staged $so"; }
  done
done
out=$("$root/usr/sbin/zeparelayd" --version)
[ "$out" = "zeparelayd $version" ] || fail "zeparelayd --version said '$out'"
# A sample appliance in the same root, with the shipped example configuration.
bash "$src/scripts/stage_appliance.sh" "$root" >/dev/null
cp "$root/usr/share/doc/zeparelayd/examples/zeparelayd.conf" "$root/usr/zepa/etc/zeparelayd/zeparelayd.conf"
rc=0; out=$("$root/usr/bin/zeparelayctl" --root "$root" status 2>"$work/err") || rc=$?
[ "$rc" -eq 1 ] || fail "zeparelayctl status without a daemon exited $rc (expected 1): $out $(cat "$work/err")"
grep -qx 'state: not_running' <<<"$out" || fail "zeparelayctl status said: $out"
grep -qx 'alias: my-nas' <<<"$out" || fail "zeparelayctl status did not read the example configuration: $out"
# Every service of the example is valid on the appliance (ports from its firewall definitions).
out=$("$root/usr/bin/zeparelayctl" --root "$root" services 2>"$work/err") || fail "zeparelayctl services failed"
for id in nos nos_https; do grep -q "^$id" <<<"$out" || fail "service $id of the example is missing: $out"; done
[ ! -s "$work/err" ] || fail "the example configuration gave messages: $(cat "$work/err")"

echo "== systemd unit"
if command -v systemd-analyze >/dev/null; then
  # Checked inside the staged root, where the unit's programs are; the host's
  # targets are not there, hence no recursive errors.
  systemd-analyze verify --man=no --recursive-errors=no --root="$root" zeparelayd.service \
    || fail "systemd-analyze verify rejects the unit"
  grep -qx 'Type=notify' "$root/usr/lib/systemd/system/zeparelayd.service" || fail "the unit is not Type=notify"
  echo "systemd-analyze verify: passed"
else
  echo "SKIPPED part: systemd-analyze is not installed, the unit was not verified"
fi
if command -v man >/dev/null; then
  for page in "$root"/usr/share/man/man*/*.gz; do
    warnings=$(LC_ALL=C.UTF-8 MANROFFSEQ='' man --warnings -l "$page" 2>&1 >/dev/null)
    [ -z "$warnings" ] || fail "manual $(basename "$page"): $warnings"
  done
fi
echo "package check passed"
