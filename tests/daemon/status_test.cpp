#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <csignal>
#include <string>
#include <vector>

#include <zeparelayd/daemon.h>
#include <zeparelayd/filelock.h>

#include "daemon_fixture.h"
#include "support/seams.h"

using ZEPA::Relay::Daemon;
using namespace daemontest;

namespace {

class StatusTest : public DaemonTest {
protected:
    std::string StatusWithPid(pid_t pid, const std::string& extra = "") const {
        return "{\"pid\": " + std::to_string(pid) + extra + "}";
    }
    // A pid that surely names no process: a child that has been reaped.
    static pid_t DeadPid() {
        StandInDaemon gone;
        pid_t pid = gone.pid();
        gone.Stop();
        return pid;
    }

private:
    ZEPA::Relay::SeamGuard _seams;
};

struct Words {
    bool ok;
    std::string serverId, state, error;
};

Words Ask(const char* serviceId) {
    Words w;
    w.serverId = w.state = w.error = "untouched";
    w.ok = Daemon::GetStatus(w.serverId, w.state, w.error, serviceId);
    return w;
}

// "daemon:<line> " at the start of the message.
bool HasSourcePrefix(const std::string& message) {
    const std::string source = "daemon:";
    if (message.compare(0, source.size(), source) != 0) return false;
    size_t end = message.find(' ', source.size());
    if (end == std::string::npos || end == source.size()) return false;
    return message.find_first_not_of("0123456789", source.size()) == end;
}

// ---- GetStatus, JSON form ------------------------------------------------

TEST_F(StatusTest, NoStatusFileMeansNotRunningWithANullValue) {
    Json::Value out = "stale";
    EXPECT_EQ(1, Daemon::GetStatus(out));
    EXPECT_TRUE(out.isNull());
    EXPECT_TRUE(SyslogLines().empty());
}

TEST_F(StatusTest, StatusFileThatIsNotJsonIsBrokenAndGoesToTheSystemLogOnly) {
    WriteStatus("{\"pid\": 12,");
    Daemon::_logLevel = 7;
    Json::Value out;
    zepatest::StderrCapture capture;
    EXPECT_EQ(255, Daemon::GetStatus(out));
    EXPECT_EQ("", capture.stop());
    ASSERT_EQ(1u, SyslogLines().size());
    EXPECT_EQ(LOG_ERR, SyslogLines()[0].priority);
    EXPECT_TRUE(HasSourcePrefix(SyslogLines()[0].message)) << SyslogLines()[0].message;
    EXPECT_NE(std::string::npos, SyslogLines()[0].message.find(" bad zeparelayd status file"));
    // A reader never repairs or removes the file.
    EXPECT_EQ("{\"pid\": 12,", root.read("/tmp/.zeparelayd.status"));
}

TEST_F(StatusTest, EmptyStatusFileIsBroken) {
    WriteStatus("");
    Json::Value out;
    EXPECT_EQ(255, Daemon::GetStatus(out));
    EXPECT_TRUE(SyslogHas(LOG_ERR, "bad zeparelayd status file"));
}

TEST_F(StatusTest, BadPidsAreBroken) {
    const std::vector<std::string> bad = {
        "[1, 2]", "7", "{}", "{\"pid\": \"12\"}", "{\"pid\": -1}", "{\"pid\": 1.5}", "{\"pid\": null}"};
    for (const std::string& text : bad) {
        StartSyslogRecorder();
        WriteStatus(text);
        Json::Value out;
        EXPECT_EQ(255, Daemon::GetStatus(out)) << text;
        ASSERT_EQ(1u, SyslogLines().size()) << text;
        EXPECT_EQ(LOG_ERR, SyslogLines()[0].priority);
        EXPECT_NE(std::string::npos, SyslogLines()[0].message.find(" bad zeparelayd status pid")) << text;
        EXPECT_TRUE(HasSourcePrefix(SyslogLines()[0].message));
    }
}

TEST_F(StatusTest, StaleFileIsNotRunningAndKeepsItsContent) {
    pid_t dead = DeadPid();
    WriteStatus(StatusWithPid(dead, ", \"serverID\": \"abc\""));
    Json::Value out;
    EXPECT_EQ(1, Daemon::GetStatus(out));
    EXPECT_EQ(dead, out["pid"].asInt());
    EXPECT_EQ("abc", out["serverID"].asString());
    EXPECT_TRUE(SyslogLines().empty());
}

TEST_F(StatusTest, LiveWriterIsRunningAndEveryMemberIsHandedOn) {
    StandInDaemon daemon;
    WriteStatus("// written by the daemon\n" + StatusWithPid(daemon.pid(), ", \"custom\": [1, 2]"));
    Json::Value out;
    EXPECT_EQ(0, Daemon::GetStatus(out));
    EXPECT_EQ(daemon.pid(), out["pid"].asInt());
    EXPECT_EQ(2u, out["custom"].size());
    // The probe is signal 0: nothing reaches the daemon.
    EXPECT_TRUE(daemon.NothingReported());
}

// ---- GetStatus, word form ----------------------------------------------

TEST_F(StatusTest, WordsWithoutStatusFile) {
    Words w = Ask(nullptr);
    EXPECT_TRUE(w.ok);
    EXPECT_EQ("", w.serverId);
    EXPECT_EQ("not_running", w.state);
    EXPECT_EQ("success", w.error);
    EXPECT_EQ("--", Ask("photo").serverId);
}

TEST_F(StatusTest, WordsOfABrokenFileAreFalseAndEmpty) {
    WriteStatus("not json at all");
    Words w = Ask(nullptr);
    EXPECT_FALSE(w.ok);
    EXPECT_EQ("", w.serverId);
    EXPECT_EQ("", w.state);
    EXPECT_EQ("", w.error);
}

TEST_F(StatusTest, WordsOfABadPidStillCarryTheServerId) {
    WriteStatus("{\"pid\": \"1\", \"serverID\": \"abc\", \"state\": 5}");
    Words w = Ask(nullptr);
    EXPECT_FALSE(w.ok);
    EXPECT_EQ("abc", w.serverId);
    EXPECT_EQ("", w.state);
}

TEST_F(StatusTest, StaleFileGivesItsServerIdOnlyWhenNoServiceIsAsked) {
    WriteStatus(StatusWithPid(DeadPid(),
                              ", \"serverID\": \"abc\", \"state\": 5, \"error\": 8, "
                              "\"service\": [{\"id\": \"photo\"}]"));
    Words w = Ask(nullptr);
    EXPECT_TRUE(w.ok);
    EXPECT_EQ("abc", w.serverId);
    EXPECT_EQ("not_running", w.state);
    EXPECT_EQ("success", w.error);
    Words forService = Ask("photo");
    EXPECT_TRUE(forService.ok);
    EXPECT_EQ("--", forService.serverId);
    EXPECT_EQ("not_running", forService.state);
    EXPECT_EQ("success", forService.error);
}

TEST_F(StatusTest, RunningDaemonWordsItsStateAndError) {
    StandInDaemon daemon;
    WriteStatus(StatusWithPid(daemon.pid(),
                              ", \"serverID\": \"abc\", \"state\": 6, \"error\": 8, "
                              "\"service\": [{\"id\": \"photo\"}, {\"id\": \"web\"}]"));
    Words w = Ask(nullptr);
    EXPECT_TRUE(w.ok);
    EXPECT_EQ("abc", w.serverId);
    EXPECT_EQ("connected", w.state);
    EXPECT_EQ("err_auth", w.error);
    Words web = Ask("web");
    EXPECT_EQ("abc", web.serverId);
    EXPECT_EQ("connected", web.state);
    EXPECT_EQ("err_auth", web.error);
}

TEST_F(StatusTest, ServiceNotRelayedReadsAsNotRunning) {
    StandInDaemon daemon;
    WriteStatus(StatusWithPid(daemon.pid(),
                              ", \"serverID\": \"abc\", \"state\": 5, \"error\": 3, "
                              "\"service\": [{\"id\": \"photo\"}]"));
    Words w = Ask("web");
    EXPECT_TRUE(w.ok);
    EXPECT_EQ("--", w.serverId);
    EXPECT_EQ("not_running", w.state);
    EXPECT_EQ("success", w.error);
}

TEST_F(StatusTest, ServiceListThatIsNotAnArrayOrHoldsNonObjectsNeverMatches) {
    StandInDaemon daemon;
    const std::vector<std::string> lists = {"\"photo\"", "{\"id\": \"photo\"}", "[\"photo\"]",
                                            "[[{\"id\": \"photo\"}]]", "[{\"name\": \"photo\"}]"};
    for (const std::string& list : lists) {
        WriteStatus(
            StatusWithPid(daemon.pid(), ", \"serverID\": \"abc\", \"state\": 5, \"service\": " + list));
        EXPECT_EQ("--", Ask("photo").serverId) << list;
        // Without a service id the list is not looked at.
        EXPECT_EQ("connected", Ask(nullptr).state) << list;
    }
    // Elements that are not objects are skipped, not fatal.
    WriteStatus(StatusWithPid(daemon.pid(),
                              ", \"serverID\": \"abc\", \"state\": 5, "
                              "\"service\": [3, \"x\", null, {\"id\": \"photo\"}]"));
    EXPECT_EQ("abc", Ask("photo").serverId);
}

TEST_F(StatusTest, ServiceIdIsComparedAsAString) {
    StandInDaemon daemon;
    WriteStatus(
        StatusWithPid(daemon.pid(), ", \"serverID\": \"abc\", \"state\": 5, \"service\": [{\"id\": 42}]"));
    EXPECT_EQ("abc", Ask("42").serverId);
    EXPECT_EQ("--", Ask("43").serverId);
}

TEST_F(StatusTest, NumbersOutsideTheTablesGetTheCatchAllWords) {
    StandInDaemon daemon;
    struct Case {
        const char* members;
        const char* state;
        const char* error;
    };
    const Case cases[] = {
        {"\"state\": 0, \"error\": 1", "error", "err_unknown"},
        {"\"state\": 9, \"error\": 2", "error", "err_unknown"},
        {"\"state\": 8, \"error\": 4", "stoped", "err_unknown"},
        {"\"state\": -1, \"error\": -1", "error", "err_unknown"},
        {"\"state\": 5, \"error\": 99999", "connected", "err_unknown"},
        {"\"state\": 5, \"error\": 255", "connected", "err_unknown"},
        {"\"state\": \"5\", \"error\": \"8\"", "not_running", "success"},
        {"\"error\": 11", "not_running", "err_lock"},
    };
    for (const Case& c : cases) {
        WriteStatus(StatusWithPid(daemon.pid(), std::string(", ") + c.members));
        Words w = Ask(nullptr);
        EXPECT_TRUE(w.ok) << c.members;
        EXPECT_EQ(c.state, w.state) << c.members;
        EXPECT_EQ(c.error, w.error) << c.members;
    }
}

// ---- UpdateAlias -----------------------------------------------------------

TEST_F(StatusTest, UpdateAliasSendsTheFirstRealTimeSignalToTheStatusFilesPid) {
    StandInDaemon daemon;
    WriteStatus(StatusWithPid(daemon.pid()));
    EXPECT_EQ(0, Daemon::UpdateAlias());
    EXPECT_EQ(SIGRTMIN + 1, daemon.NextSignal());
    // Neither the PID file nor LibInit is involved.
    EXPECT_STREQ("", Daemon::GetPidFile());
    EXPECT_TRUE(SyslogLines().empty());
}

TEST_F(StatusTest, UpdateAliasOnAStaleFileSignalsNobody) {
    StandInDaemon bystander;
    WritePidFile(bystander.pid());
    WriteStatus(StatusWithPid(DeadPid()));
    EXPECT_EQ(1, Daemon::UpdateAlias());
    EXPECT_TRUE(bystander.NothingReported());
    EXPECT_TRUE(SyslogLines().empty());
}

TEST_F(StatusTest, UpdateAliasWithoutStatusFileIsNotRunning) {
    StandInDaemon bystander;
    WritePidFile(bystander.pid());
    EXPECT_EQ(1, Daemon::UpdateAlias());
    EXPECT_TRUE(bystander.NothingReported());
    EXPECT_TRUE(SyslogLines().empty());
}

TEST_F(StatusTest, UpdateAliasOnBrokenFilesReportsToTheSystemLog) {
    Daemon::_logLevel = 7;
    zepatest::StderrCapture capture;
    WriteStatus("{");
    EXPECT_EQ(255, Daemon::UpdateAlias());
    EXPECT_TRUE(SyslogHas(LOG_ERR, " bad zeparelayd status file"));
    StartSyslogRecorder();
    WriteStatus("{\"pid\": \"123\"}");
    EXPECT_EQ(255, Daemon::UpdateAlias());
    EXPECT_TRUE(SyslogHas(LOG_ERR, " bad zeparelayd status pid"));
    StartSyslogRecorder();
    WriteStatus("{\"pid\": -1}");
    EXPECT_EQ(255, Daemon::UpdateAlias());
    EXPECT_TRUE(SyslogHas(LOG_ERR, " bad zeparelayd status pid"));
    EXPECT_EQ("", capture.stop());
}

// ---- DebugStatus -----------------------------------------------------------

std::vector<unsigned int> g_sleeps;
std::string g_waitFor;

void RecordSleep(unsigned int usec) { g_sleeps.push_back(usec); }

// Instead of sleeping, wait (bounded) until the daemon has written something.
void WaitForDump(unsigned int usec) {
    g_sleeps.push_back(usec);
    for (int i = 0; i < 5000; ++i) {
        struct stat st;
        if (stat(g_waitFor.c_str(), &st) == 0 && st.st_size > 0) return;
        usleep(1000);
    }
}

// Waits (bounded) until the debug file is gone.
void WaitForRemoval(unsigned int usec) {
    g_sleeps.push_back(usec);
    for (int i = 0; i < 5000 && access(g_waitFor.c_str(), F_OK) == 0; ++i) usleep(1000);
}

TEST_F(StatusTest, DebugStatusWithoutDaemonIsNotRunning) {
    Json::Value out = "stale";
    EXPECT_EQ(1, Daemon::DebugStatus(out));
    EXPECT_TRUE(out.isNull());
    // It named the process itself to find the PID file.
    EXPECT_EQ(root.path("/var/run/zeparelayd.pid"), Daemon::GetPidFile());
}

TEST_F(StatusTest, DebugStatusReadsTheDumpTheDaemonWritesOnSigusr1) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    g_waitFor = DebugFile(daemon.pid());
    ZEPA::Relay::g_statusSleep = WaitForDump;
    Json::Value out;
    EXPECT_EQ(0, Daemon::DebugStatus(out));
    EXPECT_EQ(daemon.pid(), out["pid"].asInt());
    EXPECT_EQ(1, out["dumps"].asInt());
    EXPECT_EQ(SIGUSR1, daemon.NextSignal());
    EXPECT_FALSE(zepatest::FileExists(DebugFile(daemon.pid())));
    EXPECT_EQ(50u, g_sleeps.at(0));
}

