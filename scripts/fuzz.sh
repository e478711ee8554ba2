#!/usr/bin/env bash
# Builds the fuzz targets with clang, libFuzzer, ASan and UBSan, and runs each
# for a bounded time, printing the executions per target.
# usage: scripts/fuzz.sh [SECONDS_PER_TARGET (default 60)] [TARGET_FOLDER...]
# New inputs are kept in build/fuzz/corpus/<target>; a finding is saved as
# build/fuzz/findings/<target>/crash-* and makes the script fail.
set -euo pipefail
cd "$(dirname "$0")/.."

seconds=${1:-60}
shift || true
case "$seconds" in '' | *[!0-9]*) echo "fuzz.sh: SECONDS_PER_TARGET must be a number, got '$seconds'" >&2; exit 2 ;; esac

fail() { printf 'fuzz.sh: %s\n' "$*" >&2; exit 1; }
command -v clang++ >/dev/null || fail "clang++ not found: apt-get install clang libclang-rt-14-dev"
probe=$(mktemp -d)
trap 'rm -rf "$probe"' EXIT
printf 'extern "C" int LLVMFuzzerTestOneInput(const unsigned char*, unsigned long) { return 0; }\n' >"$probe/p.cpp"
clang++ -fsanitize=fuzzer,address,undefined "$probe/p.cpp" -o "$probe/p" 2>"$probe/err" ||
  fail "clang cannot link libFuzzer with the sanitizers ($(head -1 "$probe/err")): apt-get install libclang-rt-14-dev"

dir=build/fuzz
echo "==> Configure and build $dir (clang, libFuzzer, ASan+UBSan)"
CC=clang CXX=clang++ cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZEPA_LIBFUZZER=ON \
  -DZEPA_SANITIZE=ON -DZEPA_BUILD_TESTS=OFF -DZEPA_BUILD_BENCH=OFF -DZEPA_BUILD_TOOLS=OFF >/dev/null ||
  fail "cmake configure of $dir failed"
cmake --build "$dir" -j "$(nproc 2>/dev/null || echo 2)" >/dev/null || fail "build of $dir failed: run cmake --build $dir"

if [ $# -gt 0 ]; then targets=("$@"); else
  targets=()
  for d in fuzz/*/; do [ -f "$d/CMakeLists.txt" ] && targets+=("$(basename "$d")"); done
fi

export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
status=0
for t in "${targets[@]}"; do
  bin="$dir/fuzz/$t/fuzz_$t"
  [ -x "$bin" ] || fail "no fuzz target $bin (folders: $(ls fuzz))"
  work="$dir/corpus/$t"
  findings="$dir/findings/$t"
  mkdir -p "$work" "$findings"
  echo "==> $t: ${seconds}s"
  log="$dir/$t.log"
  if "$bin" -max_total_time="$seconds" -print_final_stats=1 -rss_limit_mb=2048 -timeout=10 \
    -artifact_prefix="$findings/" "$work" "fuzz/$t/corpus" >"$log" 2>&1; then
    runs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -1)
    echo "$t: ${runs:-?} executions, no finding"
  else
    echo "$t: FINDING (see $log and $findings)" >&2
    status=1
  fi
done
exit $status
