// The real daemon with the real relay: registration, then a direct
// connection or a VPN tunnel as the control server says, the appliance's page
// fetched through the relay, the tunnel's loss and return, switch-off and
// stop leaving nothing behind.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <iostream>
#include <iterator>
#include <sstream>
#include <thread>

#include <json/reader.h>

#include <zeparelayd/daemon.h>

#include "support/relay_harness.h"
#include "support/test_support.h"

namespace {

const std::string kDaemon = ZEPA_BINARY_DIR "/tools/zeparelayd/zeparelayd";
const std::string kCtl = ZEPA_BINARY_DIR "/tools/zeparelayctl/zeparelayctl";

bool WaitUntil(const std::function<bool()>& cond, int ms) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    while (std::chrono::steady_clock::now() < end) {
        if (cond()) return true;
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    return cond();
}

class RelayDaemonTest : public zepatest::RelayTest {
protected:
    void SetUp() override {
        RelayTest::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        alias = "box" + std::to_string(getpid());
        std::ostringstream conf;
        conf << "{\n"
             << "  \"server_control\": {\"protocol\": \"https\", \"host\": \"127.0.0.1\", \"port\": "
             << relay.server().httpsPort() << "},\n"
             << "  \"server_alias\": {\"alias\": \"" << alias << "\", \"url\": \""
             << relay.server().httpsUrl() << "\"},\n"
             << "  \"service\": [{\"id\": \"nos\"}],\n"
             << "  \"log_level\": 7,\n"
             << "  \"log_file\": \"/var/log/zeparelayd.log\"\n"
             << "}\n";
        root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf", conf.str());
    }

    void TearDown() override {
        const pid_t pid = DaemonPid();
        if (pid > 0 && kill(pid, 0) == 0) {
            kill(pid, SIGTERM);
            if (!WaitUntil([&] { return kill(pid, 0) != 0; }, 8000)) kill(pid, SIGKILL);
        }
        RootTest::TearDown();
    }

    int Ctl(const std::vector<std::string>& args, std::string* out = nullptr) {
        std::vector<std::string> all = {kCtl, "--root", root.dir()};
        all.insert(all.end(), args.begin(), args.end());
        return zepatest::RunProgram(all, out);
    }
    std::string CtlStatus() {
        std::string out;
        Ctl({"status"}, &out);
        return out;
    }
    bool StatusHas(const std::string& text, int ms = 20000) {
        return WaitUntil([&] { return CtlStatus().find(text) != std::string::npos; }, ms);
    }
    pid_t DaemonPid() {
        if (!root.exists("/var/run/zeparelayd.pid")) return -1;
        return atoi(root.read("/var/run/zeparelayd.pid").c_str());
    }
    // The daemon rewrites the file in place: a read that meets it half
    // written is taken as no status yet, and the polling reads again.
    Json::Value StatusFile() {
        Json::Value v(Json::objectValue);
        Json::Reader reader;
        if (!reader.parse(root.read("/tmp/.zeparelayd.status"), v, false) || !v.isObject()) {
            return Json::Value(Json::objectValue);
        }
        return v;
    }
    int State() { return StatusFile()["state"].asInt(); }
    int StartDaemon() {
        return zepatest::RunProgram({kDaemon, "--root", root.dir(), "--ca-file", relay.server().caFile()});
    }
    int VpnClients() { return zepatest::RelayHarness::CountProcesses(root.dir() + "/tmp/.tunnel."); }
    std::string Page() {
        std::string body;
        long status = 0;
        relay.HttpsGet("/" + alias + "/", body, status);
        return std::to_string(status) + " " + body;
    }
    std::string Log() { return root.read("/var/log/zeparelayd.log"); }

