// The dump written by the SIGUSR1 handler, and its removal once no query
// collects it.
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/file.h>
#include <unistd.h>

#include <fcntl.h>
#include <fstream>
#include <sstream>
#include <string>

#include "debug_dump.h"

namespace {

class DebugDumpTest : public ::testing::Test {
protected:
    void SetUp() override {
        char dir[] = "/tmp/zepa_debug_dump_XXXXXX";
        ASSERT_NE(nullptr, mkdtemp(dir));
        root = dir;
        path = root + "/.zeparelayd.1.debug";
        ASSERT_TRUE(zeparelayd::InstallDebugDump(path));
        zeparelayd::TakeDumpWritten();
    }
    void TearDown() override {
        zeparelayd::RemoveDebugDump();
        signal(SIGUSR1, SIG_DFL);
        const std::string cmd = "rm -rf '" + root + "'";
        EXPECT_EQ(0, system(cmd.c_str()));
    }
    bool Exists() const { return access(path.c_str(), F_OK) == 0; }

    std::string root;
    std::string path;
};

TEST_F(DebugDumpTest, ADumpNobodyCollectsIsRemovedOnceOldAndUnlocked) {
    zeparelayd::PublishDebugDump("{\"state\": \"login\"}\n");
    EXPECT_FALSE(zeparelayd::TakeDumpWritten());
    ASSERT_EQ(0, raise(SIGUSR1));
    ASSERT_TRUE(Exists());
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    EXPECT_EQ("{\"state\": \"login\"}\n", text.str());
    EXPECT_TRUE(zeparelayd::TakeDumpWritten());
    EXPECT_FALSE(zeparelayd::TakeDumpWritten());

    // Too young: a query may still be reading it.
    EXPECT_EQ(1, zeparelayd::RemoveGivenUpDump(path, 60000));
    EXPECT_TRUE(Exists());
    // A query holds its lock: it deletes the file itself.
    const int fd = open(path.c_str(), O_RDONLY);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(0, flock(fd, LOCK_EX));
    EXPECT_EQ(1, zeparelayd::RemoveGivenUpDump(path, 0));
    EXPECT_TRUE(Exists());
    close(fd);
    EXPECT_EQ(0, zeparelayd::RemoveGivenUpDump(path, 0));
    EXPECT_FALSE(Exists());
    EXPECT_EQ(0, zeparelayd::RemoveGivenUpDump(path, 0));
}

TEST_F(DebugDumpTest, ALinkAtTheNameIsLeftAlone) {
    const std::string target = root + "/target";
    std::ofstream(target) << "keep";
    ASSERT_EQ(0, symlink(target.c_str(), path.c_str()));
    EXPECT_EQ(-1, zeparelayd::RemoveGivenUpDump(path, 0));
    EXPECT_EQ(0, access(path.c_str(), F_OK));
    EXPECT_EQ(0, access(target.c_str(), F_OK));
}

}  // namespace
