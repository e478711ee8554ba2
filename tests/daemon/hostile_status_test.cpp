// Status, debug and PID files planted by another user: FIFOs, folders,
// devices, links, oversized and deeply nested files, and pids that name a
// process group or a process that is no daemon. Every query runs in a child
// of its own process group with an alarm: a signal sent to the group kills
// the child, and a read that blocks ends by the alarm.
#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <csignal>
#include <functional>
#include <string>
#include <vector>

#include <zeparelayd/daemon.h>

#include "daemon_fixture.h"
#include "support/seams.h"

using ZEPA::Relay::Daemon;
using namespace daemontest;

namespace {

const char STATUS[] = "/tmp/.zeparelayd.status";

void NoSleep(unsigned int) {}

// The exit code of body run in a child that leads its own process group,
// with the default action for every signal the library might send; 128 +
// signal when a signal ended it.
int InOwnGroup(const std::function<int()>& body) {
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        setpgid(0, 0);
        for (int sig : {SIGUSR1, SIGHUP, SIGTERM, SIGRTMIN + 1}) signal(sig, SIG_DFL);
        sigset_t none;
        sigemptyset(&none);
        sigprocmask(SIG_SETMASK, &none, nullptr);
        alarm(10);
        _exit(body());
    }
    int status = Reap(pid);
    if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
    return WEXITSTATUS(status);
}

// A live child that is no daemon: it waits until release is closed, and the
// default action of every signal would end it.
pid_t IdleChild(int& release) {
    int fds[2];
    if (pipe(fds) != 0) return -1;
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        close(fds[1]);
        char c;
        ssize_t unused = read(fds[0], &c, 1);
        (void)unused;
        _exit(0);
    }
    close(fds[0]);
    release = fds[1];
    return pid;
}

class HostileStatus : public DaemonTest {
protected:
    void SetUp() override {
        DaemonTest::SetUp();
        ZEPA::Relay::g_statusSleep = NoSleep;
    }
    void TearDown() override {
        ZEPA::Relay::g_statusSleep = _realSleep;
        DaemonTest::TearDown();
    }
    void PlantStatus(const std::string& kind) const {
        ASSERT_TRUE(zepatest::PlantHostile(kind, root.path(STATUS))) << kind;
    }

private:
    void (*_realSleep)(unsigned int) = ZEPA::Relay::g_statusSleep;
};

TEST_F(HostileStatus, StatusFilesThatAreNoFilesAreBrokenWithoutBlocking) {
    for (const char* kind : {"fifo", "folder", "device", "huge", "nested"}) {
        SCOPED_TRACE(kind);
        PlantStatus(kind);
        EXPECT_EQ(255, InOwnGroup([] {
                      Json::Value out;
                      return Daemon::GetStatus(out);
                  }));
        EXPECT_EQ(255, InOwnGroup([] { return Daemon::UpdateAlias(); }));
        EXPECT_EQ(0, InOwnGroup([] {
                      std::string id, state, error;
                      return Daemon::GetStatus(id, state, error, nullptr) ? 1 : 0;
                  }));
    }
}

TEST_F(HostileStatus, PidsThatNameProcessGroupsAreNeverSignalled) {
    for (const std::string& pid : {std::string("0"), std::string("-1"), "-" + std::to_string(getpgrp())}) {
        SCOPED_TRACE(pid);
        root.write(STATUS, "{\"pid\": " + pid + ", \"serverID\": \"abc\"}");
        StartSyslogRecorder();
        // Each child's own group would receive a signal sent to pid 0.
        EXPECT_EQ(255, InOwnGroup([] { return Daemon::UpdateAlias(); }));
        EXPECT_EQ(255, InOwnGroup([] {
                      Json::Value out;
                      return Daemon::GetStatus(out);
                  }));
        EXPECT_EQ(255, Daemon::UpdateAlias());
        EXPECT_TRUE(SyslogHas(LOG_ERR, "bad zeparelayd status pid"));
    }
}

