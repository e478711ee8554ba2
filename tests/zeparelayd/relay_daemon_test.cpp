// RelayDaemon on a clock the test moves by hand, against the local server:
// the cycles' outcomes become the state, the error and the times of the
// status file, and the retries the daemon shows are the loop's timers.
#include <gtest/gtest.h>
#include <signal.h>
#include <time.h>

#include <memory>
#include <string>

#include <zeparelayd/errors.h>

#include "cycle_fixture.h"
#include "relay_daemon.h"

using namespace ZEPA::Relay;
using zeparelayd::RelayDaemon;

namespace {

const char PAGE[] = "/Serv.php";

class RelayDaemonCoreTest : public zepatest::CycleTest {
protected:
    void Start(const Json::Value& conf) {
        WriteConfig(conf);
        daemon.reset(new RelayDaemon(Daemon::GetConfPath(), loop, clock, random.Source()));
        loop.OnIdle([this] { daemon->Idle(); });
        ASSERT_TRUE(daemon->Start());
    }
    void Start() { Start(Config()); }

    void TearDown() override {
        if (daemon) daemon->Shutdown();
        loop.OnIdle(nullptr);
        daemon.reset();
        CycleTest::TearDown();
    }

    Json::Value Status() const { return ReadJson(Daemon::GetStatusPath()); }
    bool StatusSays(int state, int error) {
        return Pump([&] {
            const Json::Value s = Status();
            return s["state"].asInt() == state && s["error"].asInt() == error;
        });
    }

    std::unique_ptr<RelayDaemon> daemon;
};

TEST_F(RelayDaemonCoreTest, RegistrationAndAliasOutcomesReachTheStatusFile) {
    Start();
    ASSERT_TRUE(StatusSays(RELAYD_STATE_CONNECTED, RELAYD_SUCCESS)) << Status().toStyledString();
    ASSERT_TRUE(Pump([&] { return Status()["alias_status"].asString() == "good"; }))
        << Status().toStyledString();
    const Json::Value status = Status();
    EXPECT_FALSE(status["serverID"].asString().empty());
    EXPECT_TRUE(status["registration_retry_at"].isNull());
    // The keep-alive is planned: 10 to 20 minutes from now.
    const int64_t now = time(nullptr);
    EXPECT_GE(status["alias_retry_at"].asInt64(), now + 600 - 2);
    EXPECT_LE(status["alias_retry_at"].asInt64(), now + 1200 + 2);
}

TEST_F(RelayDaemonCoreTest, FailedRegistrationIsLoginWithItsErrorAndTheRetryTime) {
    ASSERT_TRUE(server.script(PAGE, 503, "busy"));
    Start();
    ASSERT_TRUE(Pump([&] {
        const Json::Value s = Status();
        return s["state"].asInt() == RELAYD_STATE_LOGIN && s["error"].asInt() != RELAYD_SUCCESS;
    })) << Status().toStyledString();
    const int64_t now = time(nullptr);
    const Json::Value status = Status();
    EXPECT_GE(status["registration_retry_at"].asInt64(), now + 285 - 2);
    EXPECT_LE(status["registration_retry_at"].asInt64(), now + 285 + 2);
    EXPECT_EQ("", status["alias_status"].asString());
    EXPECT_EQ(0u, server.requests("/alias_update.php").size());

    // The retry is the loop's: moving the clock to it registers.
    AdvanceAndRun(285000);
    ASSERT_TRUE(StatusSays(RELAYD_STATE_CONNECTED, RELAYD_SUCCESS)) << Status().toStyledString();
    EXPECT_EQ(2u, server.requests(PAGE).size());
}

TEST_F(RelayDaemonCoreTest, RefusalThatOnlyAReloadCuresPlansNothing) {
    ASSERT_TRUE(server.script(PAGE, 200, "{\"errno\": 2}"));
    Start();
    ASSERT_TRUE(StatusSays(RELAYD_STATE_LOGIN, RELAYD_ERR_AUTH)) << Status().toStyledString();
    EXPECT_TRUE(Status()["registration_retry_at"].isNull());
    AdvanceAndRun(3600000);
    Settle(100);
    EXPECT_EQ(1u, server.requests(PAGE).size());
}

TEST_F(RelayDaemonCoreTest, DirectAnswerIsStateFour) {
    Start();
    ASSERT_TRUE(StatusSays(RELAYD_STATE_CONNECTED, RELAYD_SUCCESS));
    const std::string serial = zepatest::RecordedBody(server.requests(PAGE)[0u]);
    Json::Value body;
    ASSERT_TRUE(Json::Reader().parse(serial, body));
    Json::Value reachable;
    reachable["serial"] = body["identity"]["serial"];
    reachable["reachable"] = true;
    ASSERT_EQ(200, Post("/relay/admin/reachable", reachable));
    // A reload that changes the services registers again.
    Json::Value conf = Config();
    conf["service"][1u]["id"] = "nso_https";
    WriteConfig(conf);
    daemon->HandleSignal(SIGHUP);
    ASSERT_TRUE(StatusSays(RELAYD_STATE_DIRECT_CONNECT, RELAYD_SUCCESS)) << Status().toStyledString();
    EXPECT_EQ("direct", Status()["connect"].asString());
    // The answer carries a heartbeat: the tunnel cycle's timer, followed
    // without a change of state.
    const size_t before = server.requests(PAGE).size();
    AdvanceAndRun(3600000);
    // The status of the round in which the heartbeat went out.
    loop.RunOnce(0);
    EXPECT_EQ(RELAYD_STATE_DIRECT_CONNECT, Status()["state"].asInt());
    ASSERT_TRUE(Pump([&] { return server.requests(PAGE).size() > before; }));
    ASSERT_TRUE(StatusSays(RELAYD_STATE_DIRECT_CONNECT, RELAYD_SUCCESS));
}

TEST_F(RelayDaemonCoreTest, SwitchedOffIsLogout) {
    const std::string info = root + "/etc/zepainfo.conf";
    const std::string cmd = "sed -i 's/^runrelayd=.*/runrelayd=\"no\"/' '" + info + "'";
    ASSERT_EQ(0, system(cmd.c_str()));
    Start();
    ASSERT_TRUE(StatusSays(RELAYD_STATE_LOGOUT, RELAYD_SUCCESS)) << Status().toStyledString();
    EXPECT_EQ(0u, server.requests(PAGE).size());
}

}  // namespace
