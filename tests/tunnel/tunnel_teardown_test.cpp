// Watching and stopping the VPN child: liveness, the status change, teardown
// with the module unload, and the peer address published by the up script.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zepasdk/sysroot.h>

#include <fstream>

#include <zeparelayd/daemon.h>
#include <zeparelayd/tunnel.h>

#include "support/seams.h"
#include "tunnel_fixture.h"

using namespace ZEPA::Relay;
using namespace tunneltest;

namespace {

const char kUnloadList[] =
    " tun.ko ipt_MASQUERADE.ko xt_state.ko xt_tcpudp.ko xt_multiport.ko ipt_REDIRECT.ko iptable_nat.ko "
    "nf_nat.ko nf_conntrack_ipv4.ko nf_defrag_ipv4.ko nf_conntrack.ko iptable_filter.ko ip_tables.ko";

class TunnelTeardown : public TunnelTest {
protected:
    // Starts a tunnel whose child is up and waiting.
    Tunnel StartedTunnel() {
        Tunnel tunnel = MakeTunnel();
        EXPECT_TRUE(tunnel.Create(false));
        children.push_back(tunnel.pid);
        return tunnel;
    }
    // Stops the child as the daemon's SIGCHLD handling would find it: gone and reaped.
    void EndChild(int pid) {
        kill(pid, SIGKILL);
        waitpid(pid, nullptr, 0);
    }
};

TEST_F(TunnelTeardown, DestroyWithoutChildRunsNoCommand) {
    root.write("/tmp/.zepa_farlink_tunnel_info", "peer_ip=\"10.8.0.1\"\n");
    Tunnel tunnel = MakeTunnel();
    EXPECT_TRUE(tunnel.Destroy());
    EXPECT_TRUE(ShellCommands().empty());
    EXPECT_TRUE(ToolCalls().empty());
    EXPECT_TRUE(root.exists("/tmp/.zepa_farlink_tunnel_info"));
    EXPECT_EQ(-1, tunnel.pid);
}

TEST_F(TunnelTeardown, DestroyOfAChildAlreadyGoneRunsNoCommand) {
    Tunnel tunnel = StartedTunnel();
    EndChild(tunnel.pid);
    const size_t before = ShellCommands().size();
    EXPECT_TRUE(tunnel.Destroy());
    EXPECT_EQ(before, ShellCommands().size());
    EXPECT_EQ(-1, tunnel.pid);
}

TEST_F(TunnelTeardown, DestroyStopsTheChildAndUnloadsAllButTheFirstModule) {
    Tunnel tunnel = StartedTunnel();
    const int child = tunnel.pid;
    ASSERT_TRUE(root.exists("/tmp/.zepa_farlink_tunnel_info"));
    Daemon::_logLevel = 7;
    zepatest::StderrCapture capture;
    EXPECT_TRUE(tunnel.Destroy());
    const std::string log = capture.stop();

    const std::vector<std::string> commands = ShellCommands();
    ASSERT_EQ(3u, commands.size());
    EXPECT_EQ(root.path("/usr/zepa/bin/iptablestool") + " --rmmod farlink-tunnel " + kUnloadList,
              commands[1]);
    EXPECT_EQ("rm -f " + root.path("/tmp/.zepa_farlink_tunnel_info"), commands[2]);
    EXPECT_EQ(std::string::npos, commands[1].find("x_tables.ko"));
    // Both commands really ran.
    const std::vector<std::string> tool = ToolCalls();
    ASSERT_EQ(2u, tool.size());
    EXPECT_EQ("--rmmod farlink-tunnel" + std::string(kUnloadList), tool[1]);
    EXPECT_FALSE(root.exists("/tmp/.zepa_farlink_tunnel_info"));

    EXPECT_TRUE(zepatest::LogContains(log, "kill openvpn " + std::to_string(child))) << log;
    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    EXPECT_TRUE(Terminated(1));
}

TEST_F(TunnelTeardown, UnloadWalksAnyListBackwards) {
    int child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        pause();
        _exit(0);
    }
    children.push_back(child);
    Tunnel tunnel = MakeTunnel();
    tunnel.modules = "first.ko second.ko third.ko";
    tunnel.pid = child;
    EXPECT_TRUE(tunnel.Destroy());
    const std::vector<std::string> commands = ShellCommands();
    ASSERT_EQ(2u, commands.size());
    EXPECT_EQ(root.path("/usr/zepa/bin/iptablestool") + " --rmmod farlink-tunnel  third.ko second.ko",
              commands[0]);
}