    std::string alias;
};

TEST_F(RelayDaemonTest, TunnelComesUpIsShownAndCarriesThePageAndComesBackAfterALoss) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("tunnel: READY")) << CtlStatus() << Log();
    const std::string status = CtlStatus();
    EXPECT_NE(std::string::npos, status.find("state: connected")) << status;
    EXPECT_NE(std::string::npos, status.find("connect: tunnel")) << status;
    EXPECT_NE(std::string::npos, status.find("peer 10.214.0.1")) << status;
    Json::Value file = StatusFile();
    EXPECT_EQ(6, file["state"].asInt());
    EXPECT_EQ("READY", file["tunnel"]["status"].asString());
    EXPECT_EQ(relay.relayIp, file["tunnel"]["relay_ip"].asString());
    EXPECT_GT(file["tunnel"]["pid"].asInt(), 0);
    EXPECT_FALSE(file["tunnel"].isMember("relay_pass"));
    const int firstPid = file["tunnel"]["pid"].asInt();
    ASSERT_TRUE(StatusHas("alias_status: good"));

    const std::string page = Page();
    EXPECT_EQ(0u, page.find("200 ")) << page;
    EXPECT_NE(std::string::npos, page.find("you reached the management page")) << page;

    // The relay's VPN servers go away: the daemon notices (SIGCHLD), reports
    // the loss and schedules its registration within five minutes (the tunnel
    // was up: a relay outage closes a whole fleet's tunnels at once). The
    // timer's own firing is tested on the cycle (tests/zeparelayd); here a
    // reload, which registers at once while not registered, brings the new
    // tunnel without the random wait.
    ASSERT_TRUE(relay.Vpn("stop"));
    ASSERT_TRUE(WaitUntil([&] { return State() == 3; }, 15000)) << CtlStatus();
    EXPECT_EQ(6, StatusFile()["error"].asInt()) << "err_network";
    EXPECT_NE(std::string::npos, Log().find("tunnel to [" + relay.relayIp + "] closed"));
    ASSERT_TRUE(WaitUntil([&] { return Log().find("tunnel retry 1 in ") != std::string::npos; }, 5000))
        << Log();
    const std::string log = Log();
    const long long retryMs = atoll(log.c_str() + log.find("tunnel retry 1 in ") + 18);
    EXPECT_GE(retryMs, 0) << log;
    EXPECT_LE(retryMs, 300000) << log;
    ASSERT_TRUE(relay.Vpn("start"));
    std::string out;
    ASSERT_EQ(0, Ctl({"reload"}, &out)) << out;
    ASSERT_TRUE(WaitUntil([&] { return State() == 6; }, 40000)) << CtlStatus() << Log();
    EXPECT_NE(firstPid, StatusFile()["tunnel"]["pid"].asInt());
    EXPECT_NE(std::string::npos, Log().find("reload: not registered: registering again")) << Log();
    EXPECT_EQ(0u, Page().find("200 "));

    // Stop: no VPN client, pass file or tunnel info file stays behind.
    EXPECT_EQ(0, Ctl({"stop"}, &out)) << out;
    EXPECT_EQ(0, VpnClients());
    EXPECT_FALSE(root.exists("/tmp/.zepa_farlink_tunnel_info"));
    EXPECT_EQ(8, State());
    for (const std::string& name : {std::string("/tmp")}) {
        const std::string listing = zepatest::ListDir(root.path(name));
        EXPECT_EQ(std::string::npos, listing.find(".tunnel.")) << listing;
    }
    EXPECT_EQ(0, relay.Stop());
    EXPECT_FALSE(relay.NamespacesExist());
}

TEST_F(RelayDaemonTest, ReachableApplianceConnectsDirectly) {
    Json::Value body;
    body["serial"] = "2150ZSN012345";
    body["reachable"] = true;
    ASSERT_TRUE(relay.Admin("POST", "/relay/admin/reachable", body)["ok"].asBool());
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("state: direct_connect")) << CtlStatus() << Log();
    EXPECT_NE(std::string::npos, CtlStatus().find("connect: direct"));
    EXPECT_EQ(4, State());
    EXPECT_FALSE(StatusFile().isMember("tunnel"));
    EXPECT_EQ(0, VpnClients());
    EXPECT_TRUE(StatusHas("alias_status: good"));
}

