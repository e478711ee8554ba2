// The tunnel with the real openvpn: the staged appliance's client in its own
// network namespace, the local relay's VPN servers in another, and the
// appliance's web page fetched through the relay's reverse proxy.
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <zeparelayd/tunnel.h>

#include "support/relay_harness.h"
#include "support/test_support.h"

using ZEPA::Relay::Tunnel;
using ZEPA::Relay::TUNNEL_STATUS_CLOSE;
using ZEPA::Relay::TUNNEL_STATUS_FAILED;
using ZEPA::Relay::TUNNEL_STATUS_READY;

namespace {

void SleepMs(int ms) {
    struct timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
    nanosleep(&ts, nullptr);
}

class RelayTunnelTest : public zepatest::RelayTest {
protected:
    void SetUp() override {
        RelayTest::SetUp();
        if (IsSkipped() || HasFatalFailure()) return;
        zepatest::InstallTunnelSignalHandlers();
        user = "zr" + std::to_string(getpid());
        alias = "box" + std::to_string(getpid());
    }

    void TearDown() override {
        if (tunnel.pid > 0) {
            kill(tunnel.pid, SIGTERM);
            waitpid(tunnel.pid, nullptr, 0);
        }
        RootTest::TearDown();
    }

    void Fill(const std::string& password = "") {
        Json::Value granted = relay.Grant(user, alias);
        ASSERT_TRUE(granted["relay_pass"].isString()) << zepatest::ToJson(granted);
        if (!password.empty()) granted["relay_pass"] = password;
        tunnel.Overwrite(granted);
        ASSERT_EQ(relay.relayIp, tunnel.GetHost());
    }

    std::string PassFile() const { return root.path("/tmp/.tunnel." + user); }
    std::string InfoFile() const { return root.path("/tmp/.zepa_farlink_tunnel_info"); }
    std::vector<std::string> ToolCalls() const {
        std::vector<std::string> lines;
        std::istringstream in(root.read("/var/log/iptablestool.log"));
        for (std::string line; std::getline(in, line);) lines.push_back(line);
        return lines;
    }

    // Reaps the VPN child once it has gone; true when it went within seconds.
    bool WaitChildGone(int seconds) {
        for (int i = 0; i < seconds * 50; ++i) {
            if (waitpid(tunnel.pid, nullptr, WNOHANG) == tunnel.pid) return true;
            SleepMs(20);
        }
        return false;
    }

    void ExpectPageThroughRelay() {
        std::string body;
        long status = 0;
        ASSERT_TRUE(relay.HttpsGet("/" + alias + "/", body, status)) << body;
        EXPECT_EQ(200, status) << body;
        EXPECT_NE(std::string::npos, body.find("you reached the management page")) << body;
    }

