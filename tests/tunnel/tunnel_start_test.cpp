// Starting the VPN child: protocols and fall-back, the exact command line, the
// pass file's life, the wait and its three ends (signal, death, time-out).
#include <signal.h>
#include <unistd.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/tunnel.h>

#include "support/seams.h"
#include "tunnel_fixture.h"

using namespace ZEPA::Relay;
using namespace tunneltest;

namespace {

std::vector<std::string> ExpectedArgv(const zepatest::TempRoot& root, const std::string& protoWord) {
    return {"openvpn",
            "--client",
            "--mute-replay-warnings",
            "--auth-nocache",
            "--nobind",
            "--tun-mtu",
            "1400",
            "--ping-exit",
            "10",
            "--connect-retry-max",
            "3",
            "--proto",
            protoWord,
            "--remote",
            "192.0.2.10",
            "--port",
            "443",
            "--dev",
            "tun1000",
            "--ca",
            root.path("/usr/zepa/etc/zeparelayd/ca/ca.crt"),
            "--script-security",
            "2",
            "--auth-user-pass",
            root.path("/tmp/.tunnel.relayuser"),
            "--remap-usr1",
            "SIGTERM",
            "--cipher",
            "none",
            "--comp-lzo",
            "adaptive",
            "--reneg-sec",
            "0",
            "--verb",
            "0",
            "--route-up",
            root.path("/usr/zepa/etc.defaults/zeparelayd/scripts/up.sh") + " " + std::to_string(getpid()),
            "--down",
            root.path("/usr/zepa/etc.defaults/zeparelayd/scripts/down.sh"),
            "--zepa-no-verify"};
}

const char kModules[] =
    "x_tables.ko ip_tables.ko iptable_filter.ko nf_conntrack.ko nf_defrag_ipv4.ko nf_conntrack_ipv4.ko "
    "nf_nat.ko iptable_nat.ko ipt_REDIRECT.ko xt_multiport.ko xt_tcpudp.ko xt_state.ko ipt_MASQUERADE.ko "
    "tun.ko";

class TunnelStart : public TunnelTest {};

TEST_F(TunnelStart, UdpComesUpFirstTime) {
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(true));
    children.push_back(tunnel.pid);

    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    EXPECT_GT(tunnel.pid, 0);
    EXPECT_TRUE(tunnel.IsAlive());
    EXPECT_EQ(ExpectedArgv(root, "udp"), Argv(1));
    EXPECT_FALSE(Called(2));
    // Woken by the up script, not by the time-out.
    EXPECT_EQ(1, g_sigusr2);
    EXPECT_EQ(0, g_sigalrm);
}

TEST_F(TunnelStart, StartedTunnelWritesItsStateAndPid) {
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(true));
    children.push_back(tunnel.pid);
    Json::Value out;
    tunnel.Write(out, true);
    EXPECT_EQ("READY", out["status"].asString());
    EXPECT_EQ(tunnel.pid, out["pid"].asInt());
    EXPECT_FALSE(out.isMember("relay_pass"));
}

TEST_F(TunnelStart, UdpFailureFallsBackToTcp) {
    SetBehaviour("udp", "exit");
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(true));
    children.push_back(tunnel.pid);

    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    EXPECT_EQ(ExpectedArgv(root, "udp"), Argv(1));
    EXPECT_EQ(ExpectedArgv(root, "tcp-client"), Argv(2));
    EXPECT_FALSE(Called(3));
    EXPECT_TRUE(tunnel.IsAlive());
}

TEST_F(TunnelStart, WithoutUdpOnlyTcpIsTried) {
    SetBehaviour("udp", "up");
    SetBehaviour("tcp-client", "up");
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(false));
    children.push_back(tunnel.pid);

    EXPECT_EQ(ExpectedArgv(root, "tcp-client"), Argv(1));
    EXPECT_FALSE(Called(2));
    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
}

