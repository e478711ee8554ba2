// fleet_sim: N simulated appliances on the daemon's retry rules against a
// scripted relay; prints the request rates and recovery times per scenario,
// writes per-second series for the plots, and checks the fleet's goals.
#include <sys/stat.h>

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "fleet_model.h"

namespace {

void Usage(FILE* out) {
    fprintf(
        out,
        "usage: fleet_sim [options]\n"
        "  -n, --appliances N     fleet size (default 100000)\n"
        "  --scenario NAME        run only this scenario (repeatable); --list names them;\n"
        "                         also any outage-<n><s|m|h>-<refused|hanging> up to 24 h\n"
        "  --rules NAME           retry rules (default: shipped); --list names the variants;\n"
        "                         with --variants: only these rows (repeatable)\n"
        "  --variants             trade-off table: every rule variant over the outage and power scenarios\n"
        "  --seed S               jitter and fleet seed (default 1)\n"
        "  --heartbeat S          heartbeat the control server asks for, seconds (default 300)\n"
        "  --tunnel-percent P     share of appliances behind a tunnel (default 25)\n"
        "  --warmup-hours H       boots of the steady fleet spread over H hours (default 16)\n"
        "  --csv-dir DIR          write DIR/<scenario>.csv (per second: requests per kind, recovered share)\n"
        "  --check                exit 1 when a goal is not met (each miss is printed)\n"
        "  --list                 print the scenarios and rule variants\n"
        "  --records FILE         figures of a real fleet (bench/fleet/real_fleet.py) beside the simulated\n"
        "                         fleet of the same set-up; with --check, exit 1 when the real fleet\n"
        "                         misses a goal (99 %% back within 300 s, peak/steady within --peak-limit,\n"
        "                         no lock-step)\n"
        "  --seeds K              simulated runs beside a real fleet (default 10)\n"
        "  --peak-limit X         the real fleet's peak/steady goal (default 2)\n");
}

bool ParseInt(const char* text, long long lo, long long hi, long long& out) {
    char* end = nullptr;
    errno = 0;
    const long long v = strtoll(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || v < lo || v > hi) return false;
    out = v;
    return true;
}

const char* Value(int argc, char** argv, int& i) {
    if (i + 1 >= argc) {
        fprintf(stderr, "fleet_sim: %s needs a value (try --help)\n", argv[i]);
        exit(64);
    }
    return argv[++i];
}

struct VariantRow {
    std::string rules;
    double outagePeak = 0;     // worst control or tunnel peak/steady over the outages
    double outageRecover = 0;  // worst 99 % time over the outages, s (-1 never)
    double powerPeak = 0;
    double powerRecover = 0;
    double dnsPeak = 0;
    double movePeak = 0;
    int lockStep = 0;  // scenarios with a kind in lock-step
    int goalsMissed = 0;
};

double WorstTime(double a, double b) {
    if (a < 0 || b < 0) return -1;
    return std::max(a, b);
}

struct Spread {
    double mean = 0, lo = 0, hi = 0;
    int never = 0;
};

Spread Over(const std::vector<fleet::Result>& runs, const std::function<double(const fleet::Result&)>& get) {
    Spread s;
    int n = 0;
    for (const fleet::Result& r : runs) {
        const double v = get(r);
        if (v < 0) {
            ++s.never;
            continue;
        }
        s.lo = n == 0 ? v : std::min(s.lo, v);
        s.hi = n == 0 ? v : std::max(s.hi, v);
        s.mean += v;
        ++n;
    }
    if (n > 0) s.mean /= n;
    return s;
}

double PeakRatio(const fleet::Result& r) {
    const fleet::SeriesFigures& f = r.Series("register");
    return f.steady > 0 ? f.peak / f.steady : -1;
}

// One row: the real value, the simulated runs' mean and range, and whether
// the two are within 20 % of each other.
void Row(const char* what, double real, const Spread& sim, const char* unit, bool compare) {
    char realText[32], simText[64], verdict[32] = "";
    if (real < 0) {
        snprintf(realText, sizeof realText, "never");
    } else {
        snprintf(realText, sizeof realText, "%.2f%s", real, unit);
    }
    snprintf(simText, sizeof simText, "%.2f%s (%.2f-%.2f)%s", sim.mean, unit, sim.lo, sim.hi,
             sim.never ? " +never" : "");
    if (compare && real >= 0 && sim.mean > 0) {
        const double off = real / sim.mean - 1;
        snprintf(verdict, sizeof verdict, "%+.0f %%%s", 100 * off, std::fabs(off) <= 0.2 ? "" : "  (> 20 %)");
    }
    printf("  %-34s %12s   %-28s %s\n", what, realText, simText, verdict);
}

int CompareRecorded(const std::string& path, int seeds, double peakLimit, bool check) {
    fleet::RecordedRun run;
    std::string error;
    if (!fleet::ReadRecordedRun(path, run, error)) {
        fprintf(stderr, "fleet_sim: %s\n", error.c_str());
        return 1;
    }
    const fleet::Result real = fleet::ResultFromRecords(run);
    fflush(stdout);
    fprintf(stderr, "simulating the same set-up, %d seeds ...\n", seeds);
    std::vector<fleet::Result> sims;
    const fleet::Rules rules = fleet::MatchingRules();
    const fleet::Scenario scenario = fleet::MatchingScenario(run);
    for (int seed = 1; seed <= seeds; ++seed) {
        const fleet::FleetConfig config = fleet::MatchingConfig(run, static_cast<uint64_t>(seed));
        sims.push_back(fleet::RunScenario(config, rules, scenario));
    }
    printf(
        "== real fleet: %d zeparelayd against one local server, heartbeat %d s, started evenly over %.0f s,\n"
        "   steady %.0f s, control server refusing for %.1f s, %.0f s measured after its return; no "
        "tunnels\n",
        run.appliances, run.heartbeatSeconds, run.bootSpreadSeconds, run.steadySeconds, run.outageSeconds,
        run.afterSeconds);
    for (const std::string& note : run.notes) printf("   %s\n", note.c_str());
    printf("%s", fleet::FormatResult(real).c_str());
    printf("\n== beside the simulator (same set-up, rules \"%s\", %d seeds; requests the server saw)\n",
           rules.name.c_str(), seeds);
    printf("  %-34s %12s   %-28s %s\n", "", "real", "simulated: mean (range)", "real/sim");
    for (const char* kind : {"register", "alias_map"}) {
        const std::string k = kind;
        Row((k + " steady /s").c_str(), real.Series(k).steady,
            Over(sims, [&](const fleet::Result& r) { return r.Series(k).steady; }), "", false);
        Row((k + " peak /s (60 s mean)").c_str(), real.Series(k).peak,
            Over(sims, [&](const fleet::Result& r) { return r.Series(k).peak; }), "", k == "register");
    }
    Row("register peak/steady", PeakRatio(real), Over(sims, PeakRatio), "x", true);
    Row("connected at the return", 100 * real.recoveredAtReference,
        Over(sims, [](const fleet::Result& r) { return 100 * r.recoveredAtReference; }), " %", false);
    Row("50 % connected again after", real.recover50,
        Over(sims, [](const fleet::Result& r) { return r.recover50; }), " s", true);
    Row("99 % connected again after", real.recover99,
        Over(sims, [](const fleet::Result& r) { return r.recover99; }), " s", true);
    Row("100 % connected again after", real.recover100,
        Over(sims, [](const fleet::Result& r) { return r.recover100; }), " s", true);
    bool realLockStep = false;
    for (const fleet::SeriesFigures& f : real.series) realLockStep = realLockStep || f.lockStep;
    int simLockStep = 0;
    for (const fleet::Result& r : sims) {
        bool any = false;
        for (const fleet::SeriesFigures& f : r.series) any = any || f.lockStep;
        simLockStep += any ? 1 : 0;
    }
    printf("  %-34s %12s   %d of %d runs\n", "lock-step", realLockStep ? "yes" : "no", simLockStep, seeds);

    std::vector<std::string> missed;
    char buf[256];
    if (real.recover99 < 0 || real.recover99 > 300) {
        if (real.recover99 < 0) {
            snprintf(buf, sizeof buf, "99 %% not connected again within the %.0f s measured (goal <= 300 s)",
                     run.afterSeconds);
        } else {
            snprintf(buf, sizeof buf, "99 %% connected again after %.0f s (goal <= 300 s)", real.recover99);
        }
        missed.push_back(buf);
    }
    if (PeakRatio(real) < 0 || PeakRatio(real) > peakLimit) {
        snprintf(buf, sizeof buf, "register peak/steady %.2f (goal <= %.2f)", PeakRatio(real), peakLimit);
        missed.push_back(buf);
    }
    if (realLockStep) missed.push_back("a request kind in lock-step");
    if (missed.empty()) {
        printf("\nThe real fleet met the goals (99 %% within 300 s, peak/steady <= %.2f, no lock-step).\n",
               peakLimit);
    } else {
        printf("\nThe real fleet missed goals:\n");
        for (const std::string& m : missed) printf("  %s\n", m.c_str());
    }
    return check && !missed.empty() ? 1 : 0;
}

}  // namespace