TEST_F(StatusTest, DebugStatusWithRealPausesGetsAnAnswerFromALiveDaemon) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    // The daemon has about 3 ms per query; a busy machine may miss a few.
    int ret = 11;
    Json::Value out;
    for (int attempt = 0; attempt < 50 && ret == 11; ++attempt) ret = Daemon::DebugStatus(out);
    EXPECT_EQ(0, ret);
    EXPECT_EQ(daemon.pid(), out["pid"].asInt());
    EXPECT_FALSE(zepatest::FileExists(DebugFile(daemon.pid())));
}

TEST_F(StatusTest, DaemonIgnoringSigusr1GivesBusyAfterThirtyAttempts) {
    StandInDaemon daemon(DumpMode::IGNORE);
    WritePidFile(daemon.pid());
    ZEPA::Relay::g_statusSleep = RecordSleep;
    Json::Value out;
    EXPECT_EQ(11, Daemon::DebugStatus(out));
    EXPECT_EQ(SIGUSR1, daemon.NextSignal());
    std::vector<unsigned int> expected(30, 100);
    expected[0] = 50;
    EXPECT_EQ(expected, g_sleeps);
    EXPECT_FALSE(zepatest::FileExists(DebugFile(daemon.pid())));
    ASSERT_EQ(1u, SyslogLines().size());
    EXPECT_EQ(LOG_DEBUG, SyslogLines()[0].priority);
    EXPECT_NE(std::string::npos, SyslogLines()[0].message.find(" zeparelayd status parse failed"));
    EXPECT_TRUE(HasSourcePrefix(SyslogLines()[0].message));
}