TEST_F(TunnelStart, BothProtocolsFailing) {
    SetBehaviour("udp", "exit");
    SetBehaviour("tcp-client", "exit");
    Tunnel tunnel = MakeTunnel();
    EXPECT_FALSE(tunnel.Create(true));

    EXPECT_EQ(TUNNEL_STATUS_FAILED, tunnel.GetStatus());
    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_TRUE(Called(1));
    EXPECT_TRUE(Called(2));
    EXPECT_FALSE(Called(3));
    EXPECT_EQ(0, g_sigalrm);
}

TEST_F(TunnelStart, ChildDyingDuringTheWaitFailsTheAttempt) {
    SetBehaviour("tcp-client", "late-exit");
    Tunnel tunnel = MakeTunnel();
    EXPECT_FALSE(tunnel.RunVPNTunnel("tcp"));

    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_EQ(TUNNEL_STATUS_NONE, tunnel.GetStatus());
    EXPECT_EQ(1, g_sigchld);
    EXPECT_EQ(0, g_sigalrm);
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelStart, ChildDyingBeforeTheWaitBeginsIsNotMissed) {
    SetBehaviour("tcp-client", "exit");
    Tunnel tunnel = MakeTunnel();
    EXPECT_FALSE(tunnel.RunVPNTunnel("tcp"));
    // The death ended the wait; the alarm never rang.
    EXPECT_EQ(0, g_sigalrm);
    EXPECT_EQ(-1, tunnel.pid);
}

TEST_F(TunnelStart, DeathOfAnotherChildDoesNotEndTheWait) {
    int other = fork();
    ASSERT_GE(other, 0);
    if (other == 0) {
        pause();
        _exit(0);
    }
    children.push_back(other);
    root.write("/standin/victim", std::to_string(other));
    SetBehaviour("tcp-client", "kill-up");
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(false));
    children.push_back(tunnel.pid);

    // The wait went on past the other child's end until the up script's signal.
    EXPECT_EQ(1, g_sigchld);
    EXPECT_EQ(1, g_sigusr2);
    EXPECT_EQ(0, g_sigalrm);
    EXPECT_NE(other, tunnel.pid);
}

TEST_F(TunnelStart, SilentLiveChildCountsAsUpAfterTheWait) {
    SetTunnelWaitSeconds(1);
    SetBehaviour("udp", "hang");
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(true));
    children.push_back(tunnel.pid);

    EXPECT_EQ(1, g_sigalrm);
    EXPECT_EQ(0, g_sigusr2);
    EXPECT_EQ(TUNNEL_STATUS_READY, tunnel.GetStatus());
    EXPECT_FALSE(Called(2));
    EXPECT_TRUE(tunnel.IsAlive());
}

TEST(TunnelWait, DefaultsToFortySeconds) { EXPECT_EQ(40u, GetTunnelWaitSeconds()); }

TEST_F(TunnelStart, AlarmIsCancelledAndSignalMaskRestored) {
    sigset_t before;
    sigprocmask(SIG_BLOCK, nullptr, &before);
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.RunVPNTunnel("udp"));
    children.push_back(tunnel.pid);

    EXPECT_EQ(0u, alarm(0));
    sigset_t after;
    sigprocmask(SIG_BLOCK, nullptr, &after);
    for (int sig = 1; sig < NSIG; ++sig)
        EXPECT_EQ(sigismember(&before, sig), sigismember(&after, sig)) << sig;
}

TEST_F(TunnelStart, ChildStartsWithNoSignalBlocked) {
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(false));
    children.push_back(tunnel.pid);
    EXPECT_EQ("", BlockedSignals(1));
}

