// The tunnel cycle without a relay: what each registration answer makes of
// the state, its back-off policy against a clock the test moves by hand, and
// an incomplete tunnel answer.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>
#include <utility>
#include <vector>

#include <zepasdk/sysroot.h>

#include "fake_clock.h"
#include "retry_policy.h"
#include "tunnel_cycle.h"

using namespace ZEPA::Relay;
using zeparelayd::EventLoop;
using zeparelayd::TunnelCycle;
using zeparelayd::TunnelPolicy;

namespace {

class TunnelPolicyTest : public ::testing::Test {
protected:
    zepatest::FakeClock clock;
    zepatest::FixedRandom random;
    long& jitter = random.value;
    TunnelPolicy policy{clock, random.Source()};
};

TEST_F(TunnelPolicyTest, DoublesFromTwoSecondsUpToFiveMinutes) {
    EXPECT_EQ(2000, policy.OnFailure());
    EXPECT_EQ(4000, policy.OnFailure());
    EXPECT_EQ(8000, policy.OnFailure());
    for (int i = 4; i < 8; ++i) policy.OnFailure();
    EXPECT_EQ(256000, policy.OnFailure());
    EXPECT_EQ(300000, policy.OnFailure());
    EXPECT_EQ(300000, policy.OnFailure());
    EXPECT_EQ(10, policy.Failures());
}

TEST_F(TunnelPolicyTest, JitterIsAtMostAQuarter) {
    jitter = 500;
    EXPECT_EQ(2500, policy.BackoffMs(1));
    jitter = 501;
    EXPECT_EQ(2000, policy.BackoffMs(1));
    jitter = 75000;
    EXPECT_EQ(300000 + 75000, policy.BackoffMs(20));
    jitter = -7;
    EXPECT_LE(policy.BackoffMs(1), 2500);
    EXPECT_GE(policy.BackoffMs(1), 2000);
}

TEST_F(TunnelPolicyTest, DeadlineFollowsTheClockAndUpStartsAfresh) {
    EXPECT_EQ(-1, policy.RemainingMs());
    policy.OnFailure();
    EXPECT_EQ(2000, policy.RemainingMs());
    clock.Advance(1500);
    EXPECT_EQ(500, policy.RemainingMs());
    clock.Advance(1000);
    EXPECT_EQ(0, policy.RemainingMs());
    policy.OnFailure();
    EXPECT_EQ(4000, policy.RemainingMs());
    policy.OnUp();
    EXPECT_EQ(0, policy.Failures());
    EXPECT_EQ(-1, policy.RemainingMs());
    EXPECT_EQ(2000, policy.OnFailure());
}

// A cycle on a real event loop (real time: the timers are short), below a
// throwaway system root.
class TunnelCycleTest : public ::testing::Test {
protected:
    TunnelCycleTest()
        : cycle(loop, monotonic,
                TunnelCycle::Hooks{[this](RELAYD_STATE s, RELAYD_RET e) {
                                       states.push_back({s, e});
                                   },
                                   [this] { ++reregistrations; }},
                [] { return 0L; }) {}

    void SetUp() override {
        char dir[] = "/tmp/zepa_tunnel_cycle_XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(dir));
        root = dir;
        ZEPASysRootSet(root.c_str());
    }
    void TearDown() override {
        cycle.Stop(false);
        ZEPASysRootSet("/");
        if (!root.empty()) {
            const std::string cmd = "rm -rf '" + root + "'";
            EXPECT_EQ(0, system(cmd.c_str()));
        }
    }

    // Runs the loop's due timers.
    void RunFor(int64_t ms) {
        loop.SetTimer("test_stop", ms, [this] { loop.Stop(); });
        ASSERT_TRUE(loop.Run());
    }

