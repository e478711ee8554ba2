// Daemon::ProbeFilePid: whether the pid a status or PID file names is the
// live process that wrote the file.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

#include <zeparelayd/daemon.h>

#include "daemon_fixture.h"

using ZEPA::Relay::Daemon;
using namespace daemontest;

namespace {

class Liveness : public DaemonTest {
protected:
    std::string File() const { return root.path("/tmp/probe.pid"); }
    void Write(pid_t pid, mode_t mode = 0644) const {
        root.write("/tmp/probe.pid", std::to_string(pid), mode);
    }
};

TEST_F(Liveness, PidsOfZeroAndBelowAreNeverProbed) {
    Write(getpid());
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), 0));
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), -1));
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), -getpgrp()));
}

TEST_F(Liveness, NoFileIsNotRunning) { EXPECT_EQ(1, Daemon::ProbeFilePid(File(), getpid())); }

TEST_F(Liveness, AWriterThatWroteRightAfterItStartedIsAlive) {
    StandInDaemon daemon;
    Write(daemon.pid());
    EXPECT_EQ(0, Daemon::ProbeFilePid(File(), daemon.pid()));
    EXPECT_TRUE(daemon.NothingReported());
}

TEST_F(Liveness, AWriterThatStartedLongBeforeItsFileIsAlive) {
    // This test process started before the file was written.
    Write(getpid());
    EXPECT_EQ(0, Daemon::ProbeFilePid(File(), getpid()));
}

TEST_F(Liveness, AnEndedWriterIsNotRunning) {
    StandInDaemon gone;
    const pid_t pid = gone.pid();
    Write(pid);
    gone.Stop();
    EXPECT_EQ(1, Daemon::ProbeFilePid(File(), pid));
}

TEST_F(Liveness, AProcessStartedAfterTheFileWasWrittenHasARecycledPid) {
    StandInDaemon later;
    Write(later.pid());
    ASSERT_TRUE(zepatest::SetAge(File(), 3600));
    EXPECT_EQ(1, Daemon::ProbeFilePid(File(), later.pid()));
    // Written again, the file is the process's own once more.
    Write(later.pid());
    EXPECT_EQ(0, Daemon::ProbeFilePid(File(), later.pid()));
}

TEST_F(Liveness, FilesOthersCouldHaveWrittenAreNotTrusted) {
    Write(getpid(), 0664);
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), getpid()));
    Write(getpid(), 0606);
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), getpid()));
    Write(getpid(), 0600);
    EXPECT_EQ(0, Daemon::ProbeFilePid(File(), getpid()));
    Write(getpid(), 0444);
    EXPECT_EQ(0, Daemon::ProbeFilePid(File(), getpid()));
}

TEST_F(Liveness, LinksFoldersAndFifosAreNotTrusted) {
    root.write("/tmp/real.pid", std::to_string(getpid()));
    ASSERT_EQ(0, symlink(root.path("/tmp/real.pid").c_str(), File().c_str()));
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), getpid()));
    unlink(File().c_str());
    // A second name of the same file: whoever made it may change the file.
    ASSERT_EQ(0, link(root.path("/tmp/real.pid").c_str(), File().c_str()));
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), getpid()));
    unlink(root.path("/tmp/real.pid").c_str());
    EXPECT_EQ(0, Daemon::ProbeFilePid(File(), getpid()));
    unlink(File().c_str());
    ASSERT_EQ(0, mkfifo(File().c_str(), 0644));
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), getpid()));
    unlink(File().c_str());
    root.mkdir("/tmp/probe.pid");
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), getpid()));
}

TEST_F(Liveness, AnotherUsersFileIsNotTrustedButRootsIs) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to give the file to another user";
    Write(getpid());
    ASSERT_EQ(0, chown(File().c_str(), 65534, 65534));
    EXPECT_EQ(255, Daemon::ProbeFilePid(File(), getpid()));
    ASSERT_EQ(0, chown(File().c_str(), 0, 0));
    EXPECT_EQ(0, Daemon::ProbeFilePid(File(), getpid()));
}

TEST_F(Liveness, AProcessTheCallerMayNotSignalIsNotRunning) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to probe as another user";
    // root's file naming root's process, probed by an unprivileged caller:
    // the signal fails with EPERM.
    Write(getpid());
    // The unprivileged caller must reach the file, or the test proves nothing.
    ASSERT_EQ(0, chmod(root.dir().c_str(), 0755));
    ASSERT_EQ(0, chmod(root.path("/tmp").c_str(), 0755));
    const std::string file = File();
    const pid_t target = getpid();
    const int status = RunInChild([&] {
        if (setgid(65534) != 0 || setuid(65534) != 0) return 10;
        struct stat st;
        if (lstat(file.c_str(), &st) != 0) return 11;
        return Daemon::ProbeFilePid(file, target);
    });
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(1, WEXITSTATUS(status));
}

}  // namespace
