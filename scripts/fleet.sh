#!/usr/bin/env bash
# Runs the fleet simulator (bench/fleet) over every scenario: request rates per
# kind (steady, peak, peak/steady), time until 50/99/100 % of the fleet are
# connected again, busiest second against its minute, then draws one plot per
# scenario (requests per second over time) into the output folder.
#   -n N            fleet size (default 100000)
#   --out DIR       CSV series and PNG plots (default build/fleet/out)
#   --scenario S    only this scenario (repeatable; fleet_sim --list names them)
#   --variants      the trade-off table of rule variants instead (default N 20000)
#   --rules R       these rules (fleet_sim --list names them); with --variants, only these rows (repeatable)
#   --check         exit 1 when a goal is not met
#   --real          a fleet of real zeparelayd processes instead (bench/fleet/real_fleet.py):
#                   N daemons (default 200) against one local server, the control server
#                   refusing connections for --outage seconds (default 60); the figures from
#                   the server's records beside the simulator's for the same set-up; no tunnels
#   --heartbeat S   with --real: the heartbeat the server asks for (default 300)
set -euo pipefail
cd "$(dirname "$0")/.."

build=${ZEPA_FLEET_BUILD:-build/fleet}
n=""
out=""
args=()
variants=0
real=0
outage=60
heartbeat=300
check=()
while [ $# -gt 0 ]; do
  case $1 in
    -n|--appliances) [ $# -ge 2 ] || { echo "fleet.sh: $1 needs a number" >&2; exit 64; }; n=$2; shift ;;
    --out) [ $# -ge 2 ] || { echo "fleet.sh: --out needs a folder" >&2; exit 64; }; out=$2; shift ;;
    --scenario) [ $# -ge 2 ] || { echo "fleet.sh: --scenario needs a name" >&2; exit 64; }; args+=(--scenario "$2"); shift ;;
    --rules) [ $# -ge 2 ] || { echo "fleet.sh: --rules needs a name" >&2; exit 64; }; args+=(--rules "$2"); shift ;;
    --variants) variants=1 ;;
    --check) args+=(--check); check=(--check) ;;
    --real) real=1 ;;
    --outage) [ $# -ge 2 ] || { echo "fleet.sh: --outage needs seconds" >&2; exit 64; }; outage=$2; shift ;;
    --heartbeat) [ $# -ge 2 ] || { echo "fleet.sh: --heartbeat needs seconds" >&2; exit 64; }; heartbeat=$2; shift ;;
    -h|--help) sed -n '2,16p' "$0" | sed 's/^# \{0,1\}//'; exit 0 ;;
    *) echo "fleet.sh: unknown option '$1' (try --help)" >&2; exit 64 ;;
  esac
  shift
done
out=${out:-$build/out}
step() { printf '\n==> %s\n' "$*" >&2; }
fail() { printf '\nfleet.sh: %s\n' "$*" >&2; exit 1; }

launcher=()
if command -v ccache >/dev/null; then
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi
step "Configure $build (RelWithDebInfo, tests off)"
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZEPA_BUILD_TESTS=OFF -DZEPA_BUILD_BENCH=ON \
  "${launcher[@]}" >/dev/null || fail "cmake configure of $build failed (run scripts/install-deps.sh?)"
step "Build the fleet simulator"
targets=(fleet_sim)
[ $real -eq 0 ] || targets+=(zeparelayd_daemon)
cmake --build "$build" -j "$(nproc 2>/dev/null || echo 2)" --target "${targets[@]}" \
  || fail "build of $build failed (compiler output above)"

sim=$build/bench/fleet/fleet_sim
if [ $real -eq 1 ]; then
  n=${n:-200}
  mkdir -p "$out" || fail "cannot create $out"
  records=$out/real-$n.csv
  step "$n real zeparelayd against one local server: start, steady, ${outage} s outage, return (progress below)"
  python3 bench/fleet/real_fleet.py --daemon "$build/tools/zeparelayd/zeparelayd" -n "$n" \
    --heartbeat "$heartbeat" --outage "$outage" --records "$records" \
    || fail "the real fleet run failed (see above)"
  step "Figures from the server's records beside the simulator's"
  exec "$sim" --records "$records" "${check[@]}"
fi
if [ $variants -eq 1 ]; then
  step "Trade-off of the rule variants, N = ${n:-20000} (progress on standard error)"
  exec "$sim" -n "${n:-20000}" --variants "${args[@]}"
fi

mkdir -p "$out" || fail "cannot create $out"
step "Simulate N = ${n:-100000} over the scenarios (progress on standard error)"
rc=0
"$sim" -n "${n:-100000}" --csv-dir "$out" "${args[@]}" || rc=$?
[ $rc -le 1 ] || fail "fleet_sim failed ($rc)"

step "Plots"
if /usr/bin/python3 -c 'import matplotlib' 2>/dev/null; then
  /usr/bin/python3 bench/fleet/plot.py "$out" || fail "plotting failed (see above)"
else
  echo "fleet.sh: no plots: /usr/bin/python3 lacks matplotlib (scripts/install-deps.sh installs python3-matplotlib)" >&2
fi
exit $rc
