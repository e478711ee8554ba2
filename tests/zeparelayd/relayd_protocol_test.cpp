// What the daemon and its control tool agree on: the meaning of each signal,
// the signals held back at start (exactly those the daemon handles), the
// status file's member names and the check of which process is the daemon.
#include <gtest/gtest.h>
#include <libdaemon/dsignal.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <string>
#include <vector>

#include <zeparelayd/daemon.h>

#include "relayd_protocol.h"

using ZEPA::Relay::Daemon;
using zepatools::DaemonSignal;

namespace {

bool Handled(int sig) {
    struct sigaction act;
    if (sigaction(sig, nullptr, &act) != 0) return false;
    return act.sa_handler != SIG_DFL && act.sa_handler != SIG_IGN;
}

TEST(RelaydProtocol, EachRequestHasItsSignalAndEachSignalItsMeaning) {
    EXPECT_EQ(SIGTERM, SignalOf(DaemonSignal::STOP));
    EXPECT_EQ(SIGHUP, SignalOf(DaemonSignal::RELOAD));
    EXPECT_EQ(SIGUSR1, SignalOf(DaemonSignal::DEBUG_DUMP));
    EXPECT_EQ(SIGRTMIN + 1, SignalOf(DaemonSignal::UPDATE_ALIAS));
    EXPECT_EQ(SIGRTMIN + 2, SignalOf(DaemonSignal::REOPEN_LOG));
    EXPECT_EQ(SIGUSR2, SignalOf(DaemonSignal::TUNNEL_UP));
    EXPECT_EQ(SIGCHLD, SignalOf(DaemonSignal::CHILD_EXITED));
    EXPECT_EQ(0, SignalOf(DaemonSignal::OTHER));

    for (DaemonSignal m :
         {DaemonSignal::STOP, DaemonSignal::RELOAD, DaemonSignal::DEBUG_DUMP, DaemonSignal::UPDATE_ALIAS,
          DaemonSignal::REOPEN_LOG, DaemonSignal::TUNNEL_UP, DaemonSignal::CHILD_EXITED}) {
        EXPECT_EQ(m, zepatools::MeaningOf(SignalOf(m))) << SignalOf(m);
    }
    EXPECT_EQ(DaemonSignal::STOP, zepatools::MeaningOf(SIGINT));
    EXPECT_EQ(DaemonSignal::STOP, zepatools::MeaningOf(SIGQUIT));
    for (int sig : {0, -1, SIGPIPE, SIGALRM, SIGRTMIN + 5, SIGRTMIN + 3, SIGKILL}) {
        EXPECT_EQ(DaemonSignal::OTHER, zepatools::MeaningOf(sig)) << sig;
    }
}

// The held set must be what the daemon handles: a signal handled but not
// held could arrive before the loop listens; one held but not handled would
// stay pending for good.
TEST(RelaydProtocol, HeldSetIsWhatTheLibraryRoutesPlusTheLogSignal) {
    const sigset_t held = zepatools::DaemonSignalSet();
    const std::vector<int> listed = zepatools::DaemonSignals();
    for (int sig : listed) EXPECT_EQ(1, sigismember(&held, sig)) << sig;
    for (int sig : {SIGINT, SIGTERM, SIGQUIT, SIGPIPE, SIGHUP, SIGCHLD, SIGALRM, SIGUSR1, SIGUSR2}) {
        EXPECT_EQ(1, sigismember(&held, sig)) << sig;
    }
    for (int sig : {SIGKILL, SIGSTOP, SIGSEGV, SIGWINCH, SIGRTMIN + 3}) {
        EXPECT_NE(1, sigismember(&held, sig)) << sig;
    }

    // In a child: after the library's handler set-up and the log signal's,
    // a signal has a handler exactly when it is in the held set.
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        // Handlers that were there before (a sanitizer's) are not the daemon's.
        std::vector<bool> before(NSIG, false);
        for (int sig = 1; sig < NSIG; ++sig) before[sig] = Handled(sig);
        if (Daemon::InitSignalHandler() != 0) _exit(100);
        if (daemon_signal_install(SignalOf(DaemonSignal::REOPEN_LOG)) != 0) _exit(101);
        for (int sig = 1; sig < NSIG; ++sig) {
            if (sig == SIGKILL || sig == SIGSTOP) continue;
            const bool isHeld = sigismember(&held, sig) == 1;
            if (isHeld && !Handled(sig)) _exit(sig);
            if (!isHeld && Handled(sig) && !before[sig]) _exit(sig);
        }
        _exit(0);
    }
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status)) << "signal (or set-up step 100/101) that differs";
}

