#include "tunnel_fixture.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <sstream>

#include "support/seams.h"

using ZEPA::Relay::Tunnel;

namespace tunneltest {

volatile sig_atomic_t g_sigchld = 0;
volatile sig_atomic_t g_sigusr2 = 0;
volatile sig_atomic_t g_sigalrm = 0;

namespace {

std::string g_shellLog;

void OnSignal(int sig) {
    if (sig == SIGCHLD) g_sigchld = 1;
    if (sig == SIGUSR2) g_sigusr2 = 1;
    if (sig == SIGALRM) g_sigalrm = 1;
}

// Records the exact command line (also from the forked child), then runs it.
int RecordingShell(const char* command) {
    int fd = open(g_shellLog.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    if (fd >= 0) {
        std::string line = std::string(command) + "\n";
        if (write(fd, line.data(), line.size()) < 0) perror("shell log");
        close(fd);
    }
    return system(command);
}

void InstallHandlers() {
    struct sigaction action;
    memset(&action, 0, sizeof(action));
    action.sa_handler = OnSignal;
    sigemptyset(&action.sa_mask);
    for (int sig : {SIGCHLD, SIGUSR2, SIGALRM}) sigaction(sig, &action, nullptr);
    g_sigchld = g_sigusr2 = g_sigalrm = 0;
}

}  // namespace

std::vector<std::string> SplitLines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    std::string line;
    while (std::getline(in, line)) lines.push_back(line);
    return lines;
}

void TunnelTest::SetUp() {
    RootTest::SetUp();
    InstallHandlers();
    standin = root.path("/standin");
    root.mkdir("/standin");
    root.mkdir("/tmp");
    root.mkdir("/usr/zepa/etc/zeparelayd/ca");
    root.write("/usr/sbin/openvpn", zepatest::ReadFile(ZEPA_OPENVPN_STANDIN), 0755);
    root.write("/usr/zepa/bin/iptablestool", "#!/bin/sh\necho \"$*\" >> '" + standin + "/iptablestool'\n",
               0755);
    // The appliance's up script publishes the peer and wakes the daemon.
    root.write("/usr/zepa/etc.defaults/zeparelayd/scripts/up.sh",
               "#!/bin/sh\necho 'peer_ip=\"10.8.0.1\"' > '" + root.path("/tmp/.zepa_farlink_tunnel_info") +
                   "'\nkill -USR2 \"$1\"\n",
               0755);
    root.write("/usr/zepa/etc.defaults/zeparelayd/scripts/down.sh", "#!/bin/sh\nexit 0\n", 0755);
    g_shellLog = standin + "/shell";
    ZEPA::Relay::g_tunnelShell = RecordingShell;
    // Long enough that a wait ended by the alarm shows in g_sigalrm.
    ZEPA::Relay::SetTunnelWaitSeconds(20);
}

void TunnelTest::TearDown() {
    for (int pid : children) StopChild(pid);
    while (waitpid(-1, nullptr, WNOHANG) > 0) {
    }
    alarm(0);
    RootTest::TearDown();
}

Tunnel TunnelTest::MakeTunnel(const std::string& user) {
    Tunnel tunnel;
    tunnel.relay_ip = "192.0.2.10";
    tunnel.relay_user = user;
    tunnel.relay_pass = "s3cret-pass";
    return tunnel;
}

void TunnelTest::SetBehaviour(const std::string& protoWord, const std::string& behaviour) {
    root.write("/standin/behaviour." + protoWord, behaviour + "\n");
}

void TunnelTest::RemoveVpnProgram() { unlink(root.path("/usr/sbin/openvpn").c_str()); }

bool TunnelTest::Called(int n) const { return zepatest::FileExists(standin + "/argv." + std::to_string(n)); }

std::vector<std::string> TunnelTest::Argv(int n) const {
    return SplitLines(zepatest::ReadFile(standin + "/argv." + std::to_string(n)));
}

std::string TunnelTest::PassMode(int n) const {
    return zepatest::ReadFile(standin + "/mode." + std::to_string(n));
}

std::string TunnelTest::PassContent(int n) const {
    return zepatest::ReadFile(standin + "/pass." + std::to_string(n));
}

std::string TunnelTest::BlockedSignals(int n) const {
    return zepatest::ReadFile(standin + "/mask." + std::to_string(n));
}

std::string TunnelTest::ToolLogAtStart(int n) const {
    return zepatest::ReadFile(standin + "/tool." + std::to_string(n));
}

bool TunnelTest::Terminated(int n) const {
    return zepatest::FileExists(standin + "/term." + std::to_string(n));
}

std::vector<std::string> TunnelTest::ToolCalls() const {
    return SplitLines(zepatest::ReadFile(standin + "/iptablestool"));
}

std::vector<std::string> TunnelTest::ShellCommands() const {
    return SplitLines(zepatest::ReadFile(standin + "/shell"));
}

void TunnelTest::StopChild(int pid) {
    if (pid <= 0) return;
    // Only a child of ours that is still running: a reaped pid may be reused.
    if (waitpid(pid, nullptr, WNOHANG) != 0) return;
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
}

std::string TunnelTest::PassPath(const std::string& user) const { return root.path("/tmp/.tunnel." + user); }

}  // namespace tunneltest