    Tunnel tunnel;
    std::string user;
    std::string alias;
};

TEST_F(RelayTunnelTest, UdpTunnelComesUpAndCarriesTheAppliancePage) {
    Fill();
    // Nothing answers for the alias before its tunnel exists.
    std::string body;
    long status = 0;
    ASSERT_TRUE(relay.HttpsGet("/" + alias + "/", body, status));
    EXPECT_EQ(502, status) << body;

    ASSERT_TRUE(tunnel.Create(true));
    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    EXPECT_GT(tunnel.pid, 0);
    EXPECT_EQ(1, zepatest::g_tunnelUsr2) << "the up script signals the waiting process";
    // The UDP server's end of the tunnel: the first address of its pool.
    EXPECT_EQ("10.214.0.1", Tunnel::GetVpnTunnelPeerIp());
    EXPECT_FALSE(zepatest::FileExists(PassFile()));
    ExpectPageThroughRelay();
    EXPECT_FALSE(tunnel.CheckStatusChanged());

    const int pid = tunnel.pid;
    EXPECT_TRUE(tunnel.Destroy());
    EXPECT_EQ(-1, tunnel.pid);
    ASSERT_EQ(pid, waitpid(pid, nullptr, 0));
    EXPECT_FALSE(zepatest::FileExists(InfoFile()));
    const std::vector<std::string> calls = ToolCalls();
    ASSERT_EQ(2u, calls.size());
    EXPECT_EQ(0u, calls[0].find("--insmod farlinka-tunnel x_tables.ko "));
    // The tool sees its arguments split by the shell (the exact line is a stand-in test's matter).
    EXPECT_EQ(0u, calls[1].find("--rmmod farlink-tunnel tun.ko ipt_MASQUERADE.ko "));
    EXPECT_EQ(std::string::npos, calls[1].find("x_tables.ko"));
}

TEST_F(RelayTunnelTest, WrongPasswordFailsAfterBothProtocols) {
    Fill("not-the-password");
    EXPECT_FALSE(tunnel.Create(true));
    EXPECT_EQ(TUNNEL_STATUS_FAILED, tunnel.GetStatus());
    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_FALSE(zepatest::FileExists(PassFile()));
    EXPECT_FALSE(zepatest::FileExists(InfoFile()));
    // One start per protocol, each loading the modules first.
    const std::vector<std::string> calls = ToolCalls();
    ASSERT_EQ(2u, calls.size());
    // Both servers refused the password; the client left after each refusal.
    const std::string udp = zepatest::ReadFile(relay.workDir + "/openvpn-udp.log");
    const std::string tcp = zepatest::ReadFile(relay.workDir + "/openvpn-tcp.log");
    EXPECT_NE(std::string::npos, udp.find("Username/Password verification failed")) << udp;
    EXPECT_NE(std::string::npos, tcp.find("Username/Password verification failed")) << tcp;
    const std::string log = root.read("/var/log/openvpn.log");
    const size_t first = log.find("AUTH_FAILED");
    ASSERT_NE(std::string::npos, first) << log;
    EXPECT_NE(std::string::npos, log.find("AUTH_FAILED", first + 1)) << log;
    EXPECT_EQ(0, zepatest::RelayHarness::CountProcesses(root.dir() + "/tmp/.tunnel."));
}

TEST_F(RelayTunnelTest, BlockedUdpFallsBackToTcp) {
    Fill();
    ASSERT_TRUE(relay.BlockUdp(true));
    ASSERT_TRUE(tunnel.Create(true));
    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    // The TCP server's end of the tunnel.
    EXPECT_EQ("10.214.1.1", Tunnel::GetVpnTunnelPeerIp());
    EXPECT_EQ(2u, ToolCalls().size()) << "a UDP start, then a TCP start";
    ExpectPageThroughRelay();
}

TEST_F(RelayTunnelTest, StoppedVpnServerClosesTheTunnelAndANewOneComesUp) {
    Fill();
    ASSERT_TRUE(tunnel.Create(true));
    ASSERT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    ASSERT_TRUE(relay.Vpn("stop"));
    ASSERT_TRUE(WaitChildGone(15)) << "the client did not leave after its server stopped";
    // Reaped: now the tunnel notices, once.
    EXPECT_TRUE(tunnel.CheckStatusChanged());
    EXPECT_EQ(TUNNEL_STATUS_CLOSE, tunnel.GetStatus());
    EXPECT_FALSE(tunnel.CheckStatusChanged());
    EXPECT_TRUE(tunnel.Destroy());
    // The down script took the published peer away.
    EXPECT_FALSE(zepatest::FileExists(InfoFile()));

    ASSERT_TRUE(relay.Vpn("start"));
    ASSERT_TRUE(tunnel.Create(true));
    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    ExpectPageThroughRelay();
}

TEST_F(RelayTunnelTest, StopLeavesNothingBehind) {
    Fill();
    ASSERT_TRUE(tunnel.Create(true));
    const int pid = tunnel.pid;
    EXPECT_EQ(1, zepatest::RelayHarness::CountProcesses(root.dir() + "/tmp/.tunnel."));
    EXPECT_TRUE(tunnel.Destroy());
    ASSERT_EQ(pid, waitpid(pid, nullptr, 0));
    EXPECT_EQ(0, relay.Stop());
    EXPECT_EQ(0, zepatest::RelayHarness::CountProcesses(root.dir() + "/tmp/.tunnel."));
    EXPECT_EQ(0, zepatest::RelayHarness::CountProcesses(relay.workDir));
    EXPECT_FALSE(zepatest::FileExists(PassFile()));
    EXPECT_FALSE(zepatest::FileExists(InfoFile()));
    EXPECT_FALSE(relay.NamespacesExist());
}

}  // namespace