// Readers in other programs (scripts, web handlers) match these words: a
// renamed constant must not change the file silently.
TEST(RelaydProtocol, StatusFileMemberNamesAreTheFileWords) {
    namespace key = zepatools::status_key;
    EXPECT_STREQ("pid", key::kPid);
    EXPECT_STREQ("state", key::kState);
    EXPECT_STREQ("error", key::kError);
    EXPECT_STREQ("serverID", key::kServerId);
    EXPECT_STREQ("service", key::kService);
    EXPECT_STREQ("id", key::kServiceId);
    EXPECT_STREQ("alias", key::kAlias);
    EXPECT_STREQ("alias_status", key::kAliasStatus);
    EXPECT_STREQ("config_error", key::kConfigError);
    EXPECT_STREQ("connect", key::kConnect);
    EXPECT_STREQ("tunnel", key::kTunnel);
    EXPECT_STREQ("registration_at", key::kRegistrationAt);
    EXPECT_STREQ("alias_at", key::kAliasAt);
    EXPECT_STREQ("registration_retry_at", key::kRegistrationRetryAt);
    EXPECT_STREQ("alias_retry_at", key::kAliasRetryAt);
    EXPECT_STREQ("status", key::kTunnelStatus);
    EXPECT_STREQ("relay_ip", key::kTunnelRelayIp);
    EXPECT_STREQ("relay_user", key::kTunnelRelayUser);
    EXPECT_STREQ("pid", key::kTunnelPid);
    EXPECT_STREQ("peer_ip", key::kTunnelPeerIp);
    EXPECT_STREQ("failures", key::kTunnelFailures);
    EXPECT_STREQ("starting", key::kTunnelStarting);
}

class DaemonProcessCheck : public ::testing::Test {
protected:
    void SetUp() override {
        char dir[] = "/tmp/zepa_protocol_XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(dir));
        dirPath = dir;
        pidFile = dirPath + "/zeparelayd.pid";
        ASSERT_TRUE(Daemon::SetPidFile(pidFile.c_str()));
    }
    void TearDown() override {
        const std::string cmd = "rm -rf '" + dirPath + "'";
        EXPECT_EQ(0, system(cmd.c_str()));
    }
    void WritePidFile(const std::string& text, mode_t mode = 0644) {
        unlink(pidFile.c_str());
        std::ofstream(pidFile) << text;
        ASSERT_EQ(0, chmod(pidFile.c_str(), mode));
    }

    std::string dirPath;
    std::string pidFile;
};

TEST_F(DaemonProcessCheck, NoPidFileIsNoDaemonAndNothingStale) {
    const zepatools::PidFileState state = zepatools::DaemonFromPidFile();
    EXPECT_EQ(-1, state.pid);
    EXPECT_FALSE(state.stale);
    EXPECT_FALSE(zepatools::IsRunningDaemon(getpid()));
}

TEST_F(DaemonProcessCheck, LiveWriterIsTheDaemon) {
    WritePidFile(std::to_string(getpid()) + "\n");
    const zepatools::PidFileState state = zepatools::DaemonFromPidFile();
    EXPECT_EQ(getpid(), state.pid);
    EXPECT_FALSE(state.stale);
    EXPECT_TRUE(zepatools::IsRunningDaemon(getpid()));
    EXPECT_FALSE(zepatools::IsRunningDaemon(getppid()));
    EXPECT_FALSE(zepatools::IsRunningDaemon(-1));
}

TEST_F(DaemonProcessCheck, DeadGarbledOrWritableFileIsStale) {
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) _exit(0);
    ASSERT_EQ(child, waitpid(child, nullptr, 0));
    for (const std::string& text :
         {std::to_string(child) + "\n", std::string("12ab\n"), std::string("-1\n")}) {
        WritePidFile(text);
        const zepatools::PidFileState state = zepatools::DaemonFromPidFile();
        EXPECT_EQ(-1, state.pid) << text;
        EXPECT_TRUE(state.stale) << text;
    }
    // Anybody could have written our own pid into a world-writable file.
    WritePidFile(std::to_string(getpid()) + "\n", 0666);
    EXPECT_TRUE(zepatools::DaemonFromPidFile().stale);
    EXPECT_FALSE(zepatools::IsRunningDaemon(getpid()));
}

}  // namespace
