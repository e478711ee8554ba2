// The registration cycle against the local control server, on a clock the
// test moves by hand: what each answer gives the daemon, which retries are
// armed on the loop and after how long, and what Stop() drops.
#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "cycle_fixture.h"
#include "registration_cycle.h"

using namespace ZEPA::Relay;
using zeparelayd::RegistrationCycle;
using zeparelayd::RegistrationOutcome;
using zeparelayd::RegistrationPolicy;

namespace {

const char PAGE[] = "/Serv.php";
const char TIMER[] = "register";
const int64_t FAILURE_WAIT_MS = 285000;

class RegistrationCycleTest : public zepatest::CycleTest {
protected:
    void Build(const Json::Value& conf) {
        WriteConfig(conf);
        relay.reset(new RelaydConf(Daemon::GetConfPath().c_str()));
        cycle.reset(new RegistrationCycle(
            *relay, loop, clock,
            [this](const RegistrationOutcome& o) {
                outcomes.push_back(o);
                at.push_back(clock.NowMs());
            },
            random.Source()));
    }
    void Build() { Build(Config()); }

    void TearDown() override {
        if (cycle) cycle->Stop();
        cycle.reset();
        relay.reset();
        CycleTest::TearDown();
    }

    // Pumps until an outcome of that kind arrives after the first skip ones.
    bool WaitFor(RegistrationOutcome::Kind kind, size_t skip = 0) {
        return Pump([&] {
            for (size_t i = skip; i < outcomes.size(); ++i) {
                if (outcomes[i].kind == kind) return true;
            }
            return false;
        });
    }
    const RegistrationOutcome& Last() const { return outcomes.back(); }
    Json::Value Dump() const {
        Json::Value out;
        cycle->Dump(out);
        return out;
    }
    // The last attempt's start: when its SENDING outcome came.
    int64_t SentAt() const {
        for (size_t i = outcomes.size(); i-- > 0;) {
            if (outcomes[i].kind == RegistrationOutcome::SENDING) return at[i];
        }
        return -1;
    }