TEST_F(HostileStatus, APidRecycledAfterTheFileWasWrittenIsNotRunningAndGetsNoSignal) {
    // The file was last written an hour ago; the process that holds its pid
    // now started just now, so it cannot have written it.
    int release = -1;
    pid_t other = IdleChild(release);
    ASSERT_GT(other, 0);
    root.write(STATUS, "{\"pid\": " + std::to_string(other) + ", \"state\": 4}");
    zepatest::SetAge(root.path(STATUS), 3600);
    Json::Value out;
    EXPECT_EQ(1, Daemon::GetStatus(out));
    EXPECT_EQ(4, out["state"].asInt());
    EXPECT_EQ(1, Daemon::UpdateAlias());
    std::string id, state, error;
    EXPECT_TRUE(Daemon::GetStatus(id, state, error, nullptr));
    EXPECT_EQ("not_running", state);
    // Had SIGRTMIN+1 reached it, its default action would have ended it.
    close(release);
    int status = Reap(other);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
}

TEST_F(HostileStatus, TheWriterIsRunningWhateverItsName) {
    StandInDaemon daemon;
    root.write(STATUS, "{\"pid\": " + std::to_string(daemon.pid()) + "}");
    Json::Value out;
    EXPECT_EQ(0, Daemon::GetStatus(out));
    EXPECT_EQ(0, Daemon::UpdateAlias());
    EXPECT_EQ(SIGRTMIN + 1, daemon.NextSignal());
}

TEST_F(HostileStatus, StatusFilesOthersCouldHaveWrittenAreBrokenAndSignalNobody) {
    // A live process that any signal would end, named by files that another
    // user could have planted or changed.
    int release = -1;
    pid_t other = IdleChild(release);
    ASSERT_GT(other, 0);
    const std::string content = "{\"pid\": " + std::to_string(other) + ", \"serverID\": \"abc\"}";
    const std::string path = root.path(STATUS);
    struct Case {
        const char* what;
        std::function<void()> plant;
    };
    const std::vector<Case> cases = {
        {"group-writable", [&] { root.write(STATUS, content, 0664); }},
        {"world-writable", [&] { root.write(STATUS, content, 0646); }},
        {"link",
         [&] {
             root.write("/tmp/real-status", content);
             ASSERT_EQ(0, symlink(root.path("/tmp/real-status").c_str(), path.c_str()));
         }},
        {"second hard link",
         [&] {
             root.write(STATUS, content);
             ASSERT_EQ(0, link(path.c_str(), root.path("/tmp/other-name").c_str()));
         }},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.what);
        unlink(path.c_str());
        unlink(root.path("/tmp/other-name").c_str());
        c.plant();
        StartSyslogRecorder();
        Json::Value out;
        EXPECT_EQ(255, Daemon::GetStatus(out));
        EXPECT_EQ(255, Daemon::UpdateAlias());
        EXPECT_TRUE(SyslogHas(LOG_ERR, "bad zeparelayd status file"));
        std::string id, state, error;
        EXPECT_FALSE(Daemon::GetStatus(id, state, error, nullptr));
    }
    if (geteuid() == 0) {
        // Another user's file, even one no one else may write.
        root.write(STATUS, content);
        ASSERT_EQ(0, chown(path.c_str(), 65534, 65534));
        Json::Value out;
        EXPECT_EQ(255, Daemon::GetStatus(out));
        EXPECT_EQ(255, Daemon::UpdateAlias());
    }
    close(release);
    int status = Reap(other);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
}

TEST_F(HostileStatus, PidFileNamingZeroSignalsNobody) {
    zepatest::WriteFile(DefaultPidFile(), "0\n");
    EXPECT_EQ(255, InOwnGroup([] {
                  Json::Value out;
                  return Daemon::DebugStatus(out);
              }));
    EXPECT_EQ(2, InOwnGroup([] { return Daemon::LibInit() ? Daemon::Hup() : 3; }));
    EXPECT_EQ(2, InOwnGroup([] { return Daemon::LibInit() ? Daemon::Kill() : 3; }));
    EXPECT_EQ(2, InOwnGroup([] { return Daemon::LibInit() ? Daemon::Signal(SIGUSR1) : 3; }));
}

