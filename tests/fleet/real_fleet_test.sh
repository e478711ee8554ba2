#!/usr/bin/env bash
# 20 real zeparelayd against one local server through a 1-minute outage of
# the control server (refused connections), then the figures from the
# server's own records, with the fleet's goals scaled to 20 daemons:
#   - every daemon (99 % of 20 rounds up to all 20) registered again within
#     300 s of the return;
#   - the busiest minute after the outage carries at most 1.5 x the steady
#     minute's registrations;
#   - no second in lock-step (at this size: 7 or more registrations in one
#     second, which chance does not give 20 daemons spread over minutes).
# A heartbeat of 60 s (the server's admin setting) makes one heartbeat period
# of start-up and one of steady state fit in about 2 minutes: 8 minutes in all.
# Why 1.5 at N = 20: started evenly, the daemons send exactly 20 heartbeats
# per minute, so the steady rate has no sampling noise, and a daemon that
# keeps its rules sends at most one registration per minute (its heartbeat)
# whatever the outage did: a correct fleet stays at 1.0 x, the simulator too.
# Each extra registration adds 0.05 x; 1.5 x means ten registrations in one
# minute beyond one per daemon, a herd that no timing noise explains, while
# the goal's 2 x would let every daemon register twice a minute unnoticed.
#   real_fleet_test.sh ZEPARELAYD FLEET_SIM WORKDIR
set -euo pipefail
daemon=${1:?usage: real_fleet_test.sh ZEPARELAYD FLEET_SIM WORKDIR}
sim=${2:?usage: real_fleet_test.sh ZEPARELAYD FLEET_SIM WORKDIR}
work=${3:?usage: real_fleet_test.sh ZEPARELAYD FLEET_SIM WORKDIR}
src=$(cd "$(dirname "$0")/../.." && pwd)
rm -rf "$work"
mkdir -p "$work"
python3 "$src/bench/fleet/real_fleet.py" --daemon "$daemon" -n 20 --heartbeat 60 --outage 60 --after 305 \
  --work "$work/run" --records "$work/records.csv"
"$sim" --records "$work/records.csv" --seeds 20 --peak-limit 1.5 --check
rm -rf "$work"
