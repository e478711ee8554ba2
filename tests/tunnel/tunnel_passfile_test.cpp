// The pass file: its layout, its mode before the secret, its failures, and
// the user names that must never place it outside the temporary folder.
#include <errno.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <zeparelayd/daemon.h>
#include <zeparelayd/tunnel.h>

#include "support/seams.h"
#include "tunnel_fixture.h"

using namespace ZEPA::Relay;
using namespace tunneltest;

namespace {

// What the recording file calls saw, in order.
std::vector<std::string> g_calls;
int g_openedFd = -1;
int g_failFchmod = 0;
int g_failWrite = 0;

int RecordOpen(const char* path, int flags, mode_t mode) {
    g_openedFd = open(path, flags, mode);
    g_calls.push_back("open");
    return g_openedFd;
}

int RecordFchmod(int fd, mode_t mode) {
    g_calls.push_back(std::string("fchmod ") + (fd == g_openedFd ? "same-fd " : "other-fd ") +
                      std::to_string(mode));
    if (g_failFchmod) {
        errno = g_failFchmod;
        return -1;
    }
    return fchmod(fd, mode);
}

ssize_t RecordWrite(int fd, const void* buf, size_t count) {
    struct stat st;
    fstat(fd, &st);
    g_calls.push_back(std::string("write ") + (fd == g_openedFd ? "same-fd " : "other-fd ") + "mode " +
                      std::to_string(st.st_mode & 07777) + " size-before " + std::to_string(st.st_size));
    if (g_failWrite) {
        errno = g_failWrite;
        return -1;
    }
    return write(fd, buf, count);
}

class TunnelPassFile : public TunnelTest {
protected:
    void SetUp() override {
        TunnelTest::SetUp();
        saved = g_tunnelFileOps;
        g_calls.clear();
        g_failFchmod = g_failWrite = 0;
    }
    void TearDown() override {
        g_tunnelFileOps = saved;
        TunnelTest::TearDown();
    }
    void Record() { g_tunnelFileOps = {RecordOpen, RecordFchmod, RecordWrite}; }
    TunnelFileOps saved;
};

TEST_F(TunnelPassFile, TwoLinesWithoutTrailingNewline) {
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.WritePassFile(PassPath()));
    EXPECT_EQ("relayuser\ns3cret-pass", zepatest::ReadFile(PassPath()));
    EXPECT_EQ(0600u, zepatest::FileMode(PassPath()));
}

TEST_F(TunnelPassFile, ModeIsNarrowedOnTheOpenFileBeforeAnyByte) {
    // A leftover file keeps its wide mode through open; only fchmod narrows it.
    root.write("/tmp/.tunnel.relayuser", "leftover", 0666);
    Record();
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.WritePassFile(PassPath()));

    // The leftover is replaced by a file created anew: the last open makes
    // the descriptor that is narrowed and then written.
    ASSERT_GE(g_calls.size(), 3u);
    const size_t n = g_calls.size();
    EXPECT_EQ("open", g_calls[n - 3]);
    EXPECT_EQ("fchmod same-fd 384", g_calls[n - 2]);  // 0600
    EXPECT_EQ("write same-fd mode 384 size-before 0", g_calls[n - 1]);
    EXPECT_EQ(0600u, zepatest::FileMode(PassPath()));
    EXPECT_EQ("relayuser\ns3cret-pass", zepatest::ReadFile(PassPath()));
}

TEST_F(TunnelPassFile, FailedChmodWritesNothingAndRemovesTheFile) {
    Record();
    g_failFchmod = EPERM;
    Tunnel tunnel = MakeTunnel();
    zepatest::StderrCapture capture;
    EXPECT_FALSE(tunnel.WritePassFile(PassPath()));
    const std::string log = capture.stop();

    EXPECT_TRUE(zepatest::LogContains(log, "chmod [" + PassPath() + "] failed, Operation not permitted"))
        << log;
    EXPECT_EQ(2u, g_calls.size());
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelPassFile, FailedWriteRemovesTheFile) {
    Record();
    g_failWrite = ENOSPC;
    Tunnel tunnel = MakeTunnel();
    zepatest::StderrCapture capture;
    EXPECT_FALSE(tunnel.WritePassFile(PassPath()));
    const std::string log = capture.stop();

    EXPECT_TRUE(zepatest::LogContains(log, "write pass failed, No space left on device")) << log;
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
    EXPECT_EQ(std::string::npos, log.find("s3cret-pass"));
}

TEST_F(TunnelPassFile, FailedWriteStartsNoChild) {
    Record();
    g_failWrite = EIO;
    Tunnel tunnel = MakeTunnel();
    EXPECT_FALSE(tunnel.Create(true));
    EXPECT_FALSE(Called(1));
    EXPECT_TRUE(ShellCommands().empty());
    EXPECT_EQ(TUNNEL_STATUS_FAILED, tunnel.GetStatus());
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

TEST_F(TunnelPassFile, LongContentIsCutAt1023Bytes) {
    Tunnel tunnel = MakeTunnel();
    tunnel.relay_pass = std::string(2000, 'p');
    ASSERT_TRUE(tunnel.WritePassFile(PassPath()));
    const std::string content = zepatest::ReadFile(PassPath());
    EXPECT_EQ(1023u, content.size());
    EXPECT_EQ(0u, content.find("relayuser\npppp"));
}

TEST_F(TunnelPassFile, PlantedLinkIsRemovedNotWrittenThrough) {
    root.write("/etc/victim", "keep me", 0644);
    ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), PassPath().c_str()));
    Tunnel tunnel = MakeTunnel();
    zepatest::StderrCapture capture;
    EXPECT_TRUE(tunnel.WritePassFile(PassPath()));
    const std::string log = capture.stop();

    EXPECT_EQ("keep me", root.read("/etc/victim"));
    EXPECT_EQ(0644u, zepatest::FileMode(root.path("/etc/victim")));
    EXPECT_TRUE(zepatest::LogContains(log, "removed what stood at " + PassPath())) << log;
    struct stat st;
    ASSERT_EQ(0, lstat(PassPath().c_str(), &st));
    EXPECT_TRUE(S_ISREG(st.st_mode));
    EXPECT_EQ("relayuser\ns3cret-pass", zepatest::ReadFile(PassPath()));
}

