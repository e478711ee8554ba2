#!/usr/bin/env bash
# usage: check_install.sh BUILD_DIR CONSUMER_SOURCE_DIR TOOLS_SOURCE_DIR
set -euo pipefail
build=$1
src=$2
tools=$3
work=$(mktemp -d /tmp/zepa-install.XXXXXX)
trap 'rm -rf "$work"' EXIT

echo "== install into $work/prefix"
cmake --install "$build" --prefix "$work/prefix" >/dev/null

libdir=$(dirname "$(find "$work/prefix" -name 'libzeparelayd.so' | head -n 1)")
[ -n "$libdir" ] || { echo "libzeparelayd.so was not installed" >&2; exit 1; }
soname=$(objdump -p "$libdir/libzeparelayd.so" | awk '/SONAME/ {print $2}')
[ "$soname" = "libzeparelayd.so.1" ] || { echo "unexpected SONAME '$soname'" >&2; exit 1; }

echo "== consumer through find_package"
cmake -S "$src" -B "$work/cmake-build" -G Ninja -DCMAKE_PREFIX_PATH="$work/prefix" >/dev/null
cmake --build "$work/cmake-build" >/dev/null
LD_LIBRARY_PATH="$libdir" "$work/cmake-build/consumer" > "$work/out1"
grep -qx 'err_auth connected (unknown errno: 12) 9' "$work/out1" || { cat "$work/out1"; exit 1; }

echo "== consumer through pkg-config"
export PKG_CONFIG_PATH="$libdir/pkgconfig"
pkg-config --exists zeparelayd || { echo "pkg-config does not find zeparelayd" >&2; exit 1; }
# The staged lib dir is not a default search dir; a system install is.
LD_LIBRARY_PATH="$libdir" g++ -std=c++17 "$src/consumer.cpp" -o "$work/consumer-pc" $(pkg-config --cflags --libs zeparelayd)
LD_LIBRARY_PATH="$libdir" "$work/consumer-pc" > "$work/out2"
cmp "$work/out1" "$work/out2"

echo "== the daemon and the control tool built on their own against the installed library"
cmake -S "$tools" -B "$work/tools-build" -G Ninja -DCMAKE_PREFIX_PATH="$work/prefix" \
  -DCMAKE_CXX_FLAGS="-Wall -Wextra -Werror" >/dev/null
cmake --build "$work/tools-build" >/dev/null || {
  echo "tools/ does not build against the installed library: run 'cmake --build $work/tools-build' to see why" >&2
  exit 1
}
mkdir -p "$work/root"
LD_LIBRARY_PATH="$libdir" "$work/tools-build/zeparelayd/zeparelayd" --version > "$work/out3"
grep -qx "zeparelayd [0-9.]*" "$work/out3" || { cat "$work/out3"; exit 1; }
status=0
LD_LIBRARY_PATH="$libdir" "$work/tools-build/zeparelayctl/zeparelayctl" --root "$work/root" status > "$work/out4" || status=$?
[ "$status" = 1 ] && grep -qx "state: not_running" "$work/out4" || {
  echo "installed-consumer zeparelayctl status gave $status:" >&2; cat "$work/out4" >&2; exit 1
}

echo "== only the public interface is exported"
if nm -D --defined-only "$libdir/libzeparelayd.so" | grep -q 'ParseKvLine\|g_hook'; then
  echo "internal symbols are exported" >&2; exit 1
fi
echo "install check passed"