TEST_F(RelayDaemonTest, HeartbeatKeepsTheTunnelAndSwitchOffTearsItDown) {
    Json::Value beat;
    beat["seconds"] = 1;
    ASSERT_TRUE(relay.Admin("POST", "/relay/admin/heartbeat", beat)["ok"].asBool());
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("tunnel: READY")) << CtlStatus() << Log();
    const int pid = StatusFile()["tunnel"]["pid"].asInt();
    ASSERT_TRUE(StatusHas("alias_status: good"));
    // Registrations go on while the tunnel stays the same.
    ASSERT_TRUE(WaitUntil([&] { return relay.server().requests("/Serv.php").size() >= 3; }, 15000));
    EXPECT_EQ(6, State());
    EXPECT_EQ(pid, StatusFile()["tunnel"]["pid"].asInt());
    EXPECT_EQ(1, VpnClients());
    // The dump shows the tunnel, the password appears nowhere.
    Json::Value dump;
    int ret = ZEPA::Relay::Daemon::DebugStatus(dump);
    for (int i = 0; ret == 11 && i < 20; ++i) ret = ZEPA::Relay::Daemon::DebugStatus(dump);
    ASSERT_EQ(0, ret);
    EXPECT_EQ("READY", dump["connection"]["tunnel"]["status"].asString()) << zepatest::ToJson(dump);
    EXPECT_EQ("10.214.0.1", dump["connection"]["tunnel"]["peer_ip"].asString());
    EXPECT_EQ(1, dump["connection"]["heartbeat_s"].asInt());
    for (const std::string& text : {zepatest::ToJson(dump), root.read("/tmp/.zeparelayd.status"), Log()}) {
        EXPECT_EQ(std::string::npos, text.find("relay_pass")) << text;
    }

    std::string out;
    ASSERT_EQ(0, Ctl({"disable"}, &out)) << out;
    ASSERT_TRUE(StatusHas("state: logout")) << CtlStatus();
    EXPECT_FALSE(StatusFile().isMember("tunnel"));
    EXPECT_TRUE(WaitUntil([&] { return VpnClients() == 0; }, 5000));
    // The alias was deleted: the relay no longer knows where it leads.
    ASSERT_TRUE(WaitUntil(
        [&] {
            for (const Json::Value& r : relay.server().requests("/alias_update.php")) {
                if (zepatest::RecordedBody(r).find("action=delete_alias") != std::string::npos) return true;
            }
            return false;
        },
        10000));
    EXPECT_EQ(0u, Page().find("404 ")) << Page();
}

}  // namespace

namespace {

TEST_F(RelayDaemonTest, RefusedTunnelIsAnErrorAndIsRetriedAfterABackOff) {
    Json::Value on;
    on["on"] = true;
    ASSERT_TRUE(relay.Admin("POST", "/relay/admin/refuse", on)["ok"].asBool());
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(WaitUntil([&] { return StatusFile()["tunnel"]["status"].asString() == "FAILED"; }, 20000))
        << CtlStatus() << Log();
    EXPECT_EQ(3, State());
    EXPECT_EQ(6, StatusFile()["error"].asInt()) << "err_network";
    EXPECT_EQ(0, VpnClients());
    EXPECT_FALSE(root.exists("/tmp/.zepa_farlink_tunnel_info"));
    EXPECT_NE(std::string::npos, Log().find("tunnel retry 1 in ")) << Log();

    on["on"] = false;
    ASSERT_TRUE(relay.Admin("POST", "/relay/admin/refuse", on)["ok"].asBool());
    ASSERT_TRUE(WaitUntil([&] { return State() == 6; }, 30000)) << CtlStatus() << Log();
    EXPECT_EQ(0, StatusFile()["error"].asInt());
    EXPECT_EQ(0u, Page().find("200 "));
}

}  // namespace