TEST_F(HostileStatus, PidFileNamingARecycledPidGetsNoDebugSignal) {
    int release = -1;
    pid_t other = IdleChild(release);
    ASSERT_GT(other, 0);
    WritePidFile(other);
    zepatest::SetAge(DefaultPidFile(), 3600);
    Json::Value out;
    EXPECT_EQ(1, Daemon::DebugStatus(out));
    close(release);
    int status = Reap(other);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
    EXPECT_FALSE(zepatest::FileExists(DebugFile(other)));
}

TEST_F(HostileStatus, LinkAtTheDebugFileNameCreatesNothingAtItsTarget) {
    StandInDaemon daemon(DumpMode::IGNORE);
    WritePidFile(daemon.pid());
    const std::string target = root.path("/etc/created-by-link");
    root.mkdir("/etc");
    ASSERT_EQ(0, symlink(target.c_str(), DebugFile(daemon.pid()).c_str()));
    Json::Value out;
    EXPECT_NE(0, Daemon::DebugStatus(out));
    EXPECT_FALSE(zepatest::FileExists(target));
    EXPECT_TRUE(out.isNull());
}

TEST_F(HostileStatus, DebugFilesThatAreNoFilesNeverBlockTheQuery) {
    for (const char* kind : {"fifo", "folder", "device"}) {
        SCOPED_TRACE(kind);
        StandInDaemon daemon(DumpMode::IGNORE);
        WritePidFile(daemon.pid());
        const std::string path = DebugFile(daemon.pid());
        if (std::string(kind) == "fifo") {
            ASSERT_EQ(0, mkfifo(path.c_str(), 0666));
        } else if (std::string(kind) == "folder") {
            zepatest::MakeDirs(path + "/inside");
        } else {
            ASSERT_EQ(0, symlink("/dev/zero", path.c_str()));
        }
        int code = InOwnGroup([] {
            Json::Value out;
            return Daemon::DebugStatus(out);
        });
        EXPECT_TRUE(code == 255 || code == 11) << code;
        daemon.Stop();
    }
}

TEST_F(HostileStatus, WhateverStandsAtTheDebugFileNameTheDaemonAnswers) {
    std::vector<std::string> kinds = {"link", "fifo", "folder", "second-link"};
    if (geteuid() == 0) {
        kinds.push_back("foreign-file");
        kinds.push_back("foreign-folder");
    }
    root.write("/etc/victim", "secret", 0600);
    for (const std::string& kind : kinds) {
        SCOPED_TRACE(kind);
        StandInDaemon daemon(DumpMode::ANSWER);
        WritePidFile(daemon.pid());
        const std::string path = DebugFile(daemon.pid());
        if (kind == "link") {
            ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), path.c_str()));
        } else {
            ASSERT_TRUE(zepatest::PlantHostile(kind, path));
        }
        StartSyslogRecorder();
        // Pauses long enough for the stand-in to answer on a busy machine.
        ZEPA::Relay::g_statusSleep = [](unsigned int) { usleep(10000); };
        Json::Value out;
        EXPECT_EQ(0, Daemon::DebugStatus(out));
        ZEPA::Relay::g_statusSleep = NoSleep;
        EXPECT_EQ(daemon.pid(), out["pid"].asInt());
        EXPECT_TRUE(SyslogHas(LOG_WARNING, "removed what stood at " + path));
        EXPECT_EQ("secret", root.read("/etc/victim"));
        EXPECT_FALSE(zepatest::FileExists(path));
        unlink((path + ".elsewhere").c_str());
        daemon.Stop();
    }
}

}  // namespace
