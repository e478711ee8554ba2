// The alias cycle against the local alias server, on a clock the test moves
// by hand: map after a registration, keep alive after a success, back off on
// failures, halt on stop-class answers until a reload, and what each
// exchange hands to the daemon.
#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include <zeparelayd/config_alias.h>

#include "alias_cycle.h"
#include "cycle_fixture.h"

using namespace ZEPA::Relay;
using zeparelayd::AliasCycle;
using zeparelayd::AliasOutcome;

namespace {

const char PAGE[] = "/alias_update.php";
const char TIMER[] = "alias";
const int POLL_SECONDS = 600;

class AliasCycleTest : public zepatest::CycleTest {
protected:
    void Build(const Json::Value& conf) {
        WriteConfig(conf);
        relay.reset(new RelaydConf(Daemon::GetConfPath().c_str()));
        cycle.reset(new AliasCycle(
            *relay, loop, clock,
            [this](const AliasOutcome& o) {
                outcomes.push_back(o);
                at.push_back(clock.NowMs());
            },
            random.Source()));
    }
    void Build() {
        Json::Value conf = Config();
        conf["serverID"] = "cloud-7";
        Build(conf);
    }

    void TearDown() override {
        if (cycle) cycle->Stop();
        cycle.reset();
        relay.reset();
        CycleTest::TearDown();
    }

    bool WaitForOutcomes(size_t n) {
        return Pump([&] { return outcomes.size() >= n; });
    }
    // The action of each recorded request, in order.
    std::vector<std::string> Actions() const {
        std::vector<std::string> out;
        for (const Json::Value& r : server.requests(PAGE)) {
            const std::string body = zepatest::RecordedBody(r);
            const std::string::size_type from = body.find("action=");
            out.push_back(from == std::string::npos ? ""
                                                    : body.substr(from + 7, body.find('&', from) - from - 7));
        }
        return out;
    }
    Json::Value Dump() const {
        Json::Value out;
        cycle->Dump(out);
        return out;
    }
    Json::Value StatusFile() const { return ReadJson(AliasStatus::GetPath()); }