TEST_F(TunnelPassFile, UnsafeUserNameIsRefusedBeforeAnyFile) {
    root.mkdir("/etc");
    for (const char* user : {"../etc/evil", "../../../../../../tmp/x", "a/b", "..", "x\ny"}) {
        Tunnel tunnel = MakeTunnel(user);
        zepatest::StderrCapture capture;
        EXPECT_FALSE(tunnel.RunVPNTunnel("tcp")) << user;
        EXPECT_FALSE(tunnel.Create(true)) << user;
        const std::string log = capture.stop();
        EXPECT_TRUE(zepatest::LogContains(log, "unsafe tunnel user name refused")) << user;
        EXPECT_EQ(-1, tunnel.pid);
    }
    EXPECT_FALSE(root.exists("/etc/evil"));
    EXPECT_FALSE(zepatest::FileExists(root.path("/tmp/.tunnel.a")));
    EXPECT_FALSE(Called(1));
    EXPECT_TRUE(ShellCommands().empty());
}

TEST_F(TunnelPassFile, SectionWithoutPasswordStartsNothing) {
    Tunnel tunnel(zepatest::ParseJson(R"({"relay_ip":"192.0.2.10","relay_user":"relayuser"})"));
    Daemon::_logLevel = 7;
    zepatest::StderrCapture capture;
    EXPECT_FALSE(tunnel.Create(true));
    const std::string log = capture.stop();

    EXPECT_TRUE(zepatest::LogContains(log, "invalid tunnel server info")) << log;
    EXPECT_EQ(TUNNEL_STATUS_NONE, tunnel.GetStatus());
    EXPECT_EQ(-1, tunnel.pid);
    EXPECT_FALSE(Called(1));
    EXPECT_TRUE(ShellCommands().empty());
    EXPECT_FALSE(zepatest::FileExists(PassPath()));
}

}  // namespace

// A file pre-created under the pass file's name with a second hard link of
// the planter's: the secret must never reach the planter's link.
TEST_F(TunnelPassFile, PlantedHardLinkNeverReceivesTheSecret) {
    root.write("/tmp/planted", "", 0666);
    ASSERT_EQ(0, link(root.path("/tmp/planted").c_str(), PassPath().c_str()));
    Tunnel tunnel = MakeTunnel();
    zepatest::StderrCapture capture;
    EXPECT_TRUE(tunnel.WritePassFile(PassPath()));
    const std::string log = capture.stop();
    EXPECT_EQ("", root.read("/tmp/planted"));
    EXPECT_EQ("relayuser\ns3cret-pass", zepatest::ReadFile(PassPath()));
    EXPECT_TRUE(zepatest::LogContains(log, "removed what stood at " + PassPath())) << log;
}

TEST_F(TunnelPassFile, FolderOrFifoAtTheNameIsRemoved) {
    for (const char* kind : {"folder", "fifo"}) {
        SCOPED_TRACE(kind);
        ASSERT_TRUE(zepatest::PlantHostile(kind, PassPath()));
        Tunnel tunnel = MakeTunnel();
        zepatest::StderrCapture capture;
        EXPECT_TRUE(tunnel.WritePassFile(PassPath()));
        const std::string log = capture.stop();
        EXPECT_EQ("relayuser\ns3cret-pass", zepatest::ReadFile(PassPath()));
        EXPECT_EQ(0600u, zepatest::FileMode(PassPath()));
        EXPECT_TRUE(zepatest::LogContains(log, "removed what stood at " + PassPath())) << log;
        unlink(PassPath().c_str());
    }
}

// A pass file of our own left by an earlier start is replaced by a new one.
TEST_F(TunnelPassFile, OwnLeftoverIsReplacedWithTheNewSecret) {
    zepatest::WriteFile(PassPath(), "old\nsecret", 0644);
    struct stat before;
    ASSERT_EQ(0, stat(PassPath().c_str(), &before));
    Tunnel tunnel = MakeTunnel();
    ASSERT_TRUE(tunnel.WritePassFile(PassPath()));
    EXPECT_EQ("relayuser\ns3cret-pass", zepatest::ReadFile(PassPath()));
    EXPECT_EQ(0600u, zepatest::FileMode(PassPath()));
}

// Run as root: a file or folder of another user at the name is removed and
// the pass file made anew.
TEST_F(TunnelPassFile, AnotherUsersFileOrFolderIsRemoved) {
    if (geteuid() != 0) GTEST_SKIP() << "needs root to give a file to another user";
    for (const char* kind : {"foreign-file", "foreign-folder"}) {
        SCOPED_TRACE(kind);
        ASSERT_TRUE(zepatest::PlantHostile(kind, PassPath()));
        Tunnel tunnel = MakeTunnel();
        zepatest::StderrCapture capture;
        EXPECT_TRUE(tunnel.WritePassFile(PassPath()));
        capture.stop();
        struct stat st;
        ASSERT_EQ(0, lstat(PassPath().c_str(), &st));
        EXPECT_TRUE(S_ISREG(st.st_mode));
        EXPECT_EQ(0u, st.st_uid);
        EXPECT_EQ("relayuser\ns3cret-pass", zepatest::ReadFile(PassPath()));
        unlink(PassPath().c_str());
    }
}
