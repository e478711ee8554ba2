// The tunnel cycle without a relay: the outcome of each registration answer,
// its back-off policy against a clock the test moves by hand, and an
// incomplete tunnel answer.
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <functional>
#include <sstream>

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
using zeparelayd::TunnelOutcome;
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

TEST_F(TunnelPolicyTest, AClosedTunnelRegistersAgainWithinFiveMinutes) {
    jitter = 0;
    EXPECT_EQ(0, policy.OnClosed());
    EXPECT_EQ(1, policy.Failures());
    policy.OnUp();
    jitter = 300000;
    EXPECT_EQ(300000, policy.OnClosed());
    policy.OnUp();
    jitter = 300001;  // one past the spread wraps round to none
    EXPECT_EQ(0, policy.OnClosed());
    policy.OnUp();
    jitter = 45678;
    EXPECT_EQ(45678, policy.OnClosed());
    // Whatever the source gives, the wait stays within the five minutes.
    for (long r : {-1L, -300001L, 7L, 299999L, 600002L, 2147483647L, -2147483647L - 1}) {
        policy.OnUp();
        jitter = r;
        const int64_t wait = policy.OnClosed();
        EXPECT_GE(wait, 0) << r;
        EXPECT_LE(wait, 300000) << r;
    }
}

// A start that fails is the appliance's own affair: it keeps the quick
// doubling, also when it follows a close.
TEST_F(TunnelPolicyTest, AStartThatFailsAfterACloseGoesOnDoublingFromTheClose) {
    jitter = 30000;
    EXPECT_EQ(30000, policy.OnClosed());
    jitter = 0;
    EXPECT_EQ(4000, policy.OnFailure());
    EXPECT_EQ(8000, policy.OnFailure());
    EXPECT_EQ(3, policy.Failures());
    // Up again: the next close is spread afresh, the next failed start 2 s.
    policy.OnUp();
    jitter = 250000;
    EXPECT_EQ(250000, policy.OnClosed());
    policy.OnUp();
    EXPECT_EQ(2000 + 250000 % 501, policy.OnFailure());
}

TEST_F(TunnelPolicyTest, UpStartsAfreshAndTheWaitIgnoresTheClock) {
    EXPECT_EQ(2000, policy.OnFailure());
    clock.Advance(1500);
    EXPECT_EQ(4000, policy.OnFailure());
    policy.OnUp();
    EXPECT_EQ(0, policy.Failures());
    EXPECT_EQ(2000, policy.OnFailure());
    policy.Reset();
    Json::Value dump;
    policy.Dump(dump);
    EXPECT_EQ(0, dump["failures"].asInt());
}

// A cycle on a real event loop (real time: the timers are short), below a
// throwaway system root.
class TunnelCycleTest : public ::testing::Test {
protected:
    TunnelCycleTest()
        : cycle(
              loop, monotonic,
              [this](const TunnelOutcome& o) {
                  if (o.kind == TunnelOutcome::REGISTER_AGAIN) {
                      ++reregistrations;
                  } else {
                      outcomes.push_back(o);
                  }
              },
              [this] { return jitter; }) {}

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

    long jitter = 0;  // what the cycle's jitter source gives
    zeparelayd::MonotonicClock monotonic;
    EventLoop loop{monotonic};
    std::vector<TunnelOutcome> outcomes;
    int reregistrations = 0;
    TunnelCycle cycle;
    std::string root;
};

TEST_F(TunnelCycleTest, DirectAnswerIsStateFourWithoutTunnel) {
    Json::Value answer;
    answer["errno"] = 0;
    answer["connect"] = "direct";
    cycle.OnRegistered(answer);
    ASSERT_EQ(1u, outcomes.size());
    EXPECT_EQ(TunnelOutcome::DIRECT, outcomes[0].kind);
    EXPECT_EQ(RELAYD_SUCCESS, outcomes[0].error);
    EXPECT_EQ("direct", cycle.Status()["connect"].asString());
    EXPECT_FALSE(cycle.Status().isMember("tunnel"));
}

TEST_F(TunnelCycleTest, AnswerWithoutConnectWordIsRegisteredOnly) {
    Json::Value answer;
    answer["errno"] = 0;
    cycle.OnRegistered(answer);
    ASSERT_EQ(1u, outcomes.size());
    EXPECT_EQ(TunnelOutcome::REGISTERED, outcomes[0].kind);
    EXPECT_EQ(-1, loop.TimerRemaining("heartbeat"));
}

