#include <fcntl.h>
#include <libdaemon/dlog.h>
#include <libdaemon/dpid.h>
#include <libdaemon/dsignal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>
#include <zepasdk/sysroot.h>

#include <cerrno>
#include <csignal>
#include <cstring>
#include <string>
#include <vector>

#include <zeparelayd/daemon.h>

#include "daemon_fixture.h"

using ZEPA::Relay::Daemon;
using namespace daemontest;

namespace {

class ProcessTest : public DaemonTest {
protected:
    // Points this process's stderr at a file below the root (for launchers).
    void StderrTo(const std::string& absPath) const {
        Daemon::OpenLogFile(root.path(absPath), STDERR_FILENO, O_CREAT | O_TRUNC);
    }
    std::string LauncherLog() const { return root.read("/launcher.log"); }
};

int ExitCode(int status) { return WIFEXITED(status) ? WEXITSTATUS(status) : -1000 - status; }

std::string ReadLink(const char* path) {
    char buf[512];
    ssize_t n = readlink(path, buf, sizeof(buf) - 1);
    return n < 0 ? std::string() : std::string(buf, static_cast<size_t>(n));
}

TEST_F(ProcessTest, SetNameTakesTheIdentityAfterTheLastSlash) {
    static char name[] = "/usr/sbin/zeparelayd";
    ASSERT_TRUE(Daemon::SetName(name));
    EXPECT_STREQ("zeparelayd", daemon_log_ident);
    EXPECT_STREQ("zeparelayd", daemon_pid_file_ident);
    // Not copied: the identity points into the caller's storage.
    EXPECT_EQ(name + 10, daemon_log_ident);
    EXPECT_EQ(root.path("/var/run/zeparelayd.pid"), Daemon::GetPidFile());
    EXPECT_STREQ(Daemon::GetPidFile(), daemon_pid_file_proc());
}

TEST_F(ProcessTest, WithTheRealRootThePidFileIsExactlyUnderVarRun) {
    ASSERT_EQ(0, ZEPASysRootSet("/"));
    ASSERT_TRUE(Daemon::SetName("relayx"));
    EXPECT_STREQ("/var/run/relayx.pid", Daemon::GetPidFile());
}

TEST_F(ProcessTest, SetNameRefusesNull) {
    EXPECT_FALSE(Daemon::SetName(nullptr));
    EXPECT_STREQ("", Daemon::GetPidFile());
    EXPECT_EQ(nullptr, daemon_pid_file_ident);
}

TEST_F(ProcessTest, LibInitNamesTheProcessOnceAndOnlyWhenNoPidFileIsKnown) {
    ASSERT_TRUE(Daemon::LibInit());
    EXPECT_STREQ("zeparelayd", daemon_pid_file_ident);
    EXPECT_EQ(root.path("/var/run/zeparelayd.pid"), Daemon::GetPidFile());
    ASSERT_TRUE(Daemon::SetPidFile("/elsewhere/x.pid"));
    EXPECT_TRUE(Daemon::LibInit());
    EXPECT_STREQ("/elsewhere/x.pid", Daemon::GetPidFile());
}

TEST_F(ProcessTest, SetPidFileBeforeAnyNameLeavesTheIdentityUnset) {
    ASSERT_TRUE(Daemon::SetPidFile("/elsewhere/x.pid"));
    EXPECT_TRUE(Daemon::LibInit());
    EXPECT_EQ(nullptr, daemon_pid_file_ident);
    EXPECT_EQ(nullptr, daemon_log_ident);
    EXPECT_STREQ("/elsewhere/x.pid", Daemon::GetPidFile());
}

TEST_F(ProcessTest, SetNameOverwritesAnEarlierPidFile) {
    ASSERT_TRUE(Daemon::SetPidFile("/elsewhere/x.pid"));
    ASSERT_TRUE(Daemon::SetName("zeparelayd"));
    EXPECT_EQ(root.path("/var/run/zeparelayd.pid"), Daemon::GetPidFile());
}

TEST_F(ProcessTest, SetPidFileRefusesEmptyAndNullSilentlyAndRelativeWithAMessage) {
    Daemon::_logLevel = 7;
    ASSERT_TRUE(Daemon::SetName("zeparelayd"));
    const std::string before = Daemon::GetPidFile();
    zepatest::StderrCapture capture;
    EXPECT_FALSE(Daemon::SetPidFile(nullptr));
    EXPECT_FALSE(Daemon::SetPidFile(""));
    std::string silent = capture.stop();
    EXPECT_EQ("", silent);

    zepatest::StderrCapture relative;
    EXPECT_FALSE(Daemon::SetPidFile("run/x.pid"));
    std::vector<std::string> lines = zepatest::LogMessages(relative.stop());
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ(0u, lines[0].find("daemon:"));
    EXPECT_NE(std::string::npos, lines[0].find(" pid file must be absolute path"));
    EXPECT_EQ(before, Daemon::GetPidFile());
}

TEST_F(ProcessTest, ForegroundInitCreatesThePidFileAndRefusesASecondStart) {
    ASSERT_TRUE(Daemon::SetName("zeparelayd"));
    ASSERT_TRUE(Daemon::Init(false));
    EXPECT_FALSE(Daemon::IsForked());
    EXPECT_EQ(getpid(), PidInFile(DefaultPidFile()));

    zepatest::StderrCapture capture;
    EXPECT_FALSE(Daemon::Init(false));
    EXPECT_TRUE(zepatest::LogContains(capture.stop(),
                                      "Daemon already running on PID file " + std::to_string(getpid())));
    daemon_pid_file_remove();
}

TEST_F(ProcessTest, ForegroundInitWithoutPidDirectoryFailsWithAMessage) {
    ASSERT_TRUE(Daemon::SetName("zeparelayd"));
    ASSERT_TRUE(Daemon::SetPidFile(root.path("/nodir/x.pid").c_str()));
    zepatest::StderrCapture capture;
    EXPECT_FALSE(Daemon::Init(false));
    std::string log = capture.stop();
    EXPECT_TRUE(zepatest::LogContains(log, "Could not create PID file (No such file or directory)."));
}

TEST_F(ProcessTest, DaemonStartsDetachedHoldsThePidFileAndRefusesASecondStart) {
    ZEPA_SKIP_WITHOUT_SUBREAPER();
    const pid_t testSession = getsid(0);
    int launcher = RunInChild([&] {
        StderrTo("/launcher.log");
        Daemon::SetLogFile(root.path("/var/log/d.log"), 7);
        Daemon::SetName("zeparelayd");
        if (!Daemon::Init(true)) return 90;
        // The daemon: record what it sees, then wait for SIGTERM.
        std::string facts = std::string(Daemon::IsForked() ? "forked" : "not-forked") + " " +
                            std::to_string(getsid(0) != testSession) + "\n";
        zepatest::WriteFile(root.path("/facts"), facts);
        for (;;) pause();
    });
    ASSERT_EQ(0, ExitCode(launcher));
    EXPECT_TRUE(zepatest::LogContains(LauncherLog(), "daemon:"));
    EXPECT_TRUE(zepatest::LogContains(LauncherLog(), " zeparelayd returned 0"));

    pid_t daemonPid = PidInFile(DefaultPidFile());
    ASSERT_GT(daemonPid, 0);
    EXPECT_EQ(0, kill(daemonPid, 0));

    ASSERT_TRUE(Daemon::SetName("zeparelayd"));
    zepatest::StderrCapture capture;
    // Refused before any fork: a forked parent would never come back here.
    EXPECT_FALSE(Daemon::Init(true));
    EXPECT_TRUE(zepatest::LogContains(capture.stop(),
                                      "Daemon already running on PID file " + std::to_string(daemonPid)));
    EXPECT_FALSE(Daemon::IsForked());
    EXPECT_EQ(daemonPid, PidInFile(DefaultPidFile()));

    // The daemon may still be writing its facts; SIGTERM after that.
    for (int i = 0; i < 2000 && !root.exists("/facts"); ++i) usleep(1000);
    EXPECT_EQ(0, Daemon::Kill());
    int status = Reap(daemonPid);
    ASSERT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(SIGTERM, WTERMSIG(status));
    EXPECT_EQ("forked 1\n", root.read("/facts"));
}

TEST_F(ProcessTest, SuccessWordIsLoggedOnlyAtDebugLevel) {
    int launcher = RunInChild([&] {
        StderrTo("/launcher.log");
        Daemon::SetName("zeparelayd");
        if (!Daemon::Init(true)) return 90;
        _exit(0);
    });
    ASSERT_EQ(0, ExitCode(launcher));
    EXPECT_FALSE(zepatest::LogContains(LauncherLog(), "returned"));
}

TEST_F(ProcessTest, ChildWithoutPidFileMakesTheParentExitWithFour) {
    const std::string logFile = root.path("/var/log/child.log");
    int launcher = RunInChild([&] {
        Daemon::SetLogFile(logFile, 4);
        StderrTo("/launcher.log");
        Daemon::SetName("zeparelayd");
        Daemon::SetPidFile(root.path("/nodir/zeparelayd.pid").c_str());
        if (!Daemon::Init(true)) _exit(0);  // the daemon child after sending 4
        return 91;
    });
    EXPECT_EQ(4, ExitCode(launcher));
    std::vector<std::string> lines = zepatest::LogMessages(LauncherLog());
    ASSERT_EQ(1u, lines.size()) << LauncherLog();
    EXPECT_NE(std::string::npos, lines[0].find(" zeparelayd returned 4"));
    EXPECT_EQ(0u, lines[0].find("daemon:"));
    EXPECT_TRUE(zepatest::LogContains(root.read("/var/log/child.log"),
                                      "Could not create PID file (No such file or directory)."));
}

void Wake(int) {}

TEST_F(ProcessTest, ParentThatGetsNoWordExitsWith255) {
    ZEPA_SKIP_WITHOUT_SUBREAPER();
    fflush(nullptr);
    pid_t launcher = fork();
    if (launcher == 0) {
        StderrTo("/launcher.log");
        // SIGUSR2 cuts the 20-second wait short, as its running out would.
        struct sigaction act = {};
        act.sa_handler = Wake;
        sigaction(SIGUSR2, &act, nullptr);
        Daemon::SetName("zeparelayd");
        // A daemon child that dies without a word.
        if (Daemon::Fork()) _exit(0);
        _exit(92);
    }
    // The daemon child is re-parented to us; once it is gone no word can come.
    int status = 0;
    pid_t got;
    do {
        got = waitpid(-1, &status, 0);
    } while (got < 0 && errno == EINTR);
    ASSERT_GT(got, 0);
    ASSERT_NE(launcher, got) << "the launcher ended before its child";
    pid_t ended = 0;
    while ((ended = waitpid(launcher, &status, WNOHANG)) == 0) {
        kill(launcher, SIGUSR2);
        usleep(1000);
    }
    ASSERT_EQ(launcher, ended);
    EXPECT_EQ(255, ExitCode(status));
    EXPECT_TRUE(zepatest::LogContains(LauncherLog(), "Could not recieve return value from daemon process: "));
    EXPECT_TRUE(zepatest::LogContains(LauncherLog(), " zeparelayd returned -1"));
}

TEST_F(ProcessTest, WithoutDescriptorsForThePipeInitFailsWithoutForking) {
    int status = RunInChild([&] {
        StderrTo("/launcher.log");
        Daemon::SetName("zeparelayd");
        // Use up every descriptor so that the start-up pipe cannot be made.
        rlimit limit = {64, 64};
        setrlimit(RLIMIT_NOFILE, &limit);
        while (open("/dev/null", O_RDONLY) >= 0) {
        }
        bool started = Daemon::Init(true);
        return started ? 1 : 0;
    });
    EXPECT_EQ(0, ExitCode(status));
    // libdaemon adds lines of its own; the library logs exactly one.
    std::vector<std::string> ours;
    for (const std::string& line : zepatest::LogMessages(LauncherLog()))
        if (line.compare(0, 7, "daemon:") == 0) ours.push_back(line);
    ASSERT_EQ(1u, ours.size()) << LauncherLog();
    EXPECT_NE(std::string::npos, ours[0].find(" Failed to create pipe."));
    EXPECT_FALSE(root.exists("/var/run/zeparelayd.pid"));
}

TEST_F(ProcessTest, EachDaemonStartBeginsAFreshLogFile) {
    ZEPA_SKIP_WITHOUT_SUBREAPER();
    const std::string logFile = root.path("/var/log/custom.log");
    zepatest::WriteFile(logFile, "old content\n");
    int launcher = RunInChild([&] {
        Daemon::SetLogFile(logFile, 4);
        Daemon::SetName("zeparelayd");
        if (!Daemon::Init(true)) return 90;
        Daemon::Log(3, "%s:%d first start", "test", 1);
        _exit(0);
    });
    ASSERT_EQ(0, ExitCode(launcher));
    // The daemon is re-parented to us; wait for it to finish writing.
    ReapAll();
    std::string text = zepatest::ReadFile(logFile);
    EXPECT_EQ(std::string::npos, text.find("old content"));
    EXPECT_TRUE(zepatest::LogContains(text, "test:1 first start"));
}

// logrotate's copytruncate empties the file under the running daemon: the next
// line must land at its start, not after a hole as long as the old content.
TEST_F(ProcessTest, AfterATruncationByAnotherProcessTheNextLineStartsTheFile) {
    ZEPA_SKIP_WITHOUT_SUBREAPER();
    const std::string logFile = root.path("/var/log/custom.log");
    int launcher = RunInChild([&] {
        Daemon::SetLogFile(logFile, 4);
        Daemon::SetName("zeparelayd");
        if (!Daemon::Init(true)) return 90;
        Daemon::Log(3, "%s:%d before the rotation", "test", 1);
        if (truncate(logFile.c_str(), 0) != 0) _exit(91);
        Daemon::Log(3, "%s:%d after the rotation", "test", 2);
        _exit(0);
    });
    ASSERT_EQ(0, ExitCode(launcher));
    EXPECT_EQ(0, ExitCode(ReapAll()));
    std::string text = zepatest::ReadFile(logFile);
    EXPECT_EQ(std::string::npos, text.find('\0'));
    std::vector<std::string> lines = zepatest::LogMessages(text);
    ASSERT_EQ(1u, lines.size()) << text;
    EXPECT_EQ("test:2 after the rotation", lines[0]);
}

TEST_F(ProcessTest, WithoutLogFileTheDaemonsStderrStaysOnTheNullDevice) {
    ZEPA_SKIP_WITHOUT_SUBREAPER();
    int launcher = RunInChild([&] {
        Daemon::SetName("zeparelayd");
        if (!Daemon::Init(true)) return 90;
        Daemon::Log(3, "%s:%d lost", "test", 1);
        zepatest::WriteFile(root.path("/stderr"), ReadLink("/proc/self/fd/2"));
        _exit(0);
    });
    ASSERT_EQ(0, ExitCode(launcher));
    ReapAll();
    EXPECT_EQ("/dev/null", root.read("/stderr"));
    EXPECT_FALSE(root.exists("/var/log/zeparelayd.log"));
}

TEST_F(ProcessTest, EmptySetLogFileAfterDaemonisingAppendsToTheDefaultLogFile) {
    ZEPA_SKIP_WITHOUT_SUBREAPER();
    root.write("/var/log/zeparelayd.log", "earlier line\n");
    int launcher = RunInChild([&] {
        Daemon::SetName("zeparelayd");
        if (!Daemon::Init(true)) return 90;
        Daemon::SetLogFile("", -1);
        Daemon::Log(3, "%s:%d after daemonising", "test", 2);
        bool kept = Daemon::_strLogFile.empty() && Daemon::_logLevel == 4;
        _exit(kept ? 0 : 1);
    });
    ASSERT_EQ(0, ExitCode(launcher));
    EXPECT_EQ(0, ExitCode(ReapAll()));
    std::string text = root.read("/var/log/zeparelayd.log");
    EXPECT_EQ(0u, text.find("earlier line\n"));
    EXPECT_TRUE(zepatest::LogContains(text, "test:2 after daemonising"));
}

TEST_F(ProcessTest, SetLogFileAfterDaemonisingAppendsToTheNewFile) {
    ZEPA_SKIP_WITHOUT_SUBREAPER();
    const std::string first = root.path("/var/log/first.log");
    const std::string second = root.path("/var/log/second.log");
    zepatest::WriteFile(second, "kept\n");
    int launcher = RunInChild([&] {
        Daemon::SetLogFile(first, 4);
        Daemon::SetName("zeparelayd");
        if (!Daemon::Init(true)) return 90;
        Daemon::Log(3, "%s:%d one", "test", 1);
        Daemon::SetLogFile(second, 6);
        Daemon::Log(6, "%s:%d two", "test", 2);
        _exit(0);
    });
    ASSERT_EQ(0, ExitCode(launcher));
    ReapAll();
    EXPECT_TRUE(zepatest::LogContains(zepatest::ReadFile(first), "test:1 one"));
    EXPECT_FALSE(zepatest::LogContains(zepatest::ReadFile(first), "test:2 two"));
    std::string text = zepatest::ReadFile(second);
    EXPECT_EQ(0u, text.find("kept\n"));
    EXPECT_TRUE(zepatest::LogContains(text, "test:2 two"));
}

TEST_F(ProcessTest, SetLogFileBeforeDaemonisingOpensNothing) {
    zepatest::StderrCapture capture;
    EXPECT_TRUE(Daemon::SetLogFile("", -1));
    Daemon::Log(4, "%s:%d still here", "test", 1);
    EXPECT_TRUE(zepatest::LogContains(capture.stop(), "test:1 still here"));
    EXPECT_FALSE(root.exists("/var/log/zeparelayd.log"));
}

TEST_F(ProcessTest, InitSignalHandlerRoutesEveryDaemonSignalThroughThePipe) {
    int status = RunInChild([] {
        if (Daemon::InitSignalHandler() != 0) return 10;
        const int sigs[] = {SIGINT,  SIGTERM, SIGQUIT, SIGPIPE,      SIGHUP,      SIGCHLD,
                            SIGALRM, SIGUSR1, SIGUSR2, SIGRTMIN + 1, SIGRTMIN + 5};
        for (int sig : sigs) {
            if (raise(sig) != 0) return 11;
            if (daemon_signal_next() != sig) return 12;
        }
        // Only the listed real-time signals are taken over.
        struct sigaction act;
        sigaction(SIGRTMIN + 2, nullptr, &act);
        if (act.sa_handler != SIG_DFL) return 13;
        return 0;
    });
    EXPECT_EQ(0, ExitCode(status));
}

TEST_F(ProcessTest, SignalKillAndHupReachTheProcessInThePidFile) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    ASSERT_TRUE(Daemon::LibInit());
    EXPECT_EQ(0, Daemon::Signal(SIGUSR2));
    EXPECT_EQ(SIGUSR2, daemon.NextSignal());
    EXPECT_EQ(0, Daemon::Hup());
    EXPECT_EQ(SIGHUP, daemon.NextSignal());
    EXPECT_EQ(0, Daemon::Kill());
    EXPECT_EQ(SIGTERM, daemon.NextSignal());
}

