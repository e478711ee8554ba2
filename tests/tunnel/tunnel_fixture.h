// Fixture of the tunnel tests: a private root holding stand-ins for the VPN
// program, the module tool and the up script, the signal handlers the daemon
// must have while a tunnel starts, and readers for what the stand-ins recorded.
#ifndef ZEPARELAYD_TESTS_TUNNEL_TUNNEL_FIXTURE_H
#define ZEPARELAYD_TESTS_TUNNEL_TUNNEL_FIXTURE_H

#include <signal.h>

#include <string>
#include <vector>

#include <zeparelayd/tunnel.h>

#include "support/seams.h"
#include "support/test_support.h"

namespace tunneltest {

extern volatile sig_atomic_t g_sigchld;
extern volatile sig_atomic_t g_sigusr2;
extern volatile sig_atomic_t g_sigalrm;

class TunnelTest : public zepatest::RootTest {
protected:
    void SetUp() override;
    void TearDown() override;

    // A tunnel with address, user and password set.
    ZEPA::Relay::Tunnel MakeTunnel(const std::string& user = "relayuser");
    // What the VPN stand-in does when started with this protocol word.
    void SetBehaviour(const std::string& protoWord, const std::string& behaviour);
    void RemoveVpnProgram();

    // Records of the VPN stand-in's call n (1, 2, ...).
    bool Called(int n) const;
    std::vector<std::string> Argv(int n) const;
    std::string PassMode(int n) const;
    std::string PassContent(int n) const;
    std::string BlockedSignals(int n) const;
    std::string ToolLogAtStart(int n) const;
    bool Terminated(int n) const;
    // Lines the module tool stand-in was called with ("$*").
    std::vector<std::string> ToolCalls() const;
    // Exact command lines given to the shell, in order.
    std::vector<std::string> ShellCommands() const;

    // Stops a child left running and waits for it.
    void StopChild(int pid);

    std::string PassPath(const std::string& user = "relayuser") const;
    std::string standin;  // <root>/standin
    std::vector<int> children;
    // Every seam back to the library's own call after the test.
    ZEPA::Relay::SeamGuard seams;
};

std::vector<std::string> SplitLines(const std::string& text);

}  // namespace tunneltest

#endif