namespace {

// Milliseconds from now until cond holds, -1 when it did not within maxMs.
int64_t MsUntil(const std::function<bool()>& cond, int maxMs) {
    const auto start = std::chrono::steady_clock::now();
    const auto end = start + std::chrono::milliseconds(maxMs);
    for (;;) {
        if (cond()) {
            return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() -
                                                                         start)
                .count();
        }
        if (std::chrono::steady_clock::now() >= end) return -1;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
}

size_t Count(const std::string& text, const std::string& needle) {
    size_t n = 0;
    for (size_t at = text.find(needle); at != std::string::npos; at = text.find(needle, at + 1)) ++n;
    return n;
}

TEST_F(RelayDaemonTest, SilentRelayEveryCommandIsAnsweredDuringTheStartAndStopLeavesNothing) {
    ASSERT_TRUE(relay.Silence(true));
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(WaitUntil([&] { return StatusFile()["tunnel"].isMember("starting"); }, 15000))
        << CtlStatus() << Log();
    const std::string user = StatusFile()["tunnel"]["relay_user"].asString();
    ASSERT_FALSE(user.empty());
    EXPECT_TRUE(root.exists("/tmp/.tunnel." + user));

    for (int round = 0; round < 3; ++round) {
        // The debug dump answers at once.
        std::string out;
        EXPECT_EQ(0, Ctl({"status", "--debug"}, &out)) << out;
        EXPECT_NE(std::string::npos, out.find("\"starting\"")) << out;
        // The alias exchange starts within a second.
        const size_t aliasBefore = relay.server().requests("/alias_update.php").size();
        ASSERT_EQ(0, Ctl({"update-alias"}, &out)) << out;
        EXPECT_GE(
            MsUntil([&] { return relay.server().requests("/alias_update.php").size() > aliasBefore; }, 1000),
            0)
            << "update-alias not started within 1 s";
        // A reload is applied within a second; with nothing changed the
        // start under way goes on.
        const int vpnPid = StatusFile()["tunnel"]["pid"].asInt();
        const size_t reloadsBefore = Count(Log(), "reload: nothing changed");
        ASSERT_EQ(0, Ctl({"reload"}, &out)) << out;
        EXPECT_GE(MsUntil([&] { return Count(Log(), "reload: nothing changed") > reloadsBefore; }, 1000), 0)
            << "reload not applied within 1 s";
        ASSERT_TRUE(WaitUntil([&] { return StatusFile()["tunnel"].isMember("starting"); }, 5000))
            << CtlStatus();
        if (vpnPid > 0 && StatusFile()["tunnel"]["starting"].asString() == "udp") {
            EXPECT_EQ(vpnPid, StatusFile()["tunnel"]["pid"].asInt());
        }
        // No READY without a peer address.
        EXPECT_NE(6, State());
        EXPECT_NE("READY", StatusFile()["tunnel"]["status"].asString());
        std::this_thread::sleep_for(std::chrono::milliseconds(500));
    }
    EXPECT_EQ(std::string::npos, CtlStatus().find("READY")) << CtlStatus();
    EXPECT_EQ(std::string::npos, Log().find("tunnel up")) << Log();

    // Stop during the start: no openvpn, pass file or tunnel info file stays.
    std::string out;
    EXPECT_EQ(0, Ctl({"stop"}, &out)) << out;
    EXPECT_EQ(0, VpnClients());
    EXPECT_FALSE(root.exists("/tmp/.tunnel." + user));
    EXPECT_FALSE(root.exists("/tmp/.zepa_farlink_tunnel_info"));
    EXPECT_EQ(8, State());
}

}  // namespace