    zeparelayd::MonotonicClock monotonic;
    EventLoop loop{monotonic};
    std::vector<std::pair<RELAYD_STATE, RELAYD_RET>> states;
    int reregistrations = 0;
    TunnelCycle cycle;
    std::string root;
};

TEST_F(TunnelCycleTest, DirectAnswerIsStateFourWithoutTunnel) {
    Json::Value answer;
    answer["errno"] = 0;
    answer["connect"] = "direct";
    cycle.OnRegistered(answer);
    ASSERT_EQ(1u, states.size());
    EXPECT_EQ(RELAYD_STATE_DIRECT_CONNECT, states[0].first);
    EXPECT_EQ("direct", cycle.Status()["connect"].asString());
    EXPECT_FALSE(cycle.Status().isMember("tunnel"));
}

TEST_F(TunnelCycleTest, AnswerWithoutConnectWordIsRegisteredOnly) {
    Json::Value answer;
    answer["errno"] = 0;
    cycle.OnRegistered(answer);
    ASSERT_EQ(1u, states.size());
    EXPECT_EQ(RELAYD_STATE_CONNECTED, states[0].first);
    EXPECT_EQ(-1, loop.TimerRemaining("heartbeat"));
}

TEST_F(TunnelCycleTest, ArrayAnswerAndWrongTypesAreReadSafely) {
    Json::Value answer(Json::arrayValue);
    answer[0u]["connect"] = "direct";
    answer[0u]["heartbeat"] = "soon";
    cycle.OnRegistered(answer);
    ASSERT_EQ(1u, states.size());
    EXPECT_EQ(RELAYD_STATE_DIRECT_CONNECT, states[0].first);
    EXPECT_EQ(-1, loop.TimerRemaining("heartbeat"));

    Json::Value odd;
    odd["connect"] = 7;
    cycle.OnRegistered(odd);
    ASSERT_EQ(2u, states.size());
    EXPECT_EQ(RELAYD_STATE_CONNECTED, states[1].first);
    EXPECT_EQ("", cycle.Status()["connect"].asString());
}

TEST_F(TunnelCycleTest, HeartbeatRegistersAgain) {
    Json::Value answer;
    answer["connect"] = "direct";
    answer["heartbeat"] = 1;
    cycle.OnRegistered(answer);
    EXPECT_GT(loop.TimerRemaining("heartbeat"), 0);
    RunFor(1300);
    EXPECT_EQ(1, reregistrations);
}

TEST_F(TunnelCycleTest, IncompleteTunnelAnswerIsAnErrorWithBackOff) {
    Json::Value answer;
    answer["connect"] = "tunnel";
    answer["tunnel"]["relay_ip"] = "10.213.0.1";
    answer["tunnel"]["relay_user"] = "zr1";
    answer["tunnel"]["relay_pass"] = "";
    cycle.OnRegistered(answer);
    RunFor(50);
    ASSERT_EQ(2u, states.size());
    EXPECT_EQ(RELAYD_STATE_CONNECTED, states[0].first);
    EXPECT_EQ(RELAYD_STATE_LOGIN, states[1].first);
    EXPECT_EQ(RELAYD_ERR_NOT_SUPPORT, states[1].second);
    const Json::Value status = cycle.Status();
    EXPECT_EQ("INVALID_CONF", status["tunnel"]["status"].asString());
    EXPECT_EQ(1, status["tunnel"]["failures"].asInt());
    EXPECT_FALSE(status["tunnel"].isMember("relay_pass"));
    // Jitter 0: the first retry after exactly 2 s, less the time run so far.
    EXPECT_GE(loop.TimerRemaining("tunnel_retry"), 1000);
    EXPECT_LE(loop.TimerRemaining("tunnel_retry"), 2000);
    EXPECT_EQ(0, reregistrations);
    Json::Value dump;
    cycle.Dump(dump);
    EXPECT_EQ(1, dump["retry"]["failures"].asInt());
    EXPECT_FALSE(dump["tunnel"].isMember("relay_pass"));
}

TEST_F(TunnelCycleTest, PasswordIsNeverShown) {
    Json::Value answer;
    answer["connect"] = "tunnel";
    answer["tunnel"]["relay_ip"] = "10.213.0.1";
    answer["tunnel"]["relay_user"] = "zr1";
    answer["tunnel"]["relay_pass"] = "s3cret-pass";
    cycle.OnRegistered(answer);
    Json::Value dump;
    cycle.Dump(dump);
    EXPECT_EQ(std::string::npos, dump.toStyledString().find("s3cret-pass"));
    EXPECT_EQ(std::string::npos, cycle.Status().toStyledString().find("s3cret-pass"));
    EXPECT_EQ("10.213.0.1", cycle.Status()["tunnel"]["relay_ip"].asString());
    cycle.Stop(false);
    EXPECT_FALSE(cycle.HasTunnel());
    EXPECT_EQ(-1, loop.TimerRemaining("tunnel"));
}

}  // namespace
