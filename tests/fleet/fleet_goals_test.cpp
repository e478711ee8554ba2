// The fleet's goals at CI size: 1,000 simulated appliances on the daemon's
// retry policies, a scripted relay, a simulated clock. The ratios and times
// do not depend on the fleet's size; only the noise does, which the 60-second
// windows and the lock-step test's chance allowance absorb.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>

#include <string>
#include <vector>

#include "fleet_model.h"

namespace {

// A quarter of the appliances behind tunnels, as at full size: a relay
// outage closes all their tunnels within seconds.
fleet::FleetConfig Small() {
    fleet::FleetConfig config;
    config.appliances = 1000;
    config.seed = 7;
    return config;
}

fleet::Scenario Named(const std::string& name) {
    fleet::Scenario s;
    EXPECT_TRUE(fleet::FindScenario(name, s)) << name;
    return s;
}

fleet::Rules Shipped() { return fleet::Rules(); }

fleet::Rules Before() {
    fleet::Rules r;
    EXPECT_TRUE(fleet::FindRules("before", r));
    return r;
}

double PeakOverSteady(const fleet::Result& r) {
    const fleet::SeriesFigures& f = r.Series("register");
    return f.steady > 0 ? f.peak / f.steady : 1e9;
}

bool AnyLockStep(const fleet::Result& r) {
    for (const fleet::SeriesFigures& f : r.series) {
        if (f.lockStep || f.busiestRatio > 3.0) return true;
    }
    return false;
}

TEST(FleetGoals, AfterAOneMinuteOutageEveryoneIsBackWithinFiveMinutesWithoutAHerd) {
    const fleet::Result r = fleet::RunScenario(Small(), Shipped(), Named("outage-1m-refused"));
    EXPECT_GT(r.Series("register").steady, 3.0);  // 1,000 appliances, one heartbeat each 5 minutes
    EXPECT_LE(r.recover99, 300) << fleet::FormatResult(r);
    EXPECT_GE(r.recover100, 0) << fleet::FormatResult(r);
    EXPECT_LE(PeakOverSteady(r), 2.0) << fleet::FormatResult(r);
    EXPECT_FALSE(AnyLockStep(r)) << fleet::FormatResult(r);
}

TEST(FleetGoals, AfterSixHoursOfHangingRequestsEveryoneIsBackWithinFiveMinutes) {
    const fleet::Result r = fleet::RunScenario(Small(), Shipped(), Named("outage-6h-hanging"));
    EXPECT_EQ(0.0, r.recoveredAtReference) << "nobody is connected when the relay returns";
    EXPECT_LE(r.recover99, 300) << fleet::FormatResult(r);
    EXPECT_LE(PeakOverSteady(r), 2.0) << fleet::FormatResult(r);
    EXPECT_FALSE(AnyLockStep(r)) << fleet::FormatResult(r);
}

TEST(FleetGoals, APowerRestoreIsSpreadOverTheFirstMinutes) {
    const fleet::Result steady = fleet::RunScenario(Small(), Shipped(), Named("steady"));
    const fleet::Result r = fleet::RunScenario(Small(), Shipped(), Named("power-restore"), &steady);
    EXPECT_LE(PeakOverSteady(r), 3.0) << fleet::FormatResult(r);
    EXPECT_LE(r.recover99, 300) << fleet::FormatResult(r);
    EXPECT_FALSE(AnyLockStep(r)) << fleet::FormatResult(r);
}

TEST(FleetGoals, FailingNameLookupsDoNotMultiplyTheLoad) {
    const fleet::Result r = fleet::RunScenario(Small(), Shipped(), Named("dns-30m"));
    EXPECT_LE(PeakOverSteady(r), 2.0) << fleet::FormatResult(r);
    EXPECT_LE(r.recover99, 300) << fleet::FormatResult(r);
    EXPECT_FALSE(AnyLockStep(r)) << fleet::FormatResult(r);
}

// Every outage length, refused or hanging: at most twice the steady rate,
// 99 % back within 5 minutes, no request kind in lock-step; the tunnels
// are reopened once the relay is back.
TEST(FleetGoals, EveryOutageKeepsTheGoalsWithAQuarterOfTheFleetBehindTunnels) {
    for (const fleet::Scenario& s : fleet::DefaultScenarios()) {
        if (s.kind != fleet::ScenarioKind::OUTAGE) continue;
        const fleet::Result r = fleet::RunScenario(Small(), Shipped(), s);
        EXPECT_GT(r.Series("tunnel").peakAfterReturn, 0) << s.name;
        EXPECT_LE(PeakOverSteady(r), 2.0) << fleet::FormatResult(r);
        EXPECT_LE(r.recover99, 300) << fleet::FormatResult(r);
        EXPECT_FALSE(AnyLockStep(r)) << fleet::FormatResult(r);
        const std::vector<std::string> missed = fleet::CheckGoals(r);
        EXPECT_TRUE(missed.empty()) << (missed.empty() ? "" : missed.front());
    }
}

// A tunnel retried 2 s after it closed, as before the rule was measured:
// the tunnels an outage closes register again together.
TEST(FleetGoals, TunnelsRetriedAfterTwoSecondsComeBackTogether) {
    fleet::Rules quick;
    ASSERT_TRUE(fleet::FindRules("tunnel-2s", quick));
    const fleet::Result r = fleet::RunScenario(Small(), quick, Named("outage-1h-refused"));
    EXPECT_GT(PeakOverSteady(r), 2.0) << fleet::FormatResult(r);
    EXPECT_TRUE(AnyLockStep(r)) << fleet::FormatResult(r);
    EXPECT_FALSE(fleet::CheckGoals(r).empty());
}

// The same checks catch the rules the daemon had before the fleet was
// measured: 30 s doubling to 30 minutes, 10 s after a failed lookup.
TEST(FleetGoals, TheEarlierRulesMissedThem) {
    const fleet::Result outage = fleet::RunScenario(Small(), Before(), Named("outage-1h-refused"));
    EXPECT_GT(outage.recover99, 300) << fleet::FormatResult(outage);
    EXPECT_GT(PeakOverSteady(outage), 2.0) << fleet::FormatResult(outage);
    const fleet::Result dns = fleet::RunScenario(Small(), Before(), Named("dns-30m"));
    EXPECT_GT(PeakOverSteady(dns), 10.0) << fleet::FormatResult(dns);
    EXPECT_TRUE(AnyLockStep(dns)) << fleet::FormatResult(dns);
    EXPECT_FALSE(fleet::CheckGoals(outage).empty());
}

TEST(FleetGoals, ASeededRunRepeatsItselfExactly) {
    const fleet::Result a = fleet::RunScenario(Small(), Shipped(), Named("outage-5m-hanging"));
    const fleet::Result b = fleet::RunScenario(Small(), Shipped(), Named("outage-5m-hanging"));
    EXPECT_EQ(a.events, b.events);
    EXPECT_EQ(a.perSecond, b.perSecond);
    fleet::FleetConfig other = Small();
    other.seed = 8;
    const fleet::Result c = fleet::RunScenario(other, Shipped(), Named("outage-5m-hanging"));
    EXPECT_NE(a.perSecond, c.perSecond);
}

}  // namespace