namespace {

TEST_F(RelayDaemonTest, KillNineWithTheTunnelUpThenStartEndsTheOldOpenvpnAndComesBack) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("tunnel: READY")) << CtlStatus() << Log();
    const pid_t daemon = DaemonPid();
    const int oldVpn = StatusFile()["tunnel"]["pid"].asInt();
    ASSERT_GT(oldVpn, 0);
    ASSERT_EQ(0, kill(daemon, SIGKILL));
    ASSERT_TRUE(WaitUntil([&] { return kill(daemon, 0) != 0; }, 5000));
    // Left behind: the openvpn, still connected, and a status saying READY.
    ASSERT_EQ(1, VpnClients());
    ASSERT_EQ(6, State());

    const auto start = std::chrono::steady_clock::now();
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(WaitUntil([&] { return State() == 6 && StatusFile()["pid"].asInt() != daemon; }, 20000))
        << CtlStatus() << Log();
    ASSERT_TRUE(WaitUntil([&] { return Page().find("200 ") == 0; }, 10000)) << Page();
    const auto ms =
        std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start)
            .count();
    std::cout << "kill -9 with the tunnel up: READY and the page " << ms << " ms after the start\n";
    EXPECT_EQ(1, VpnClients());
    EXPECT_NE(oldVpn, StatusFile()["tunnel"]["pid"].asInt());
    // The old openvpn is gone (its number may have been reused by now).
    std::ifstream oldCommand("/proc/" + std::to_string(oldVpn) + "/cmdline", std::ios::binary);
    const std::string oldLine((std::istreambuf_iterator<char>(oldCommand)), std::istreambuf_iterator<char>());
    EXPECT_EQ(std::string::npos, oldLine.find(root.dir())) << oldLine;
    EXPECT_NE(std::string::npos,
              Log().find("ending openvpn " + std::to_string(oldVpn) + " left by an earlier run"))
        << Log();
    const std::string listing = zepatest::ListDir(root.path("/tmp"));
    EXPECT_EQ(std::string::npos, listing.find(".tunnel.")) << listing;
}

TEST_F(RelayDaemonTest, KillNineDuringTheStartLeavesNothingAfterTheNextStart) {
    ASSERT_TRUE(relay.Silence(true));
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(WaitUntil([&] { return StatusFile()["tunnel"]["pid"].asInt() > 0; }, 15000)) << CtlStatus();
    const std::string user = StatusFile()["tunnel"]["relay_user"].asString();
    ASSERT_TRUE(root.exists("/tmp/.tunnel." + user));
    const pid_t daemon = DaemonPid();
    ASSERT_EQ(0, kill(daemon, SIGKILL));
    ASSERT_TRUE(WaitUntil([&] { return kill(daemon, 0) != 0; }, 5000));
    ASSERT_TRUE(relay.Silence(false));

    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(WaitUntil([&] { return State() == 6 && StatusFile()["pid"].asInt() != daemon; }, 30000))
        << CtlStatus() << Log();
    EXPECT_EQ(1, VpnClients());
    EXPECT_FALSE(root.exists("/tmp/.tunnel." + user));
    EXPECT_NE(std::string::npos, Log().find("left by an earlier run")) << Log();
}

}  // namespace

namespace {

TEST_F(RelayDaemonTest, ReloadWithNothingChangedKeepsTheTunnelRegistrationAndAlias) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("tunnel: READY")) << CtlStatus() << Log();
    ASSERT_TRUE(StatusHas("alias_status: good")) << CtlStatus();
    const int vpnPid = StatusFile()["tunnel"]["pid"].asInt();
    const size_t registrations = relay.server().requests("/Serv.php").size();
    const size_t aliasUpdates = relay.server().requests("/alias_update.php").size();

    std::string out;
    ASSERT_EQ(0, Ctl({"reload"}, &out)) << out;
    ASSERT_TRUE(WaitUntil([&] { return Log().find("reload: nothing changed") != std::string::npos; }, 5000))
        << Log();
    // The page stays reachable all the while.
    for (int i = 0; i < 5; ++i) {
        EXPECT_EQ(0u, Page().find("200 "));
        std::this_thread::sleep_for(std::chrono::milliseconds(200));
    }
    EXPECT_EQ(6, State());
    EXPECT_EQ(vpnPid, StatusFile()["tunnel"]["pid"].asInt());
    EXPECT_EQ(registrations, relay.server().requests("/Serv.php").size());
    EXPECT_EQ(aliasUpdates, relay.server().requests("/alias_update.php").size());
    EXPECT_EQ(1, VpnClients());
}

}  // namespace

namespace {

double SecondsSince(std::chrono::steady_clock::time_point from) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - from).count();
}