TEST_F(TunnelCycleTest, ArrayAnswerAndWrongTypesAreReadSafely) {
    Json::Value answer(Json::arrayValue);
    answer[0u]["connect"] = "direct";
    answer[0u]["heartbeat"] = "soon";
    cycle.OnRegistered(answer);
    ASSERT_EQ(1u, outcomes.size());
    EXPECT_EQ(TunnelOutcome::DIRECT, outcomes[0].kind);
    EXPECT_EQ(-1, loop.TimerRemaining("heartbeat"));

    Json::Value odd;
    odd["connect"] = 7;
    cycle.OnRegistered(odd);
    ASSERT_EQ(2u, outcomes.size());
    EXPECT_EQ(TunnelOutcome::REGISTERED, outcomes[1].kind);
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
    ASSERT_EQ(2u, outcomes.size());
    EXPECT_EQ(TunnelOutcome::REGISTERED, outcomes[0].kind);
    EXPECT_EQ(TunnelOutcome::FAILED, outcomes[1].kind);
    EXPECT_EQ(RELAYD_ERR_NOT_SUPPORT, outcomes[1].error);
    EXPECT_EQ(2000, outcomes[1].retryMs);
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
    // The time left is the loop's timer's.
    EXPECT_LE(dump["retry"]["retry_in_ms"].asInt64(), 2000);
    EXPECT_GE(dump["retry"]["retry_in_ms"].asInt64(), loop.TimerRemaining("tunnel_retry"));
    EXPECT_FALSE(dump["tunnel"].isMember("relay_pass"));
    loop.CancelTimer("tunnel_retry");
    cycle.Dump(dump);
    EXPECT_EQ(-1, dump["retry"]["retry_in_ms"].asInt64());
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

// A start driven by the loop, against a stand-in openvpn below the root that
// does what the test file "etc/openvpn.mode" says: "up" publishes a peer
// address (as the up script does), "die" ends at once, anything else stays
// silent. The daemon would pass on SIGUSR2 and SIGCHLD; here the test does.
class TunnelStartTest : public TunnelCycleTest {
protected:
    void SetUp() override {
        TunnelCycleTest::SetUp();
        for (const char* dir : {"/usr", "/usr/sbin", "/tmp", "/etc", "/var", "/var/log"}) {
            ASSERT_EQ(0, mkdir((root + dir).c_str(), 0755));
        }
        Write("/usr/sbin/openvpn",
              "#!/bin/sh\n"
              "root=$(cd \"$(dirname \"$0\")/../..\" && pwd)\n"
              "proto=''; prev=''\n"
              "for a do [ \"$prev\" = --proto ] && proto=$a; prev=$a; done\n"
              "echo \"$proto\" >>\"$root/var/log/openvpn.calls\"\n"
              "mode=$(cat \"$root/etc/openvpn.mode\" 2>/dev/null)\n"
              "case \"$mode\" in\n"
              "  up) printf 'peer_ip=\"10.214.0.1\"\\n' >\"$root/tmp/.zepa_farlink_tunnel_info\" ;;\n"
              "  die) exit 1 ;;\n"
              "esac\n"
              "exec sleep 30\n");
        ASSERT_EQ(0, chmod((root + "/usr/sbin/openvpn").c_str(), 0755));
        cycle.SetUpWaitMs(300);
    }

    void Write(const std::string& path, const std::string& text) {
        std::ofstream out(root + path);
        out << text;
    }
    bool Exists(const std::string& path) const { return access((root + path).c_str(), F_OK) == 0; }
    std::string Read(const std::string& path) const {
        std::ifstream in(root + path);
        std::stringstream text;
        text << in.rdbuf();
        return text.str();
    }

    void AskForTunnel() {
        Json::Value answer;
        answer["connect"] = "tunnel";
        answer["tunnel"]["relay_ip"] = "10.213.0.1";
        answer["tunnel"]["relay_user"] = "zr1";
        answer["tunnel"]["relay_pass"] = "s3cret-pass";
        cycle.OnRegistered(answer);
    }

    // Runs the loop until cond holds (checked every 20 ms, after passing on
    // what the daemon would: SIGCHLD always, SIGUSR2 once the up script's
    // file is there) or maxMs pass; whether it held.
    bool RunUntil(const std::function<bool()>& cond, int64_t maxMs) {
        bool held = false;
        const int64_t end = monotonic.NowMs() + maxMs;
        std::function<void()> tick = [&] {
            cycle.OnChildExited();
            if (Exists("/tmp/.zepa_farlink_tunnel_info") && cycle.Starting()) cycle.OnUpSignal();
            if (cond()) {
                held = true;
                loop.Stop();
            } else if (monotonic.NowMs() >= end) {
                loop.Stop();
            } else {
                loop.SetTimer("test_tick", 20, tick);
            }
        };
        loop.SetTimer("test_tick", 0, tick);
        EXPECT_TRUE(loop.Run());
        loop.CancelTimer("test_tick");
        return held;
    }

    bool Saw(TunnelOutcome::Kind kind) const {
        for (const auto& o : outcomes) {
            if (o.kind == kind) return true;
        }
        return false;
    }
    int TunnelPid() const { return cycle.Status()["tunnel"]["pid"].asInt(); }
};

TEST_F(TunnelStartTest, PeerAddressFromTheUpScriptMakesItReadyAndThePassFileGoes) {
    Write("/etc/openvpn.mode", "up");
    AskForTunnel();
    ASSERT_TRUE(RunUntil([&] { return cycle.IsUp(); }, 5000));
    EXPECT_EQ(TunnelOutcome::UP, outcomes.back().kind);
    const Json::Value status = cycle.Status();
    EXPECT_EQ("READY", status["tunnel"]["status"].asString());
    EXPECT_EQ("10.214.0.1", status["tunnel"]["peer_ip"].asString());
    EXPECT_EQ("udp\n", Read("/var/log/openvpn.calls"));
    EXPECT_FALSE(Exists("/tmp/.tunnel.zr1"));
    const int pid = TunnelPid();
    ASSERT_GT(pid, 0);
    EXPECT_EQ(0, kill(pid, 0));

    // The down script takes the peer address away while openvpn reconnects:
    // no longer READY, until the up script reports again.
    ASSERT_EQ(0, unlink((root + "/tmp/.zepa_farlink_tunnel_info").c_str()));
    ASSERT_TRUE(RunUntil([&] { return outcomes.back().kind == TunnelOutcome::LINK_LOST; }, 3000));
    EXPECT_EQ(RELAYD_ERR_NETWORK, outcomes.back().error);
    EXPECT_FALSE(cycle.IsUp());
    EXPECT_EQ("NONE", cycle.Status()["tunnel"]["status"].asString());
    Write("/tmp/.zepa_farlink_tunnel_info", "peer_ip=\"10.214.0.1\"\n");
    cycle.OnUpSignal();
    EXPECT_TRUE(cycle.IsUp());
    EXPECT_EQ(TunnelOutcome::UP, outcomes.back().kind);

    cycle.Stop(true);
    EXPECT_NE(0, kill(pid, 0));
    EXPECT_FALSE(Exists("/tmp/.zepa_farlink_tunnel_info"));
}

// openvpn exits with the tunnel up (its relay went away): torn down, then
// registered again after the close's spread wait, not the start's 2 s.
TEST_F(TunnelStartTest, ATunnelThatWasUpAndClosedRegistersAgainAfterTheSpreadWait) {
    Write("/etc/openvpn.mode", "up");
    jitter = 700;
    AskForTunnel();
    ASSERT_TRUE(RunUntil([&] { return cycle.IsUp(); }, 5000));
    const int pid = TunnelPid();
    ASSERT_GT(pid, 0);
    ASSERT_EQ(0, kill(pid, SIGTERM));
    ASSERT_TRUE(RunUntil([&] { return Saw(TunnelOutcome::FAILED); }, 3000));
    EXPECT_EQ(RELAYD_ERR_NETWORK, outcomes.back().error);
    EXPECT_EQ("CLOSE", cycle.Status()["tunnel"]["status"].asString());
    EXPECT_EQ(1, cycle.Status()["tunnel"]["failures"].asInt());
    EXPECT_FALSE(Exists("/tmp/.zepa_farlink_tunnel_info"));
    const int64_t retry = loop.TimerRemaining("tunnel_retry");
    EXPECT_GT(retry, 0);
    EXPECT_LE(retry, 700);
    EXPECT_EQ(-1, loop.TimerRemaining("heartbeat"));
    EXPECT_EQ(0, reregistrations);
    ASSERT_TRUE(RunUntil([&] { return reregistrations == 1; }, 3000));
    EXPECT_EQ(-1, loop.TimerRemaining("tunnel_retry"));
}

TEST_F(TunnelStartTest, ASecondFailedStartWaitsTwiceAsLong) {
    Write("/etc/openvpn.mode", "die");
    jitter = 700;  // 2 s plus 700 % 501 ms; then 4 s plus 700 % 1001 ms
    AskForTunnel();
    ASSERT_TRUE(RunUntil([&] { return Saw(TunnelOutcome::FAILED); }, 5000));
    EXPECT_EQ("FAILED", cycle.Status()["tunnel"]["status"].asString());
    int64_t retry = loop.TimerRemaining("tunnel_retry");
    EXPECT_GT(retry, 1000);  // not the close's 700 ms
    EXPECT_LE(retry, 2199);
    outcomes.clear();
    AskForTunnel();
    ASSERT_TRUE(RunUntil([&] { return Saw(TunnelOutcome::FAILED); }, 5000));
    EXPECT_EQ(2, cycle.Status()["tunnel"]["failures"].asInt());
    retry = loop.TimerRemaining("tunnel_retry");
    EXPECT_GT(retry, 2700);
    EXPECT_LE(retry, 4700);
}

TEST_F(TunnelStartTest, SilentChildIsNeverReadyAndIsEndedAfterTheWait) {
    Write("/etc/openvpn.mode", "silent");
    AskForTunnel();
    // The pass file exists while a start runs, and only then.
    ASSERT_TRUE(RunUntil([&] { return Exists("/tmp/.tunnel.zr1"); }, 2000));
    // An up signal without a peer address changes nothing.
    cycle.OnUpSignal();
    EXPECT_FALSE(cycle.IsUp());
    ASSERT_TRUE(RunUntil([&] { return Saw(TunnelOutcome::FAILED); }, 5000));
    EXPECT_FALSE(Saw(TunnelOutcome::UP));
    EXPECT_EQ(RELAYD_ERR_NETWORK, outcomes.back().error);
    // UDP first, then TCP, each ended when the wait ran out.
    EXPECT_EQ("udp\ntcp-client\n", Read("/var/log/openvpn.calls"));
    EXPECT_EQ("FAILED", cycle.Status()["tunnel"]["status"].asString());
    EXPECT_FALSE(Exists("/tmp/.tunnel.zr1"));
    EXPECT_GT(loop.TimerRemaining("tunnel_retry"), 0);
    ASSERT_TRUE(RunUntil([&] { return cycle.Ending() == 0; }, 4000));
    EXPECT_EQ(-1, waitpid(-1, nullptr, WNOHANG));
}

TEST_F(TunnelStartTest, ChildThatDiesFallsBackToTcpThenFails) {
    Write("/etc/openvpn.mode", "die");
    AskForTunnel();
    ASSERT_TRUE(RunUntil([&] { return Saw(TunnelOutcome::FAILED); }, 5000));
    EXPECT_EQ("udp\ntcp-client\n", Read("/var/log/openvpn.calls"));
    EXPECT_FALSE(Saw(TunnelOutcome::UP));
    EXPECT_FALSE(Exists("/tmp/.tunnel.zr1"));
}

TEST_F(TunnelStartTest, StopDuringTheStartLeavesNoChildAndNoPassFile) {
    Write("/etc/openvpn.mode", "silent");
    AskForTunnel();
    ASSERT_TRUE(RunUntil([&] { return TunnelPid() > 0 && Exists("/var/log/openvpn.calls"); }, 2000));
    const int pid = TunnelPid();
    cycle.Stop(true);
    EXPECT_NE(0, kill(pid, 0));
    EXPECT_FALSE(Exists("/tmp/.tunnel.zr1"));
    EXPECT_FALSE(cycle.HasTunnel());
    EXPECT_EQ(0u, cycle.Ending());
    EXPECT_EQ(-1, loop.TimerRemaining("tunnel_up_wait"));
}

TEST_F(TunnelStartTest, HeartbeatWithTheSameAnswerKeepsTheStartUnderWay) {
    Write("/etc/openvpn.mode", "silent");
    AskForTunnel();
    ASSERT_TRUE(RunUntil([&] { return TunnelPid() > 0; }, 2000));
    const int pid = TunnelPid();
    AskForTunnel();
    EXPECT_TRUE(cycle.Starting());
    EXPECT_EQ(pid, TunnelPid());
    EXPECT_EQ(0, kill(pid, 0));
}

}  // namespace