TEST_F(TunnelTeardown, WithTheDefaultRootTheCommandsAreThePlainOnes) {
    // The shell is replaced by a recorder here: nothing below "/" is run.
    static std::vector<std::string> seen;
    seen.clear();
    g_tunnelShell = [](const char* command) {
        seen.push_back(command);
        return 0;
    };
    int child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        pause();
        _exit(0);
    }
    children.push_back(child);
    Tunnel tunnel = MakeTunnel();
    tunnel.pid = child;
    ZEPASysRootSet("/");
    const bool destroyed = tunnel.Destroy();
    ZEPASysRootSet(root.dir().c_str());

    EXPECT_TRUE(destroyed);
    ASSERT_EQ(2u, seen.size());
    EXPECT_EQ(std::string("/usr/zepa/bin/iptablestool --rmmod farlink-tunnel ") + kUnloadList, seen[0]);
    EXPECT_EQ("rm -f /tmp/.zepa_farlink_tunnel_info", seen[1]);
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    EXPECT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGTERM);
}

TEST_F(TunnelTeardown, DestructorLeavesTheChildRunning) {
    int child = -1;
    {
        Tunnel tunnel = StartedTunnel();
        child = tunnel.pid;
    }
    EXPECT_EQ(0, kill(child, 0));
    EXPECT_EQ(0, waitpid(child, nullptr, WNOHANG));
    EXPECT_FALSE(Terminated(1));
}

TEST_F(TunnelTeardown, IsAliveForgetsNegativeAndVanishedPids) {
    Tunnel tunnel;
    tunnel.pid = -5;
    EXPECT_FALSE(tunnel.IsAlive());
    EXPECT_EQ(-1, tunnel.pid);

    tunnel.pid = getpid();
    EXPECT_TRUE(tunnel.IsAlive());
    EXPECT_EQ(getpid(), tunnel.pid);

    int child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) _exit(0);
    waitpid(child, nullptr, 0);
    tunnel.pid = child;
    EXPECT_FALSE(tunnel.IsAlive());
    EXPECT_EQ(-1, tunnel.pid);
}

TEST_F(TunnelTeardown, ReadyTunnelWhoseChildIsGoneBecomesClosed) {
    Tunnel tunnel = StartedTunnel();
    EXPECT_FALSE(tunnel.CheckStatusChanged());
    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());

    EndChild(tunnel.pid);
    EXPECT_TRUE(tunnel.CheckStatusChanged());
    EXPECT_EQ(TUNNEL_STATUS_CLOSE, tunnel.GetStatus());
    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_FALSE(tunnel.CheckStatusChanged());
    EXPECT_EQ(TUNNEL_STATUS_CLOSE, tunnel.GetStatus());
}

TEST_F(TunnelTeardown, OnlyReadyTunnelsChangeStatus) {
    Tunnel tunnel;
    for (TUNNEL_STATUS s : {TUNNEL_STATUS_NONE, TUNNEL_STATUS_FAILED, TUNNEL_STATUS_INVALID_CONF}) {
        tunnel.status = s;
        EXPECT_FALSE(tunnel.CheckStatusChanged()) << s;
        EXPECT_EQ(s, tunnel.GetStatus());
    }
}

TEST_F(TunnelTeardown, PeerAddressComesFromTheUpScript) {
    EXPECT_EQ("", Tunnel::GetVpnTunnelPeerIp());
    Tunnel tunnel = StartedTunnel();
    EXPECT_EQ("10.8.0.1", Tunnel::GetVpnTunnelPeerIp());
    tunnel.Destroy();
    EXPECT_EQ("", Tunnel::GetVpnTunnelPeerIp());
}

TEST_F(TunnelTeardown, PeerAddressMissingKeyIsEmpty) {
    root.write("/tmp/.zepa_farlink_tunnel_info", "other=\"x\"\n");
    EXPECT_EQ("", Tunnel::GetVpnTunnelPeerIp());
}

}  // namespace
