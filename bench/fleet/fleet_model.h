// A fleet of simulated appliances against a scripted relay, on a simulated
// clock. Each appliance runs the daemon's own retry policies
// (tools/zeparelayd/retry_policy.*) and the library's alias polling time, and
// follows them the way the daemon's cycles do: the cycles themselves need the
// real event loop and curl, so their few lines of wiring (what is called after
// which answer) are mirrored here, step for step, in fleet_model.cpp.
#ifndef ZEPARELAYD_BENCH_FLEET_MODEL_H
#define ZEPARELAYD_BENCH_FLEET_MODEL_H

#include <cstdint>
#include <string>
#include <vector>

#include "retry_policy.h"

namespace fleet {

enum RequestKind { REQ_REGISTER, REQ_ALIAS_MAP, REQ_ALIAS_KEEP_ALIVE, REQ_TUNNEL, REQ_KINDS };
const char* KindName(int kind);

enum class ScenarioKind { STEADY, OUTAGE, POWER_RESTORE, DNS_FAILURE, SERVER_CHANGED, ALIAS_DOWN };

struct Scenario {
    std::string name;
    ScenarioKind kind = ScenarioKind::STEADY;
    int64_t durationMs = 0;  // outage, failing DNS, alias server down
    bool hanging = false;    // outage: requests hang until their time-out instead of being refused
};

// Every scenario of the study, in the order printed.
std::vector<Scenario> DefaultScenarios();
// One scenario by name; false when there is none.
bool FindScenario(const std::string& name, Scenario& out);

// The retry rules a fleet runs on: the daemon's defaults, or a variant.
struct Rules {
    std::string name = "shipped";
    zeparelayd::RegistrationRules registration;
    zeparelayd::TunnelRules tunnel;
};

// The variants of the trade-off table ("shipped": the daemon's defaults).
std::vector<Rules> RuleVariants();
bool FindRules(const std::string& name, Rules& out);

struct FleetConfig {
    int appliances = 100000;
    uint64_t seed = 1;
    int heartbeatSeconds = 300;  // what the control server's answer asks for
    int tunnelPercent = 25;      // share of appliances reached through a tunnel
    int64_t warmupMs =
        16LL * 3600 * 1000;  // first boots spread over this, so that alias keep-alives are spread
    int64_t steadyWindowMs = 3600 * 1000;  // measured before the disturbance
    int64_t bootSpreadMs = 60000;          // power restore: every appliance boots within this
    int64_t afterMs = 3600 * 1000;         // measured after the return
    // Boots one after another at even steps over the warm-up, as a harness
    // starts a fleet of real daemons, instead of at random moments.
    bool bootEvenly = false;
    // Counts only the requests that reached a server, as the server's own
    // records do: a refused connection or a failed name lookup is not seen.
    bool servedOnly = false;
};

// Figures of one request series (a kind, or a server's sum of kinds).
struct SeriesFigures {
    std::string name;
    double steady = 0;  // requests per second before the disturbance
    double peak = 0;    // highest mean of a 60-second window from the disturbance on
    double peakAfterReturn = 0;
    double busiestRatio = 0;  // busiest second / mean of its minute, over minutes averaging >= 20/s
    bool lockStep = false;    // a second above 3x its minute's mean that chance (at the busier
                              // half-minute's rate) does not explain
};

struct Result {
    Scenario scenario;
    Rules rules;
    int appliances = 0;
    std::vector<SeriesFigures> series;  // register, alias_map, alias_keep_alive, alias, tunnel
    // Seconds from the reference moment (the relay's return; boot for a power
    // restore; the move for a server change) until the share was recovered;
    // -1 when it was not within the measured time.
    double recover50 = -1, recover99 = -1, recover100 = -1;
    double recoveredAtReference = 0;  // share recovered at the reference moment
    int64_t events = 0;
    double wallSeconds = 0;
    // Per second from the start of the measured window: requests per kind and the recovered share.
    int64_t windowStartMs = 0, eventMs = 0, returnMs = 0;
    std::vector<std::vector<uint32_t>> perSecond;
    std::vector<float> recoveredShare;

    const SeriesFigures& Series(const std::string& name) const;
};

// Runs one scenario. steadyFrom: the figures whose steady rates a scenario
// without a steady phase of its own (power restore) is measured against.
Result RunScenario(const FleetConfig& config, const Rules& rules, const Scenario& scenario,
                   const Result* steadyFrom = nullptr);

// A fleet measured elsewhere: real daemons against the local server, as
// bench/fleet/real_fleet.py records them from the server's own records.
struct RecordedRequest {
    double secondsFromEvent = 0;  // arrival, from the start of the outage
    int kind = REQ_REGISTER;
    int appliance = 0;
    bool ok = false;  // the answer was a success
};

struct RecordedRun {
    int appliances = 0;
    int heartbeatSeconds = 0;
    double bootSpreadSeconds = 0;  // the daemons started evenly over this
    double steadySeconds = 0;      // from the last start to the outage
    double outageSeconds = 0;      // refused from the event to the return
    double afterSeconds = 0;       // measured after the return
    std::vector<RecordedRequest> requests;
    std::vector<std::string> notes;  // the file's other comment lines, as written
};

// Reads the CSV of real_fleet.py; false with a reason when it is not one.
bool ReadRecordedRun(const std::string& path, RecordedRun& out, std::string& error);

// The figures of a recorded outage, computed as for a simulated one. The
// server sees no refused attempt, so an appliance counts as disconnected
// from its first heartbeat that did not arrive (its last success plus the
// heartbeat, and a few seconds' grace) until its next successful registration.
Result ResultFromRecords(const RecordedRun& run);

// The simulated fleet that matches a recorded one: its size, heartbeat,
// even boots over the same spread, steady window, outage and time after; no
// tunnels; counting only what reaches the server; the shipped rules without
// the start-up spread, which a daemon started long after the machine's boot
// does not wait.
FleetConfig MatchingConfig(const RecordedRun& run, uint64_t seed);
Rules MatchingRules();
Scenario MatchingScenario(const RecordedRun& run);

// The goals, scaled to nothing: the ratios and times do not depend on the
// fleet's size. One line per goal not met; empty when all are.
std::vector<std::string> CheckGoals(const Result& result);

// Printing.
std::string FormatResult(const Result& result);
bool WriteSeriesCsv(const Result& result, const std::string& path);

}  // namespace fleet

#endif