int main(int argc, char** argv) {
    fleet::FleetConfig config;
    std::vector<std::string> names;
    std::vector<std::string> rulesNames;
    std::string csvDir;
    bool check = false, variants = false;
    std::string recordsPath;
    int seeds = 10;
    double peakLimit = 2.0;
    for (int i = 1; i < argc; ++i) {
        const std::string arg = argv[i];
        long long v = 0;
        if (arg == "-h" || arg == "--help") {
            Usage(stdout);
            return 0;
        } else if (arg == "-n" || arg == "--appliances") {
            if (!ParseInt(Value(argc, argv, i), 1, 10000000, v)) {
                fprintf(stderr, "fleet_sim: --appliances wants 1 to 10000000\n");
                return 64;
            }
            config.appliances = static_cast<int>(v);
        } else if (arg == "--scenario") {
            names.push_back(Value(argc, argv, i));
        } else if (arg == "--rules") {
            rulesNames.push_back(Value(argc, argv, i));
        } else if (arg == "--variants") {
            variants = true;
        } else if (arg == "--seed") {
            if (!ParseInt(Value(argc, argv, i), 0, 1LL << 62, v)) {
                fprintf(stderr, "fleet_sim: --seed wants a non-negative number\n");
                return 64;
            }
            config.seed = static_cast<uint64_t>(v);
        } else if (arg == "--heartbeat") {
            if (!ParseInt(Value(argc, argv, i), 10, 86400, v)) {
                fprintf(stderr, "fleet_sim: --heartbeat wants 10 to 86400 seconds\n");
                return 64;
            }
            config.heartbeatSeconds = static_cast<int>(v);
        } else if (arg == "--tunnel-percent") {
            if (!ParseInt(Value(argc, argv, i), 0, 100, v)) {
                fprintf(stderr, "fleet_sim: --tunnel-percent wants 0 to 100\n");
                return 64;
            }
            config.tunnelPercent = static_cast<int>(v);
        } else if (arg == "--warmup-hours") {
            if (!ParseInt(Value(argc, argv, i), 0, 48, v)) {
                fprintf(stderr, "fleet_sim: --warmup-hours wants 0 to 48\n");
                return 64;
            }
            config.warmupMs = v * 3600 * 1000;
        } else if (arg == "--csv-dir") {
            csvDir = Value(argc, argv, i);
        } else if (arg == "--records") {
            recordsPath = Value(argc, argv, i);
        } else if (arg == "--seeds") {
            if (!ParseInt(Value(argc, argv, i), 1, 1000, v)) {
                fprintf(stderr, "fleet_sim: --seeds wants 1 to 1000\n");
                return 64;
            }
            seeds = static_cast<int>(v);
        } else if (arg == "--peak-limit") {
            const char* text = Value(argc, argv, i);
            char* end = nullptr;
            peakLimit = strtod(text, &end);
            if (end == text || *end != '\0' || !(peakLimit > 0)) {
                fprintf(stderr, "fleet_sim: --peak-limit wants a positive number\n");
                return 64;
            }
        } else if (arg == "--check") {
            check = true;
        } else if (arg == "--list") {
            printf("scenarios:");
            for (const fleet::Scenario& s : fleet::DefaultScenarios()) printf(" %s", s.name.c_str());
            printf("\nrules:");
            for (const fleet::Rules& r : fleet::RuleVariants()) printf(" %s", r.name.c_str());
            printf("\n");
            return 0;
        } else {
            fprintf(stderr, "fleet_sim: unknown option '%s' (try --help)\n", arg.c_str());
            return 64;
        }
    }

    if (!recordsPath.empty()) return CompareRecorded(recordsPath, seeds, peakLimit, check);

    std::vector<fleet::Scenario> scenarios;
    if (names.empty()) {
        scenarios = fleet::DefaultScenarios();
        if (variants) {
            scenarios.clear();
            for (const fleet::Scenario& s : fleet::DefaultScenarios()) {
                if (s.kind != fleet::ScenarioKind::ALIAS_DOWN) scenarios.push_back(s);
            }
        }
    }
    for (const std::string& name : names) {
        fleet::Scenario s;
        if (!fleet::FindScenario(name, s)) {
            fprintf(stderr, "fleet_sim: no scenario '%s' (--list names them)\n", name.c_str());
            return 64;
        }
        scenarios.push_back(s);
    }
    std::vector<fleet::Rules> ruleSets;
    if (variants && rulesNames.empty()) {
        ruleSets = fleet::RuleVariants();
    } else {
        if (rulesNames.empty()) rulesNames.push_back("shipped");
        if (!variants && rulesNames.size() > 1) {
            fprintf(stderr, "fleet_sim: more than one --rules needs --variants\n");
            return 64;
        }
        for (const std::string& name : rulesNames) {
            fleet::Rules r;
            if (!fleet::FindRules(name, r)) {
                fprintf(stderr, "fleet_sim: no rules '%s' (--list names them)\n", name.c_str());
                return 64;
            }
            ruleSets.push_back(r);
        }
    }
    if (!csvDir.empty() && mkdir(csvDir.c_str(), 0755) != 0 && errno != EEXIST) {
        fprintf(stderr, "fleet_sim: cannot create %s: %s\n", csvDir.c_str(), strerror(errno));
        return 1;
    }

    std::vector<std::string> missed;
    std::vector<VariantRow> rows;
    const size_t total = scenarios.size() * ruleSets.size();
    size_t done = 0;
    for (const fleet::Rules& rules : ruleSets) {
        VariantRow row;
        row.rules = rules.name;
        // A power restore is measured against the steady fleet's rates.
        fleet::Result steady;
        bool haveSteady = false;
        for (const fleet::Scenario& scenario : scenarios) {
            if (scenario.kind == fleet::ScenarioKind::POWER_RESTORE && !haveSteady) {
                fleet::Scenario s;
                fleet::FindScenario("steady", s);
                fprintf(stderr, "  (steady fleet first, for the power restore's reference rates)\n");
                steady = fleet::RunScenario(config, rules, s);
                haveSteady = true;
            }
            fprintf(stderr, "[%zu/%zu] %s, rules %s, N = %d ...\n", ++done, total, scenario.name.c_str(),
                    rules.name.c_str(), config.appliances);
            fleet::Result r = fleet::RunScenario(config, rules, scenario, haveSteady ? &steady : nullptr);
            if (scenario.kind == fleet::ScenarioKind::STEADY) {
                steady = r;
                haveSteady = true;
            }
            if (!variants) {
                printf("%s", fleet::FormatResult(r).c_str());
                fflush(stdout);
            }
            if (!csvDir.empty() && !variants) {
                const std::string path = csvDir + "/" + scenario.name + ".csv";
                if (!fleet::WriteSeriesCsv(r, path)) {
                    fprintf(stderr, "fleet_sim: cannot write %s\n", path.c_str());
                    return 1;
                }
            }
            const std::vector<std::string> goals = fleet::CheckGoals(r);
            row.goalsMissed += static_cast<int>(goals.size());
            missed.insert(missed.end(), goals.begin(), goals.end());
            const fleet::SeriesFigures& control = r.Series("register");
            const double peak = control.steady > 0 ? control.peak / control.steady : 0;
            bool lockStep = false;
            for (const fleet::SeriesFigures& f : r.series)
                lockStep = lockStep || f.lockStep || f.busiestRatio > 3.0;
            row.lockStep += lockStep ? 1 : 0;
            switch (scenario.kind) {
                case fleet::ScenarioKind::OUTAGE:
                    row.outagePeak = std::max(row.outagePeak, peak);
                    row.outageRecover = WorstTime(row.outageRecover, r.recover99);
                    break;
                case fleet::ScenarioKind::POWER_RESTORE:
                    row.powerPeak = peak;
                    row.powerRecover = r.recover99;
                    break;
                case fleet::ScenarioKind::DNS_FAILURE:
                    row.dnsPeak = peak;
                    break;
                case fleet::ScenarioKind::SERVER_CHANGED:
                    row.movePeak = peak;
                    break;
                default:
                    break;
            }
        }
        rows.push_back(row);
    }

    if (variants) {
        printf("\nTrade-off (N = %d): worst over the outages (1 min, 5 min, 1 h, 6 h; refused and hanging)\n",
               config.appliances);
        printf(
            "(peaks: control server, highest 60-s mean / steady; lock-step: scenarios with a kind in it)\n");
        printf("%-22s %11s %10s %10s %9s %8s %9s %9s %6s\n", "rules", "outage peak", "outage 99%",
               "power peak", "power 99%", "dns peak", "move peak", "lockstep", "missed");
        for (const VariantRow& row : rows) {
            char o99[16], p99[16];
            snprintf(o99, sizeof o99, row.outageRecover < 0 ? "never" : "%.0f s", row.outageRecover);
            snprintf(p99, sizeof p99, row.powerRecover < 0 ? "never" : "%.0f s", row.powerRecover);
            printf("%-22s %10.2fx %10s %9.2fx %9s %7.2fx %8.2fx %9d %6d\n", row.rules.c_str(), row.outagePeak,
                   o99, row.powerPeak, p99, row.dnsPeak, row.movePeak, row.lockStep, row.goalsMissed);
        }
    }
    if (!missed.empty()) {
        printf("\nGoals not met:\n");
        for (const std::string& m : missed) printf("  %s\n", m.c_str());
    } else {
        printf("\nAll goals met.\n");
    }
    return check && !missed.empty() ? 1 : 0;
}
