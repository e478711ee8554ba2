// The doctor's relay probes against the real relay: openvpn servers in a
// network namespace, probed from the appliance's namespace as the appliance
// would. Needs root (skipped elsewhere, saying why).
#include <fcntl.h>
#include <sched.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>

#include "probes.h"
#include "support/relay_harness.h"

using namespace zeparelayctl;

namespace {

// Runs fn in a child that has joined the named network namespace; fn's result
// (0..125) is the child's exit status; -1 when it could not run there.
int InNetns(const std::string& netns, const std::function<int()>& fn) {
    const pid_t pid = fork();
    if (pid == 0) {
        const int fd = open(("/run/netns/" + netns).c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0 || setns(fd, CLONE_NEWNET) != 0) _exit(126);
        _exit(fn());
    }
    int status = 0;
    if (pid < 0 || waitpid(pid, &status, 0) != pid || !WIFEXITED(status) || WEXITSTATUS(status) == 126)
        return -1;
    return WEXITSTATUS(status);
}

class RelayProbes : public zepatest::RelayTest {
protected:
    int Udp() {
        const std::string ip = relay.relayIp;
        return InNetns(relay.applianceNetns,
                       [ip] { return static_cast<int>(ProbeVpnUdp(ip, 443, 2000).outcome); });
    }
    int Tcp() {
        const std::string ip = relay.relayIp;
        return InNetns(relay.applianceNetns, [ip] { return ProbeTcp(ip, 443, 2000).empty() ? 0 : 1; });
    }
};

TEST_F(RelayProbes, TheRelaysVpnServerAnswersTheHandshake) {
    EXPECT_EQ(UdpVpnProbe::ANSWERED, Udp());
    EXPECT_EQ(0, Tcp());
}

TEST_F(RelayProbes, UdpBlockedOnTheApplianceIsNamed) {
    ASSERT_TRUE(relay.BlockUdp(true));
    EXPECT_EQ(UdpVpnProbe::BLOCKED, Udp());
    EXPECT_EQ(0, Tcp());  // the TCP server still takes connections
}

TEST_F(RelayProbes, StoppedServersAreNamed) {
    ASSERT_TRUE(relay.Vpn("stop"));
    EXPECT_EQ(UdpVpnProbe::REFUSED, Udp());
    EXPECT_EQ(1, Tcp());
}

}  // namespace