    std::unique_ptr<RelaydConf> relay;
    std::unique_ptr<RegistrationCycle> cycle;
    std::vector<RegistrationOutcome> outcomes;
    std::vector<int64_t> at;  // the clock when each outcome came
};

TEST_F(RegistrationCycleTest, SuccessHandsTheAnswerToTheDaemonAndKeepsTheServerId) {
    Build();
    cycle->Start();
    ASSERT_FALSE(outcomes.empty());
    EXPECT_EQ(RegistrationOutcome::SENDING, outcomes[0].kind);
    EXPECT_FALSE(outcomes[0].heartbeat);
    ASSERT_TRUE(WaitFor(RegistrationOutcome::REGISTERED));
    ASSERT_EQ(2u, outcomes.size());
    const Json::Value& answer = Last().answer;
    EXPECT_EQ(0, answer["errno"].asInt());
    const std::string id = answer["serverID"].asString();
    ASSERT_FALSE(id.empty());
    EXPECT_EQ(id, relay->serverID);
    EXPECT_EQ(id, ReadJson(Daemon::GetConfPath())["serverID"].asString());

    const Json::Value requests = server.requests(PAGE);
    ASSERT_EQ(1u, requests.size());
    Json::Value body;
    ASSERT_TRUE(Json::Reader().parse(zepatest::RecordedBody(requests[0]), body));
    EXPECT_EQ("register", body["command"].asString());
    EXPECT_FALSE(body["identity"]["serial"].asString().empty());

    // Nothing left to do: no retry, no exchange.
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
    EXPECT_FALSE(loop.HasRequest(TIMER));
    const Json::Value dump = Dump();
    EXPECT_EQ(-1, dump["retry_in_ms"].asInt64());
    EXPECT_EQ(0, dump["failures"].asInt());
}

TEST_F(RegistrationCycleTest, HeartbeatIsSaidSoAndTheKnownIdIsSent) {
    Build();
    cycle->Start();
    ASSERT_TRUE(WaitFor(RegistrationOutcome::REGISTERED));
    const std::string id = relay->serverID;
    const size_t before = outcomes.size();
    cycle->Start(true);
    ASSERT_GT(outcomes.size(), before);
    EXPECT_EQ(RegistrationOutcome::SENDING, outcomes[before].kind);
    EXPECT_TRUE(outcomes[before].heartbeat);
    ASSERT_TRUE(WaitFor(RegistrationOutcome::REGISTERED, before));
    const Json::Value requests = server.requests(PAGE);
    ASSERT_EQ(2u, requests.size());
    Json::Value body;
    ASSERT_TRUE(Json::Reader().parse(zepatest::RecordedBody(requests[1]), body));
    EXPECT_EQ(id, body["serverID"].asString());
}

TEST_F(RegistrationCycleTest, RefusedServerIsRetriedAboutFiveMinutesAfterTheAttemptStarted) {
    Json::Value conf = Config();
    {
        // A port nobody listens on any more.
        zepatest::LocalServer gone;
        ASSERT_TRUE(gone.ok()) << gone.error();
        conf["server_control"]["port"] = gone.httpsPort();
        gone.stop();
    }
    Build(conf);
    cycle->Start();
    ASSERT_TRUE(WaitFor(RegistrationOutcome::FAILED));
    const RegistrationOutcome failed = Last();
    EXPECT_NE(RELAYD_SUCCESS, failed.error);
    EXPECT_FALSE(RegistrationPolicy::NeedsReload(failed.error)) << failed.error;
    const int64_t sent = SentAt();
    const int64_t failedAt = at.back();
    EXPECT_EQ(FAILURE_WAIT_MS - (failedAt - sent), failed.retryMs);
    // One loop timer holds the wait; the dump shows what it has left.
    EXPECT_EQ(failed.retryMs - (clock.NowMs() - failedAt), loop.TimerRemaining(TIMER));
    clock.Advance(1000);
    EXPECT_EQ(loop.TimerRemaining(TIMER), Dump()["retry_in_ms"].asInt64());
    EXPECT_EQ(1, Dump()["failures"].asInt());

    // Not a moment early ...
    const size_t before = outcomes.size();
    AdvanceAndRun(loop.TimerRemaining(TIMER) - 1);
    EXPECT_EQ(before, outcomes.size());
    // ... and on time, with the last error still shown while it runs.
    AdvanceAndRun(1);
    ASSERT_GT(outcomes.size(), before);
    EXPECT_EQ(RegistrationOutcome::SENDING, outcomes[before].kind);
    EXPECT_EQ(failed.error, outcomes[before].error);
    ASSERT_TRUE(WaitFor(RegistrationOutcome::FAILED, before));
    EXPECT_EQ(2, Dump()["failures"].asInt());
}

TEST_F(RegistrationCycleTest, JitterLengthensTheWait) {
    random.value = 14250;  // the most there is: 5 % of 285 s
    Build();
    ASSERT_TRUE(server.script(PAGE, 503, "busy"));
    cycle->Start();
    ASSERT_TRUE(WaitFor(RegistrationOutcome::FAILED));
    EXPECT_EQ(FAILURE_WAIT_MS + 14250 - (at.back() - SentAt()), Last().retryMs);
}

TEST_F(RegistrationCycleTest, ServerThatHangsCostsNoExtraWait) {
    Build();
    ASSERT_TRUE(server.hang(PAGE, 1.0));
    cycle->Start();
    ASSERT_TRUE(WaitFor(RegistrationOutcome::FAILED));
    const int64_t hung = at.back() - SentAt();
    EXPECT_GT(hung, 0);
    // Counted from the start of the attempt, not from its end.
    EXPECT_EQ(FAILURE_WAIT_MS - hung, Last().retryMs);
}

TEST_F(RegistrationCycleTest, RefusalOnlyAReloadCuresArmsNothing) {
    Build();
    ASSERT_TRUE(server.script(PAGE, 200, "{\"errno\": 2}"));
    cycle->Start();
    ASSERT_TRUE(WaitFor(RegistrationOutcome::FAILED));
    EXPECT_EQ(RELAYD_ERR_AUTH, Last().error);
    EXPECT_EQ(RegistrationPolicy::WAIT_FOR_RELOAD, Last().retryMs);
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
    EXPECT_TRUE(Dump()["halted"].asBool());
    EXPECT_EQ(-1, Dump()["retry_in_ms"].asInt64());
    const size_t before = outcomes.size();
    AdvanceAndRun(3600000);
    EXPECT_EQ(before, outcomes.size());
    EXPECT_EQ(1u, server.requests(PAGE).size());

    // A reload starts afresh and registers at once.
    cycle->Restart();
    EXPECT_FALSE(Dump()["halted"].asBool());
    ASSERT_TRUE(WaitFor(RegistrationOutcome::REGISTERED, before));
    EXPECT_EQ(RELAYD_ERR_AUTH, outcomes[before].error);  // SENDING shows the last error
}

TEST_F(RegistrationCycleTest, ServerChangedFollowsTheNewHostAtOnce) {
    Build();
    ASSERT_TRUE(server.script(PAGE, 200, "{\"errno\": 13, \"control_host\": \"localhost\"}"));
    cycle->Start();
    ASSERT_TRUE(WaitFor(RegistrationOutcome::REGISTERED));
    ASSERT_EQ(4u, outcomes.size());
    EXPECT_EQ(RegistrationOutcome::FAILED, outcomes[1].kind);
    EXPECT_EQ(RELAYD_ERR_SERVER_CHANGED, outcomes[1].error);
    EXPECT_EQ(0, outcomes[1].retryMs);
    EXPECT_EQ(RegistrationOutcome::SENDING, outcomes[2].kind);
    EXPECT_EQ(RELAYD_ERR_SERVER_CHANGED, outcomes[2].error);
    EXPECT_EQ(at[1], at[2]);

    EXPECT_EQ("localhost", relay->serverControl.host);
    EXPECT_EQ("localhost", ReadJson(Daemon::GetConfPath())["server_control"]["host"].asString());
    const Json::Value requests = server.requests(PAGE);
    ASSERT_EQ(2u, requests.size());
    EXPECT_EQ(0u, zepatest::RecordedHeader(requests[1], "Host").find("localhost"))
        << zepatest::RecordedHeader(requests[1], "Host");
}

TEST_F(RegistrationCycleTest, ARunOfMovesBacksOff) {
    Build();
    ASSERT_TRUE(server.script(PAGE, 200, "{\"errno\": 13, \"control_host\": \"localhost\"}", 2));
    cycle->Start();
    ASSERT_TRUE(Pump([&] { return outcomes.size() >= 4; }));
    ASSERT_EQ(4u, outcomes.size());
    EXPECT_EQ(RegistrationOutcome::FAILED, outcomes[3].kind);
    EXPECT_EQ(RELAYD_ERR_SERVER_CHANGED, outcomes[3].error);
    EXPECT_EQ(FAILURE_WAIT_MS, outcomes[3].retryMs);
    EXPECT_EQ(FAILURE_WAIT_MS - (clock.NowMs() - at[3]), loop.TimerRemaining(TIMER));
    EXPECT_EQ(2, Dump()["moves"].asInt());
}

TEST_F(RegistrationCycleTest, StopDropsTheExchangeAndTheTimer) {
    Build();
    ASSERT_TRUE(server.hang(PAGE, 2.0));
    cycle->Start();
    ASSERT_TRUE(Pump([&] { return server.requests(PAGE).size() == 1; }));
    EXPECT_TRUE(loop.HasRequest(TIMER));
    cycle->Stop();
    EXPECT_FALSE(loop.HasRequest(TIMER));
    const size_t before = outcomes.size();
    Settle(2500);
    EXPECT_EQ(before, outcomes.size());

    // A failure's retry goes too.
    ASSERT_TRUE(server.script(PAGE, 503, "busy"));
    cycle->Start();
    ASSERT_TRUE(WaitFor(RegistrationOutcome::FAILED, before));
    ASSERT_GT(loop.TimerRemaining(TIMER), 0);
    cycle->Stop();
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
    EXPECT_EQ(-1, Dump()["retry_in_ms"].asInt64());
    const size_t after = outcomes.size();
    AdvanceAndRun(3600000);
    EXPECT_EQ(after, outcomes.size());
}

TEST_F(RegistrationCycleTest, SwitchedOffSendsNothing) {
    const std::string info = root + "/etc/zepainfo.conf";
    const std::string cmd = "sed -i 's/^runrelayd=.*/runrelayd=\"no\"/' '" + info + "'";
    ASSERT_EQ(0, system(cmd.c_str()));
    Build();
    ASSERT_FALSE(relay->enable);
    cycle->Start();
    ASSERT_EQ(1u, outcomes.size());
    EXPECT_EQ(RegistrationOutcome::OFF, outcomes[0].kind);
    EXPECT_FALSE(loop.HasRequest(TIMER));
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
    Settle(200);
    EXPECT_EQ(0u, server.requests(PAGE).size());
}

TEST_F(RegistrationCycleTest, NoControlServerIsAConfigurationError) {
    Json::Value conf = Config();
    conf["server_control"]["host"] = "";
    conf["server_control"]["ip"] = "";
    Build(conf);
    cycle->Start();
    ASSERT_FALSE(outcomes.empty());
    EXPECT_EQ(RegistrationOutcome::FAILED, Last().kind) << relay->serverControl.GetUrl(nullptr);
    EXPECT_EQ(RELAYD_ERR_CONFIG, Last().error);
    EXPECT_EQ(RegistrationPolicy::WAIT_FOR_RELOAD, Last().retryMs);
    EXPECT_EQ(-1, loop.TimerRemaining(TIMER));
}

}  // namespace
