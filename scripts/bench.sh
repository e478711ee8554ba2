#!/usr/bin/env bash
# Builds the benchmarks and prints the figures of scripts/../bench/figures/bench.py:
# one line per figure ("name: ours X, reference Y, ratio Z", medians of
# interleaved runs with min..max) and a summary table. Also runs the
# foundation micro-benchmarks. --smoke: one short repetition, no thresholds.
set -euo pipefail
cd "$(dirname "$0")/.."

build=${ZEPA_BENCH_BUILD:-build/bench}
smoke=()
for arg in "$@"; do
  case $arg in
    --smoke) smoke=(--smoke) ;;
    -h|--help) sed -n '2,5p' "$0" | sed 's/^# \{0,1\}//'; exit 0 ;;
    *) echo "bench.sh: unknown option '$arg' (try --help)" >&2; exit 64 ;;
  esac
done
jobs=$(nproc 2>/dev/null || echo 2)
step() { printf '\n==> %s\n' "$*" >&2; }
fail() { printf '\nbench.sh: %s\n' "$*" >&2; exit 1; }

launcher=()
if command -v ccache >/dev/null; then
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi
step "Configure $build (RelWithDebInfo as Debian builds, benchmarks on, tests off)"
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZEPA_BUILD_TESTS=OFF -DZEPA_BUILD_BENCH=ON \
  "${launcher[@]}" >/dev/null || fail "cmake configure of $build failed (run scripts/install-deps.sh?)"
step "Build the daemon, the control tool and the benchmark programs"
cmake --build "$build" -j "$jobs" --target zeparelayd_daemon zeparelayctl zepa_figures zepa_status_floor \
  zepa_min_daemon bench_foundation || fail "build of $build failed (compiler output above)"

step "Foundation micro-benchmarks"
if [ ${#smoke[@]} -gt 0 ]; then
  "$build/bench/foundation/bench_foundation" --benchmark_min_time=0.01 >/dev/null || fail "bench_foundation failed"
else
  "$build/bench/foundation/bench_foundation" --benchmark_repetitions=3 --benchmark_min_time=0.1 \
    --benchmark_report_aggregates_only=true \
    || fail "bench_foundation failed"
fi

step "Figures (staged appliance, local server, real daemon)"
python3 bench/figures/bench.py --build "$build" --src . "${smoke[@]}" || fail "the figures failed (see above)"

# The relay figures need the tests' relay harness (a test build) and root.
relay_bench=${ZEPA_TEST_BUILD:-build/plain}/bench/relay/bench_relay
if [ "$(id -u)" != 0 ]; then
  step "Relay figures skipped: they need root (network namespaces, openvpn)"
elif [ ! -x "$relay_bench" ]; then
  step "Relay figures skipped: build $relay_bench first (cmake --build build/plain --target bench_relay)"
else
  step "Relay figures (real openvpn in namespaces, the daemon against a silent relay, kill -9, reload)"
  rounds=3
  [ ${#smoke[@]} -gt 0 ] && rounds=1
  "$relay_bench" "$rounds" || fail "bench_relay failed (see above)"
fi
