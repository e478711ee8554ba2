#!/usr/bin/env bash
# Installs the build into a throwaway prefix, runs the installed programs from
# there (their RUNPATH finds the prefix's libraries), and builds the README's
# example (examples/using_the_library) against the prefix, once through the
# CMake package and once through pkg-config, and runs it in a staged appliance
# root against the local relay server.
#   usage: check_example.sh SOURCE_DIR BUILD_DIR
set -euo pipefail
src=$1
build=$2
fail() { echo "FAIL: $*" >&2; exit 1; }
work=$(mktemp -d /tmp/zepa-example.XXXXXX)
server=
cleanup() {
  [ -n "$server" ] && kill "$server" 2>/dev/null && wait "$server" 2>/dev/null
  rm -rf "$work"
}
trap cleanup EXIT

echo "== install into $work/prefix"
cmake --install "$build" --prefix "$work/prefix" >/dev/null
prefix=$work/prefix
libdir=$(dirname "$(find "$prefix" -name 'libzeparelayd.so.1' | head -n 1)")

echo "== installed programs run without LD_LIBRARY_PATH"
out=$(env -u LD_LIBRARY_PATH "$prefix/sbin/zeparelayd" --version) || fail "installed zeparelayd does not run: $out"
grep -q '^zeparelayd ' <<<"$out" || fail "zeparelayd --version said '$out'"
rc=0; env -u LD_LIBRARY_PATH "$prefix/bin/zeparelayctl" --root "$work" status >/dev/null 2>&1 || rc=$?
[ "$rc" -eq 1 ] || fail "installed zeparelayctl status exited $rc (expected 1: not running)"

echo "== a staged appliance and the local relay server (plain http)"
root=$work/root
bash "$src/scripts/stage_appliance.sh" "$root" >/dev/null
python3 "$src/tools/localserver/zepa_localserver.py" --ready-file "$work/ready.json" --no-https &
server=$!
for _ in $(seq 1 200); do [ -s "$work/ready.json" ] && break; sleep 0.05; done
[ -s "$work/ready.json" ] || fail "the local server did not start"
port=$(python3 -c 'import json,sys; print(json.load(open(sys.argv[1]))["http_port"])' "$work/ready.json")
cat >"$root/usr/zepa/etc/zeparelayd/zeparelayd.conf" <<CONF
{"server_control": {"protocol": "http", "host": "127.0.0.1", "port": $port},
 "server_alias": {"alias": "example-box"}}
CONF

check_run() {  # program: runs it in the staged root and checks its three answers
  "$1" "$root" >"$work/out" 2>"$work/err" || fail "$1 failed: $(cat "$work/out" "$work/err")"
  mapfile -t lines <"$work/out"
  [ "${#lines[@]}" -eq 3 ] || fail "expected 3 lines, got: $(cat "$work/out")"
  python3 -c 'import json,sys; c=json.loads(sys.argv[1]); assert c["server_alias"]["alias"]=="example-box"' \
    "${lines[0]}" || fail "the configuration below the root was not read: ${lines[0]}"
  # The control server answered (an empty body is a bad request to it): a
  # word of the server's error, not a transport failure.
  case "${lines[1]}" in err_network|err_resolv|err_timeout|'') fail "no answer from the server: ${lines[1]}";; esac
  [ "${lines[2]}" = "not_running" ] || fail "state word: ${lines[2]}"
}

echo "== example through find_package(zeparelayd)"
cmake -S "$src/examples/using_the_library" -B "$work/cmake-build" -G Ninja -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$work/cmake-build" >/dev/null || fail "the example does not build through the CMake package"
check_run "$work/cmake-build/using_the_library"
posts=$(python3 -c 'import json,sys,urllib.request
r = json.load(urllib.request.urlopen(sys.argv[1]))["requests"]
print(sum(1 for x in r if x["method"] == "POST"))' "http://127.0.0.1:$port/_control/requests?path=/Serv.php")
[ "$posts" -eq 1 ] || fail "the example's request did not reach the control server ($posts POSTs to /Serv.php)"

echo "== example through pkg-config (zeparelayd zepasdk)"
export PKG_CONFIG_PATH="$libdir/pkgconfig"
# No LD_LIBRARY_PATH at link time: the SDK on the command line satisfies the
# library's own reference to it.
env -u LD_LIBRARY_PATH g++ -std=c++17 "$src/examples/using_the_library/main.cpp" -o "$work/example-pc" \
  $(pkg-config --cflags --libs zeparelayd zepasdk) || fail "the example does not link through pkg-config"
LD_LIBRARY_PATH="$libdir" check_run "$work/example-pc"
echo "example check passed"