namespace {

// A file of the given text below /tmp, removed again at the end of the scope.
class TextFile {
public:
    explicit TextFile(const std::string& text) {
        std::string name = "/tmp/fleet_records_" + std::to_string(getpid()) + "_XXXXXX";
        std::vector<char> buf(name.begin(), name.end());
        buf.push_back('\0');
        const int fd = mkstemp(buf.data());
        if (fd >= 0) {
            _path = buf.data();
            const bool whole = write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
            close(fd);
            if (!whole) ADD_FAILURE() << "cannot write " << _path;
        } else {
            ADD_FAILURE() << "cannot create a file below /tmp";
        }
    }
    ~TextFile() {
        if (!_path.empty()) unlink(_path.c_str());
    }
    const std::string& path() const { return _path; }

private:
    std::string _path;
};

fleet::RecordedRun TwoDaemons() {
    // Heartbeat 60 s, started 30 s apart, the outage from 0 to 60 s: each
    // misses its heartbeat in it (0 s and 30 s), then comes back 290 s and
    // 325 s after the event.
    fleet::RecordedRun run;
    run.appliances = 2;
    run.heartbeatSeconds = 60;
    run.bootSpreadSeconds = 60;
    run.steadySeconds = 60;
    run.outageSeconds = 60;
    run.afterSeconds = 305;
    auto add = [&run](double t, int kind, int appliance, bool ok) {
        fleet::RecordedRequest r;
        r.secondsFromEvent = t;
        r.kind = kind;
        r.appliance = appliance;
        r.ok = ok;
        run.requests.push_back(r);
    };
    for (double t : {-120.0, -60.0, 290.0, 350.0}) add(t, fleet::REQ_REGISTER, 0, true);
    for (double t : {-90.0, -30.0, 325.0}) add(t, fleet::REQ_REGISTER, 1, true);
    add(-119.9, fleet::REQ_ALIAS_MAP, 0, true);
    return run;
}

}  // namespace

TEST(RealFleetRecords, MissedHeartbeatsMakeTheRecoveryTimes) {
    const fleet::Result r = fleet::ResultFromRecords(TwoDaemons());
    EXPECT_EQ(0.0, r.recoveredAtReference) << fleet::FormatResult(r);
    EXPECT_DOUBLE_EQ(230.0, r.recover50) << fleet::FormatResult(r);
    EXPECT_DOUBLE_EQ(265.0, r.recover99) << fleet::FormatResult(r);
    EXPECT_DOUBLE_EQ(265.0, r.recover100) << fleet::FormatResult(r);
    // Two registrations in the steady minute; the busiest minute after the
    // event holds the two comebacks 35 s apart.
    EXPECT_NEAR(2.0 / 60, r.Series("register").steady, 1e-9);
    EXPECT_NEAR(2.0 / 60, r.Series("register").peak, 1e-9);
    EXPECT_EQ(0.0, r.Series("alias_map").steady);  // the map came before the steady window
}