TEST_F(ProcessTest, SendersReportFailureInThreeDifferentWays) {
    Daemon::_logLevel = 5;
    ASSERT_TRUE(Daemon::LibInit());

    zepatest::StderrCapture signalCapture;
    EXPECT_EQ(2, Daemon::Signal(SIGUSR2));
    std::vector<std::string> lines = zepatest::LogMessages(signalCapture.stop());
    ASSERT_EQ(1u, lines.size());
    EXPECT_NE(std::string::npos, lines[0].find(" Failed to signal daemon, " + std::to_string(SIGUSR2)));

    zepatest::StderrCapture killCapture;
    EXPECT_EQ(2, Daemon::Kill());
    lines = zepatest::LogMessages(killCapture.stop());
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ(0u, lines[0].find("daemon:"));
    EXPECT_NE(std::string::npos, lines[0].find(" Failed to kill daemon"));

    Daemon::_logLevel = 7;
    zepatest::StderrCapture hupCapture;
    EXPECT_EQ(2, Daemon::Hup());
    EXPECT_EQ("zeparelayd not running\n", hupCapture.stop());
}

TEST_F(ProcessTest, FailedSignalAndKillAreNoticesHiddenAtTheDefaultLevel) {
    ASSERT_TRUE(Daemon::LibInit());
    zepatest::StderrCapture capture;
    EXPECT_EQ(2, Daemon::Signal(SIGUSR2));
    EXPECT_EQ(2, Daemon::Kill());
    EXPECT_EQ("", capture.stop());
}

TEST_F(ProcessTest, SignalToADeadDaemonFails) {
    pid_t dead;
    {
        StandInDaemon daemon;
        dead = daemon.pid();
    }
    WritePidFile(dead);
    ASSERT_TRUE(Daemon::LibInit());
    EXPECT_EQ(2, Daemon::Kill());
}

}  // namespace