TEST_F(StatusTest, DebugFileRemovedUnderTheQueryIsBrokenWithoutRetry) {
    StandInDaemon daemon(DumpMode::REMOVE);
    WritePidFile(daemon.pid());
    g_waitFor = DebugFile(daemon.pid());
    ZEPA::Relay::g_statusSleep = WaitForRemoval;
    Json::Value out;
    EXPECT_EQ(255, Daemon::DebugStatus(out));
    EXPECT_EQ(std::vector<unsigned int>{50}, g_sleeps);
    EXPECT_TRUE(SyslogHas(LOG_ERR, " zeparelayd status file is not ready"));
}

TEST_F(StatusTest, DebugQueryWhileTheDebugFileIsLockedIsBusyAtOnce) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    FileLock other(DebugFile(daemon.pid()).c_str());
    ASSERT_TRUE(other.Lock(LOCK_EX));
    ZEPA::Relay::g_statusSleep = RecordSleep;
    Json::Value out;
    EXPECT_EQ(11, Daemon::DebugStatus(out));
    EXPECT_TRUE(g_sleeps.empty());
    EXPECT_TRUE(daemon.NothingReported());
    ASSERT_EQ(1u, SyslogLines().size());
    EXPECT_EQ(LOG_INFO, SyslogLines()[0].priority);
    EXPECT_NE(std::string::npos, SyslogLines()[0].message.find(" lock failed"));
}