// The link between appliance and relay is cut for 30 s while the tunnel is
// up, at the relay's end (the appliance keeps its route and loses its
// carrier, as with a pulled cable), then for 5 s at the appliance's end (its
// route goes): each time the status leaves READY while the link is cut and
// is READY again, with the page reachable through the tunnel, once it is
// back.
TEST_F(RelayDaemonTest, LinkDownForThirtySecondsShowsAsNotReadyAndComesBack) {
    ASSERT_EQ(0, StartDaemon());
    ASSERT_TRUE(StatusHas("tunnel: READY")) << CtlStatus() << Log();
    ASSERT_TRUE(WaitUntil([&] { return Page().find("200 ") == 0; }, 10000)) << Page();
    const int firstVpn = StatusFile()["tunnel"]["pid"].asInt();
    ASSERT_GT(firstVpn, 0);

    // "state error tunnel-status" as the status file says it.
    auto describe = [](const Json::Value& f) {
        return std::to_string(f["state"].asInt()) + " " + std::to_string(f["error"].asInt()) + " " +
               f["tunnel"]["status"].asString();
    };
    auto ready = [](const Json::Value& f) {
        return f["state"].asInt() == 6 && f["tunnel"]["status"].asString() == "READY" &&
               !f["tunnel"]["peer_ip"].asString().empty();
    };

    for (const bool atRelay : {true, false}) {
        const int seconds = atRelay ? 30 : 5;
        const std::string cut =
            std::string(atRelay ? "relay" : "appliance") + " end down " + std::to_string(seconds) + " s";
        const int vpnBefore = StatusFile()["tunnel"]["pid"].asInt();
        ASSERT_TRUE(relay.Link(false, atRelay));
        const auto down = std::chrono::steady_clock::now();
        double leftReadyAfter = -1;
        bool readyAgainWhileDown = false;
        std::string seen;  // each change of the status while the link is cut
        std::string last;
        while (SecondsSince(down) < seconds) {
            const Json::Value f = StatusFile();
            if (f.isMember("state")) {
                const std::string now = describe(f);
                if (now != last)
                    seen += "\n  " + std::to_string(SecondsSince(down)).substr(0, 5) + " s: " + now;
                last = now;
                if (!ready(f) && leftReadyAfter < 0) {
                    leftReadyAfter = SecondsSince(down);
                    EXPECT_NE(6, f["state"].asInt()) << now;
                    EXPECT_EQ(6, f["error"].asInt()) << "err_network: " << now;
                }
                if (ready(f) && leftReadyAfter >= 0) readyAgainWhileDown = true;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
        ASSERT_TRUE(relay.Link(true, atRelay));
        const auto up = std::chrono::steady_clock::now();
        std::cout << cut << "; the status while it was cut:" << seen << "\n";
        EXPECT_GE(leftReadyAfter, 0) << cut << ": still READY all along" << Log();
        EXPECT_FALSE(readyAgainWhileDown) << cut << seen;

        double readyAfter = -1;
        double pageAfter = -1;
        while (SecondsSince(up) < 150 && pageAfter < 0) {
            if (readyAfter < 0 && ready(StatusFile())) readyAfter = SecondsSince(up);
            if (readyAfter >= 0 && Page().find("200 ") == 0) pageAfter = SecondsSince(up);
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
        const int vpnAfter = StatusFile()["tunnel"]["pid"].asInt();
        std::cout << cut << ": not READY " << leftReadyAfter << " s after the cut; READY again " << readyAfter
                  << " s and the page " << pageAfter << " s after the return; openvpn "
                  << (vpnAfter == vpnBefore ? "rode the outage out (same pid)"
                                            : "was replaced (pid " + std::to_string(vpnBefore) + " -> " +
                                                  std::to_string(vpnAfter) + ")")
                  << "\n";
        ASSERT_GE(readyAfter, 0) << cut << CtlStatus() << Log();
        ASSERT_GE(pageAfter, 0) << cut << Page();
        EXPECT_EQ(1, VpnClients());
    }
    EXPECT_NE(std::string::npos, Log().find("lost its link: no way to the relay")) << Log();
    EXPECT_NE(std::string::npos, Log().find("is back")) << Log();
}

}  // namespace
