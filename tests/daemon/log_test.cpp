#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include <zeparelayd/daemon.h>

#include "support/seams.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::FileMode;
using zepatest::LogMessages;
using zepatest::ReadFile;
using zepatest::RootTest;
using zepatest::StderrCapture;

namespace {

class LogTest : public RootTest {};

char* FailingCtime(const time_t*, char*) { return nullptr; }

TEST_F(LogTest, InitialLevelWritesErrorsAndWarningsOnly) {
    EXPECT_EQ(4, Daemon::_logLevel);
    StderrCapture cap;
    errno = 42;
    Daemon::Log(5, "%s:%d notice %d", "test", 1, 5);
    EXPECT_EQ(42, errno);
    Daemon::Log(4, "%s:%d warning", "test", 2);
    Daemon::Log(3, "%s:%d error", "test", 3);
    Daemon::Log(7, "%s:%d debug", "test", 4);
    auto lines = LogMessages(cap.stop());
    ASSERT_EQ(2u, lines.size());
    EXPECT_EQ("test:2 warning", lines[0]);
    EXPECT_EQ("test:3 error", lines[1]);
}

TEST_F(LogTest, LineIsCtimeStampBlankAndMessage) {
    StderrCapture cap;
    time_t before = time(nullptr);
    Daemon::Log(3, "%s:%d hello [%s]", "config", 17, "x");
    time_t after = time(nullptr);
    std::string out = cap.stop();
    ASSERT_EQ(24u + 1u + 19u + 1u, out.size()) << out;
    std::string stamp = out.substr(0, 24);
    bool matches = false;
    for (time_t t = before; t <= after; ++t) {
        char expect[32] = {};
        ctime_r(&t, expect);
        matches = matches || stamp == std::string(expect, 24);
    }
    EXPECT_TRUE(matches) << stamp;
    EXPECT_EQ(" config:17 hello [x]\n", out.substr(24));
}

TEST_F(LogTest, WritingPreservesErrno) {
    StderrCapture cap;
    errno = EACCES;
    Daemon::Log(3, "%s:%d %m", "t", 1);
    EXPECT_EQ(EACCES, errno);
    EXPECT_NE(std::string::npos, cap.stop().find("Permission denied"));
}

TEST_F(LogTest, FailedTimeConversionLeavesMessageAlone) {
    g_logCtime = FailingCtime;
    StderrCapture cap;
    Daemon::Log(3, "%s:%d plain", "t", 9);
    EXPECT_EQ("t:9 plain\n", cap.stop());
    g_logCtime = ctime_r;
}

TEST_F(LogTest, TrailingNewlineGivesEmptyLine) {
    g_logCtime = FailingCtime;
    StderrCapture cap;
    Daemon::Log(3, "two\n");
    EXPECT_EQ("two\n\n", cap.stop());
    g_logCtime = ctime_r;
}

TEST_F(LogTest, LevelZeroSilencesEverything) {
    EXPECT_TRUE(Daemon::SetLogFile("", 0));
    EXPECT_EQ(0, Daemon::_logLevel);
    StderrCapture cap;
    Daemon::Log(3, "error");
    EXPECT_EQ("", cap.stop());
    EXPECT_FALSE(Daemon::IsLogEnable(1));
    EXPECT_TRUE(Daemon::IsLogEnable(0));
}

TEST_F(LogTest, SetLogFileBeforeDaemonisingOnlyRecords) {
    Daemon::_strLogFile = "/somewhere.log";
    StderrCapture cap;
    EXPECT_TRUE(Daemon::SetLogFile("", -1));
    EXPECT_EQ(4, Daemon::_logLevel);
    EXPECT_EQ("", Daemon::_strLogFile);
    EXPECT_TRUE(Daemon::SetLogFile(root.path("/var/log/r.log"), 7));
    EXPECT_EQ(7, Daemon::_logLevel);
    EXPECT_EQ(root.path("/var/log/r.log"), Daemon::_strLogFile);
    EXPECT_EQ("", cap.stop());
    EXPECT_FALSE(root.exists("/var/log/r.log"));
    EXPECT_FALSE(root.exists("/var/log/zeparelayd.log"));
}

TEST_F(LogTest, SettingAnyLevelPrintsNothing) {
    for (int level : {0, 3, 4, 5, 6, 7}) {
        StderrCapture cap;
        EXPECT_TRUE(Daemon::SetLogFile("", level));
        EXPECT_EQ("", cap.stop()) << level;
        EXPECT_EQ(level, Daemon::_logLevel);
    }
}

TEST_F(LogTest, OpenLogFileInMissingDirectoryKeepsStderr) {
    std::string path = root.path("/no/dir/x.log");
    StderrCapture cap;
    EXPECT_FALSE(Daemon::OpenLogFile(path, 2, O_CREAT | O_APPEND));
    Daemon::Log(3, "%s:%d still here", "t", 1);
    auto lines = LogMessages(cap.stop());
    ASSERT_EQ(2u, lines.size());
    EXPECT_EQ("daemon:", lines[0].substr(0, 7));
    EXPECT_NE(std::string::npos, lines[0].find(" open log file [" + path + "] failed"));
    EXPECT_EQ("t:1 still here", lines[1]);
}

TEST_F(LogTest, OpenLogFileRedirectsDescriptorAndCreatesWith0600) {
    root.mkdir("/var/log");
    std::string path = root.path("/var/log/a.log");
    umask(0);
    int target = dup(1);
    ASSERT_TRUE(Daemon::OpenLogFile(path, target, O_CREAT | O_APPEND));
    ASSERT_EQ(4, write(target, "abc\n", 4));
    close(target);
    EXPECT_EQ("abc\n", ReadFile(path));
    EXPECT_EQ(0600u, FileMode(path));
    chmod(path.c_str(), 0640);
    target = dup(1);
    ASSERT_TRUE(Daemon::OpenLogFile(path, target, O_CREAT | O_APPEND));
    close(target);
    EXPECT_EQ(0640u, FileMode(path));  // an existing file keeps its mode
    EXPECT_EQ("abc\n", ReadFile(path));
}

TEST_F(LogTest, TruncateAndAppendFlagsDiffer) {
    root.write("/var/log/b.log", "earlier\n");
    std::string path = root.path("/var/log/b.log");
    int fd = dup(1);
    ASSERT_TRUE(Daemon::OpenLogFile(path, fd, O_CREAT | O_APPEND));
    ASSERT_EQ(4, write(fd, "new\n", 4));
    close(fd);
    EXPECT_EQ("earlier\nnew\n", ReadFile(path));
    fd = dup(1);
    ASSERT_TRUE(Daemon::OpenLogFile(path, fd, O_CREAT | O_TRUNC));
    close(fd);
    EXPECT_EQ("", ReadFile(path));
}

// Where the log should be: a link, a FIFO, a folder, a second name of some
// file. None is opened, truncated or blocked on; the target descriptor and
// whatever the link names stay as they were.
TEST_F(LogTest, OpenLogFileRefusesAnythingButAPlainFile) {
    root.write("/etc/victim", "secret\n", 0600);
    const std::string path = root.path("/var/log/planted.log");
    root.mkdir("/var/log");
    for (const char* kind : {"link", "fifo", "folder", "second-link"}) {
        SCOPED_TRACE(kind);
        zepatest::RemoveWithBad(path);
        if (std::string(kind) == "link") {
            ASSERT_EQ(0, symlink(root.path("/etc/victim").c_str(), path.c_str()));
        } else if (std::string(kind) == "second-link") {
            ASSERT_EQ(0, link(root.path("/etc/victim").c_str(), path.c_str()));
        } else {
            ASSERT_TRUE(zepatest::PlantHostile(kind, path));
        }
        for (int flags : {O_CREAT | O_TRUNC, O_CREAT | O_APPEND}) {
            pid_t child = fork();
            if (child == 0) {
                alarm(10);  // a FIFO that blocked the open would end here
                int target = dup(1);
                _exit(Daemon::OpenLogFile(path, target, flags) ? 1 : 0);
            }
            int status = 0;
            waitpid(child, &status, 0);
            ASSERT_TRUE(WIFEXITED(status)) << "the open blocked or crashed";
            EXPECT_EQ(0, WEXITSTATUS(status));
        }
        EXPECT_EQ("secret\n", zepatest::ReadFile(root.path("/etc/victim")));
    }
    zepatest::RemoveWithBad(path);
}

// Runs body in a child whose standard error is a pipe; returns what the child
// wrote there and its exit status.
template <typename F>
int InChild(F body) {
    pid_t pid = fork();
    if (pid == 0) {
        body();
        _exit(0);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

TEST_F(LogTest, SetLogFileAfterDaemonisingAppendsToDefaultFile) {
    root.write("/var/log/zeparelayd.log", "earlier line\n");
    int status = InChild([] {
        Daemon::_isForked = true;
        Daemon::SetLogFile("", -1);
        Daemon::Log(3, "%s:%d after", "t", 5);
        _exit(Daemon::_strLogFile.empty() ? 0 : 1);
    });
    EXPECT_EQ(0, status);
    std::string text = root.read("/var/log/zeparelayd.log");
    EXPECT_EQ(0u, text.find("earlier line\n"));
    auto lines = LogMessages(text);
    ASSERT_EQ(2u, lines.size());
    EXPECT_EQ("t:5 after", lines[1]);
}

TEST_F(LogTest, SetLogFileAfterDaemonisingUsesChosenFile) {
    std::string path = root.path("/var/log/chosen.log");
    root.mkdir("/var/log");
    int status = InChild([path] {
        Daemon::_isForked = true;
        Daemon::SetLogFile(path, 6);
        Daemon::Log(6, "%s:%d info now written", "t", 1);
        Daemon::Log(7, "%s:%d debug not", "t", 2);
    });
    EXPECT_EQ(0, status);
    auto lines = LogMessages(ReadFile(path));
    ASSERT_EQ(1u, lines.size());
    EXPECT_EQ("t:1 info now written", lines[0]);
    EXPECT_FALSE(root.exists("/var/log/zeparelayd.log"));
}

}  // namespace