int g_release = -1;
int g_started = -1;

// The first pause tells the test the lock is held, then waits to be let go.
void HoldInFirstPause(unsigned int usec) {
    if (usec == 50) {
        char c = 's';
        if (write(g_started, &c, 1) != 1) _exit(40);
        if (read(g_release, &c, 1) < 0) _exit(41);
    }
    WaitForDump(usec);
}

TEST_F(StatusTest, TwoQueriesAtOnceOneIsBusyAtOnce) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    int started[2], release[2];
    ASSERT_EQ(0, pipe(started));
    ASSERT_EQ(0, pipe(release));
    fflush(nullptr);
    pid_t first = fork();
    if (first == 0) {
        close(started[0]);
        close(release[1]);
        g_started = started[1];
        g_release = release[0];
        g_waitFor = DebugFile(daemon.pid());
        ZEPA::Relay::g_statusSleep = HoldInFirstPause;
        Json::Value out;
        _exit(Daemon::DebugStatus(out));
    }
    close(started[1]);
    close(release[0]);
    char c;
    ASSERT_EQ(1, read(started[0], &c, 1));
    ZEPA::Relay::g_statusSleep = RecordSleep;
    Json::Value out;
    EXPECT_EQ(11, Daemon::DebugStatus(out));
    EXPECT_TRUE(g_sleeps.empty());
    EXPECT_TRUE(SyslogHas(LOG_INFO, " lock failed"));
    close(release[1]);
    int status = Reap(first);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
    // One signal only: from the query that held the lock.
    EXPECT_EQ(SIGUSR1, daemon.NextSignal());
    EXPECT_TRUE(daemon.NothingReported());
}