    std::unique_ptr<RelaydConf> relay;
    std::unique_ptr<AliasCycle> cycle;
    std::vector<AliasOutcome> outcomes;
    std::vector<int64_t> at;
};

TEST_F(AliasCycleTest, RegistrationMapsAtOnceThenKeepsAliveAfterThePollingTime) {
    Build();
    cycle->SetRegistered(true);
    cycle->OnRegistered();
    EXPECT_EQ(0, loop.TimerRemaining(TIMER));
    EXPECT_EQ("map", Dump()["next"].asString());
    ASSERT_TRUE(WaitForOutcomes(1));
    const AliasOutcome& mapped = outcomes[0];
    EXPECT_EQ(ALIAS_REQ_MAP, mapped.cmd);
    EXPECT_EQ(ALIAS_RET_SUCCESS, mapped.ret);
    EXPECT_EQ("good", mapped.word);
    EXPECT_FALSE(mapped.halted);
    // Kept alive after the poll period plus up to as much again.
    EXPECT_GE(mapped.nextMs, POLL_SECONDS * 1000);
    EXPECT_LT(mapped.nextMs, 2 * POLL_SECONDS * 1000);
    EXPECT_EQ(mapped.nextMs - (clock.NowMs() - at[0]), loop.TimerRemaining(TIMER));
    EXPECT_EQ(loop.TimerRemaining(TIMER), Dump()["next_in_ms"].asInt64());
    EXPECT_EQ("keep_alive", Dump()["next"].asString());
    EXPECT_TRUE(Dump()["mapped"].asBool());
    EXPECT_EQ("cyclebox", StatusFile()["alias_name"].asString());
    EXPECT_EQ("good", StatusFile()["status"].asString());
    EXPECT_EQ(std::vector<std::string>({"map_alias"}), Actions());

    // Nothing before the keep-alive is due, then the keep-alive.
    AdvanceAndRun(loop.TimerRemaining(TIMER) - 1);
    Settle(100);
    EXPECT_EQ(1u, Actions().size());
    AdvanceAndRun(1);
    ASSERT_TRUE(WaitForOutcomes(2));
    EXPECT_EQ(ALIAS_REQ_KEEP_ALIVE, outcomes[1].cmd);
    EXPECT_EQ(ALIAS_RET_SUCCESS, outcomes[1].ret);
    EXPECT_EQ(std::vector<std::string>({"map_alias", "keep_alive_alias"}), Actions());
}

TEST_F(AliasCycleTest, NothingIsSentWhileNotRegistered) {
    Build();
    cycle->OnRegistered();
    AdvanceAndRun(0);
    Settle(200);
    EXPECT_TRUE(outcomes.empty());
    EXPECT_TRUE(Actions().empty());
    EXPECT_FALSE(cycle->Pending());
}

TEST_F(AliasCycleTest, ServerTroubleBacksOffFromAMinute) {
    Build();
    cycle->SetRegistered(true);
    ASSERT_TRUE(server.script(PAGE, 500, "oops", 2));
    cycle->OnRegistered();
    ASSERT_TRUE(WaitForOutcomes(1));
    EXPECT_EQ(ALIAS_REQ_MAP, outcomes[0].cmd);
    EXPECT_NE(ALIAS_RET_SUCCESS, outcomes[0].ret);
    EXPECT_FALSE(outcomes[0].halted);
    EXPECT_EQ(60000, outcomes[0].nextMs);
    EXPECT_EQ(60000 - (clock.NowMs() - at[0]), loop.TimerRemaining(TIMER));
    EXPECT_EQ(outcomes[0].word, StatusFile()["status"].asString());
    // The same command again once the wait is over, then twice as long.
    AdvanceAndRun(loop.TimerRemaining(TIMER));
    ASSERT_TRUE(WaitForOutcomes(2));
    EXPECT_EQ(ALIAS_REQ_MAP, outcomes[1].cmd);
    EXPECT_EQ(120000, outcomes[1].nextMs);
    EXPECT_EQ(2, Dump()["failures"].asInt());
    EXPECT_EQ(std::vector<std::string>({"map_alias", "map_alias"}), Actions());
}

TEST_F(AliasCycleTest, JitterAddsUpToHalfTheWait) {
    random.value = 30000;
    Build();
    cycle->SetRegistered(true);
    ASSERT_TRUE(server.scriptAction(PAGE, "close"));
    cycle->OnRegistered();
    ASSERT_TRUE(WaitForOutcomes(1));
    EXPECT_EQ(90000, outcomes[0].nextMs);
}

TEST_F(AliasCycleTest, StopClassAnswerHaltsUntilAReload) {
    Build();
    cycle->SetRegistered(true);
    ASSERT_TRUE(server.script(PAGE, 200, "badauth:token does not match serial"));
    cycle->OnRegistered();
    ASSERT_TRUE(WaitForOutcomes(1));
    EXPECT_EQ(ALIAS_RET_AUTH, outcomes[0].ret);
    EXPECT_EQ("badauth", outcomes[0].word);
    EXPECT_EQ("token does not match serial", outcomes[0].extra);
    EXPECT_TRUE(outcomes[0].halted);
    EXPECT_EQ(-1, outcomes[0].nextMs);
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
    EXPECT_TRUE(cycle->Halted());
    EXPECT_EQ("badauth", StatusFile()["status"].asString());

    // Neither time nor a new registration sends anything ...
    AdvanceAndRun(3600000);
    cycle->OnRegistered();
    AdvanceAndRun(0);
    Settle(100);
    EXPECT_EQ(1u, Actions().size());
    EXPECT_FALSE(cycle->Pending());

    // ... an explicit request does, at once ...
    cycle->OnRequested();
    EXPECT_EQ(0, loop.TimerRemaining(TIMER));
    ASSERT_TRUE(WaitForOutcomes(2));
    EXPECT_EQ(ALIAS_RET_SUCCESS, outcomes[1].ret);
    EXPECT_EQ(2u, Actions().size());

    // ... and a reload starts afresh: the next registration maps again.
    cycle->Reset();
    EXPECT_FALSE(cycle->Halted());
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
    cycle->OnRegistered();
    ASSERT_TRUE(WaitForOutcomes(3));
    EXPECT_EQ(ALIAS_REQ_MAP, outcomes[2].cmd);
}

TEST_F(AliasCycleTest, UnreachableServerIsANormalFailure) {
    Json::Value conf = Config();
    conf["serverID"] = "cloud-7";
    {
        zepatest::LocalServer gone;
        ASSERT_TRUE(gone.ok()) << gone.error();
        conf["server_alias"]["url"] = gone.httpsUrl();
        gone.stop();
    }
    Build(conf);
    cycle->SetRegistered(true);
    cycle->OnRegistered();
    ASSERT_TRUE(WaitForOutcomes(1));
    EXPECT_EQ(ALIAS_RET_NETWORK, outcomes[0].ret) << outcomes[0].word;
    EXPECT_FALSE(outcomes[0].halted);
    EXPECT_EQ(60000, outcomes[0].nextMs);
}

TEST_F(AliasCycleTest, StopDropsTheExchangeAndTheTimer) {
    Build();
    cycle->SetRegistered(true);
    ASSERT_TRUE(server.hang(PAGE, 2.0));
    cycle->OnRegistered();
    ASSERT_TRUE(Pump([&] { return Actions().size() == 1; }));
    EXPECT_TRUE(cycle->Pending());
    cycle->Stop();
    EXPECT_FALSE(cycle->Pending());
    EXPECT_EQ("", Dump()["next"].asString());
    Settle(2500);
    EXPECT_TRUE(outcomes.empty());

    ASSERT_TRUE(server.script(PAGE, 500, "oops"));
    cycle->OnRegistered();
    ASSERT_TRUE(WaitForOutcomes(1));
    ASSERT_GT(loop.TimerRemaining(TIMER), 0);
    cycle->Stop();
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
    EXPECT_EQ(-1, Dump()["next_in_ms"].asInt64());
    AdvanceAndRun(3600000);
    Settle(100);
    EXPECT_EQ(1u, outcomes.size());
}

TEST_F(AliasCycleTest, DeleteOnSwitchOffIsReportedToo) {
    Build();
    cycle->SetRegistered(true);
    cycle->OnRegistered();
    ASSERT_TRUE(WaitForOutcomes(1));
    ASSERT_EQ(ALIAS_RET_SUCCESS, outcomes[0].ret);
    cycle->DeleteOnDisable();
    cycle->Reset();
    ASSERT_TRUE(WaitForOutcomes(2));
    EXPECT_EQ(ALIAS_REQ_DELETE, outcomes[1].cmd);
    EXPECT_EQ(ALIAS_RET_SUCCESS, outcomes[1].ret);
    EXPECT_EQ("deleted", outcomes[1].word);
    EXPECT_EQ("deleted", StatusFile()["status"].asString());
    EXPECT_EQ(std::vector<std::string>({"map_alias", "delete_alias"}), Actions());
}

}  // namespace