TEST(RealFleetRecords, AHeartbeatOnTimeKeepsADaemonConnected) {
    fleet::RecordedRun run = TwoDaemons();
    // Daemon 1's heartbeat at 30 s came through after all (a shorter outage).
    fleet::RecordedRequest r;
    r.secondsFromEvent = 30;
    r.appliance = 1;
    r.ok = true;
    run.requests.push_back(r);
    run.requests.erase(run.requests.begin() + 6);  // its comeback at 325 s
    const fleet::Result res = fleet::ResultFromRecords(run);
    EXPECT_DOUBLE_EQ(0.5, res.recoveredAtReference) << fleet::FormatResult(res);
    EXPECT_DOUBLE_EQ(0.0, res.recover50);
    // Its next heartbeat (90 s) never came: gone again until the end.
    EXPECT_LT(res.recover100, 0) << fleet::FormatResult(res);
}

TEST(RealFleetRecords, TheSimulatorOfTheSameSetUpAgreesWithADaemonThatKeepsTheRules) {
    const fleet::RecordedRun run = TwoDaemons();
    const fleet::FleetConfig config = fleet::MatchingConfig(run, 3);
    EXPECT_TRUE(config.bootEvenly);
    EXPECT_TRUE(config.servedOnly);
    EXPECT_EQ(0, config.tunnelPercent);
    EXPECT_EQ(0, fleet::MatchingRules().registration.startSpreadMs);
    const fleet::Result sim =
        fleet::RunScenario(config, fleet::MatchingRules(), fleet::MatchingScenario(run));
    // Both miss their heartbeat in the outage and come back 285-300 s after it.
    EXPECT_EQ(0.0, sim.recoveredAtReference) << fleet::FormatResult(sim);
    EXPECT_GE(sim.recover100, 225) << fleet::FormatResult(sim);
    EXPECT_LE(sim.recover100, 300) << fleet::FormatResult(sim);
    // Refused attempts are not counted: nothing reached the server in the outage.
    for (size_t s = static_cast<size_t>((sim.eventMs - sim.windowStartMs) / 1000);
         s < static_cast<size_t>((sim.returnMs - sim.windowStartMs) / 1000); ++s) {
        EXPECT_EQ(0u, sim.perSecond[fleet::REQ_REGISTER][s]) << s;
    }
}

TEST(RealFleetRecords, ReadsWhatRealFleetWritesAndRefusesOtherFiles) {
    TextFile good(
        "# real fleet: appliances 2 heartbeat 60 boot_spread 60 steady 60.5 outage 60.1 after 305\n"
        "# memory_kib alive 2 rss_mean 1 rss_max 1 pss_mean 1 pss_max 1\n"
        "seconds_from_event,kind,appliance,ok\n"
        "-120.000,register,0,1\n"
        "-119.900,alias_map,0,1\n"
        "-90.000,register,1,0\n");
    fleet::RecordedRun run;
    std::string error;
    ASSERT_TRUE(fleet::ReadRecordedRun(good.path(), run, error)) << error;
    EXPECT_EQ(2, run.appliances);
    EXPECT_DOUBLE_EQ(60.5, run.steadySeconds);
    EXPECT_DOUBLE_EQ(60.1, run.outageSeconds);
    ASSERT_EQ(3u, run.requests.size());
    EXPECT_EQ(fleet::REQ_ALIAS_MAP, run.requests[1].kind);
    EXPECT_FALSE(run.requests[2].ok);
    ASSERT_EQ(1u, run.notes.size());
    EXPECT_EQ(0u, run.notes[0].find("memory_kib"));

    TextFile badAppliance(
        "# real fleet: appliances 2 heartbeat 60 boot_spread 60 steady 60 outage 60 after 305\n"
        "seconds_from_event,kind,appliance,ok\n"
        "1.0,register,2,1\n");
    EXPECT_FALSE(fleet::ReadRecordedRun(badAppliance.path(), run, error));
    EXPECT_NE(std::string::npos, error.find(":3: bad request line")) << error;
    TextFile noHeader("seconds_from_event,kind,appliance,ok\n1.0,register,0,1\n");
    EXPECT_FALSE(fleet::ReadRecordedRun(noHeader.path(), run, error));
    EXPECT_FALSE(fleet::ReadRecordedRun("/nonexistent/records.csv", run, error));
    EXPECT_NE(std::string::npos, error.find("cannot be read")) << error;
}