TEST_F(StatusTest, StatusDebugPrintsTheDumpOnOneLine) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    g_waitFor = DebugFile(daemon.pid());
    ZEPA::Relay::g_statusSleep = WaitForDump;
    zepatest::StdoutCapture capture;
    int ret = Daemon::Status(true);
    std::string printed = capture.stop();
    EXPECT_EQ(0, ret);
    EXPECT_EQ("{\"dumps\":1,\"pid\":" + std::to_string(daemon.pid()) + "}\n", printed);
}

TEST_F(StatusTest, StatusDebugWithoutDaemonPrintsFailure) {
    zepatest::StdoutCapture capture;
    int ret = Daemon::Status(true);
    EXPECT_EQ("get status failed\n", capture.stop());
    EXPECT_EQ(1, ret);
}

class StatusReportTest : public StatusTest {
protected:
    void SetUp() override {
        StatusTest::SetUp();
        root.write("/usr/zepa/etc/zeparelayd/zeparelayd.conf",
                   "{\"serverID\": \"conf-id\", \"server_alias\": {\"alias\": \"myhome\"}}");
        root.write("/tmp/hopcloud_alias.status",
                   "{\"alias_name\": \"myhome\", \"status\": \"registered\", \"extra\": \"hidden\"}");
    }
    int Report(std::string& printed) {
        zepatest::StdoutCapture capture;
        int ret = Daemon::Status(false);
        printed = capture.stop();
        return ret;
    }
};