TEST_F(TunnelStart, PassFileExistsOnlyDuringTheAttempt) {
    SetBehaviour("udp", "exit");
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(true));
    children.push_back(tunnel.pid);

    // Both attempts saw the file with the credentials, mode 0600.
    for (int call : {1, 2}) {
        EXPECT_EQ("600", PassMode(call)) << call;
        EXPECT_EQ("relayuser\ns3cret-pass", PassContent(call)) << call;
    }
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelStart, PassFileGoneAfterFailedAttempts) {
    SetBehaviour("udp", "exit");
    SetBehaviour("tcp-client", "late-exit");
    Tunnel tunnel = MakeTunnel();
    EXPECT_FALSE(tunnel.Create(true));
    EXPECT_EQ("relayuser\ns3cret-pass", PassContent(2));
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelStart, PassFileGoneAfterTimedOutAttempt) {
    SetTunnelWaitSeconds(1);
    SetBehaviour("tcp-client", "hang");
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.RunVPNTunnel("tcp"));
    children.push_back(tunnel.pid);
    // The child may still be starting on a busy machine: only the clean-up is asserted.
    EXPECT_EQ(1, g_sigalrm);
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelStart, LeftoverWideOpenPassFileIsNarrowedAndTruncated) {
    root.write("/tmp/.tunnel.relayuser", "old content that is much longer than the new one\n", 0666);
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(false));
    children.push_back(tunnel.pid);
    EXPECT_EQ("600", PassMode(1));
    EXPECT_EQ("relayuser\ns3cret-pass", PassContent(1));
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelStart, ModulesAreLoadedBeforeTheVpnProgramStarts) {
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(false));
    children.push_back(tunnel.pid);

    const std::vector<std::string> commands = ShellCommands();
    ASSERT_EQ(1u, commands.size());
    EXPECT_EQ(root.path("/usr/zepa/bin/iptablestool") + " --insmod farlinka-tunnel " + kModules, commands[0]);
    // The tool really ran through the shell, and before the VPN program.
    EXPECT_EQ("--insmod farlinka-tunnel " + std::string(kModules) + "\n", ToolLogAtStart(1));
}

TEST_F(TunnelStart, EachAttemptLoadsTheModules) {
    SetBehaviour("udp", "exit");
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.Create(true));
    children.push_back(tunnel.pid);
    EXPECT_EQ(2u, ToolCalls().size());
}

TEST_F(TunnelStart, MissingVpnProgramFailsWithTheChildsMessage) {
    RemoveVpnProgram();
    Tunnel tunnel = MakeTunnel();
    zepatest::StderrCapture capture;
    EXPECT_FALSE(tunnel.Create(true));
    const std::string log = capture.stop();

    EXPECT_EQ(TUNNEL_STATUS_FAILED, tunnel.GetStatus());
    EXPECT_TRUE(zepatest::LogContains(log, "execl openvpn failed, No such file or directory")) << log;
    EXPECT_TRUE(zepatest::LogContains(log, "tunnel:")) << log;
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelStart, UnwritablePassFileStartsNothing) {
    // No /tmp below the root: the pass file cannot be created.
    unlink(root.path("/tmp").c_str());
    rmdir(root.path("/tmp").c_str());
    Tunnel tunnel = MakeTunnel();
    zepatest::StderrCapture capture;
    EXPECT_FALSE(tunnel.RunVPNTunnel("udp"));
    const std::string log = capture.stop();

    EXPECT_TRUE(zepatest::LogContains(log, "open [" + PassPath() + "] failed, No such file or directory"))
        << log;
    EXPECT_FALSE(Called(1));
    EXPECT_TRUE(ShellCommands().empty());
    EXPECT_EQ(-1, tunnel.pid);
}

TEST_F(TunnelStart, PasswordNeverReachesTheLog) {
    Daemon::_logLevel = 7;
    SetBehaviour("udp", "exit");
    Tunnel tunnel = MakeTunnel();
    zepatest::StderrCapture capture;
    ASSERT_TRUE(tunnel.Create(true));
    children.push_back(tunnel.pid);
    tunnel.Destroy();
    RemoveVpnProgram();
    tunnel.Create(false);
    const std::string log = capture.stop();

    EXPECT_TRUE(zepatest::LogContains(log, "kill openvpn")) << log;
    EXPECT_TRUE(zepatest::LogContains(log, "execl openvpn failed")) << log;
    EXPECT_EQ(std::string::npos, log.find("s3cret-pass")) << log;
}

}  // namespace