TEST_F(StatusReportTest, WithoutStatusFileFourLinesAndNotRunning) {
    std::string printed;
    EXPECT_EQ(1, Report(printed));
    EXPECT_EQ("serverID: \nstate: not_running\nalias: myhome\nalias_status: registered\n", printed);
}

TEST_F(StatusReportTest, BrokenStatusFilePrintsFailureAndGivesTwo) {
    WriteStatus("{\"pid\": ");
    std::string printed;
    EXPECT_EQ(2, Report(printed));
    EXPECT_EQ("get status failed\n", printed);
}

TEST_F(StatusReportTest, RunningDaemonWithAnErrorGetsAFifthLine) {
    StandInDaemon daemon;
    WriteStatus(StatusWithPid(daemon.pid(), ", \"serverID\": \"abc\", \"state\": 5, \"error\": 8"));
    std::string printed;
    EXPECT_EQ(0, Report(printed));
    EXPECT_EQ("serverID: abc\nstate: connected\nalias: myhome\nalias_status: registered\nerror: err_auth\n",
              printed);
}

TEST_F(StatusReportTest, RunningDaemonWithoutErrorAndAnotherAliasInTheStatus) {
    StandInDaemon daemon;
    WriteStatus(StatusWithPid(daemon.pid(), ", \"serverID\": \"abc\", \"state\": 3, \"error\": 0"));
    root.write("/tmp/hopcloud_alias.status", "{\"alias_name\": \"other\", \"status\": \"registered\"}");
    std::string printed;
    EXPECT_EQ(0, Report(printed));
    EXPECT_EQ("serverID: abc\nstate: login\nalias: myhome\nalias_status: \n", printed);
}

TEST_F(StatusReportTest, StaleStatusFileReportsItsServerIdAsNotRunning) {
    WriteStatus(StatusWithPid(DeadPid(), ", \"serverID\": \"abc\", \"state\": 5, \"error\": 8"));
    std::string printed;
    EXPECT_EQ(1, Report(printed));
    EXPECT_EQ("serverID: abc\nstate: not_running\nalias: myhome\nalias_status: registered\n", printed);
}

}  // namespace
