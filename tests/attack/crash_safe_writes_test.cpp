// Writers killed at random moments, writers racing for one file, and the
// order of the calls that make a write survive a power loss.
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>

#include "support/test_support.h"

using namespace ZEPA::Relay;

namespace {

class CrashSafeWrites : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        root.mkdir("/conf");
        path = root.path("/conf/zeparelayd.conf");
        Daemon::_logLevel = 2;
    }
    std::string path;
};

// The figure printed for the report and the runs by hand: ZEPA_KILLS sets
// the number of killed writers (200 by default, to keep the suite quick).
int Kills() {
    const char* env = getenv("ZEPA_KILLS");
    return env != nullptr && atoi(env) > 0 ? atoi(env) : 200;
}

TEST_F(CrashSafeWrites, WritersKilledAtRandomLeaveAWholeFileAndNoTemporaries) {
    // Large values make each write take long enough to be hit midway.
    const std::string filler(64 * 1024, 'f');
    {
        RelaydConf conf(nullptr);
        ASSERT_TRUE(conf.WriteAliasName(path, "start"));
    }
    std::mt19937 rng(4242);
    int torn = 0;
    int maxLeft = 0;
    const int kills = Kills();
    for (int round = 0; round < kills; ++round) {
        fflush(nullptr);
        pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            RelaydConf conf(nullptr);
            for (int i = 0;; ++i)
                conf.WriteAliasName(path, std::to_string(round) + "-" + std::to_string(i) + filler);
        }
        usleep(rng() % 3000);
        kill(child, SIGKILL);
        int status = 0;
        waitpid(child, &status, 0);
        ASSERT_TRUE(WIFSIGNALED(status));

        std::ifstream in(path);
        std::stringstream text;
        text << in.rdbuf();
        Json::Value value = zepatest::ParseJson(text.str());
        if (!value.isObject() || !value["server_alias"]["alias"].isString()) ++torn;
        const int left = static_cast<int>(zepatest::TemporariesOf(path).size());
        if (left > maxLeft) maxLeft = left;
    }
    // Every writer removes what dead writers left, so at most the last
    // killed writer's temporary file (one) stands before the next write.
    const int leftBeforeNextWrite = static_cast<int>(zepatest::TemporariesOf(path).size());
    RelaydConf conf(nullptr);
    ASSERT_TRUE(conf.WriteAliasName(path, "after"));
    const int leftAfterNextWrite = static_cast<int>(zepatest::TemporariesOf(path).size());
    printf(
        "killed writers: %d, torn files: %d, most temporaries at once: %d, left after the next write: %d\n",
        kills, torn, maxLeft, leftAfterNextWrite);
    EXPECT_EQ(0, torn);
    EXPECT_LE(maxLeft, 1);
    EXPECT_LE(leftBeforeNextWrite, 1);
    EXPECT_EQ(0, leftAfterNextWrite);
    EXPECT_EQ("after", zepatest::ParseJson(zepatest::ReadFile(path))["server_alias"]["alias"].asString());
}

// Each of two processes changes its own field 500 times. Between its writes
// nobody else writes that field, so finding another value than its last one
// means the other process wrote back an old copy: a lost update.
TEST_F(CrashSafeWrites, TwoProcessesChangingDifferentFieldsLoseNothing) {
    const int writes = 500;
    {
        RelaydConf conf(nullptr);
        ASSERT_TRUE(conf.WriteServerId(path));
    }
    auto writer = [&](bool alias) {
        RelaydConf conf(nullptr);
        int lost = 0;
        std::string last;
        for (int i = 0; i < writes; ++i) {
            if (!last.empty()) {
                Json::Value file = zepatest::ParseJson(zepatest::ReadFile(path));
                std::string now = alias ? file["server_alias"]["alias"].asString()
                                        : file["server_myhub"]["account"].asString();
                if (now != last) ++lost;
            }
            last = (alias ? "alias-" : "account-") + std::to_string(i);
            bool ok = alias ? conf.WriteAliasName(path, last) : conf.WriteMyHubAccount(path, last);
            if (!ok) return 101;
        }
        return lost > 100 ? 100 : lost;
    };
    fflush(nullptr);
    pid_t a = fork();
    if (a == 0) _exit(writer(true));
    pid_t b = fork();
    if (b == 0) _exit(writer(false));
    int statusA = 0, statusB = 0;
    waitpid(a, &statusA, 0);
    waitpid(b, &statusB, 0);
    ASSERT_TRUE(WIFEXITED(statusA) && WIFEXITED(statusB));
    printf("lost updates: alias writer %d, account writer %d\n", WEXITSTATUS(statusA), WEXITSTATUS(statusB));
    EXPECT_EQ(0, WEXITSTATUS(statusA));
    EXPECT_EQ(0, WEXITSTATUS(statusB));
    Json::Value file = zepatest::ParseJson(zepatest::ReadFile(path));
    EXPECT_EQ("alias-" + std::to_string(writes - 1), file["server_alias"]["alias"].asString());
    EXPECT_EQ("account-" + std::to_string(writes - 1), file["server_myhub"]["account"].asString());
    EXPECT_TRUE(zepatest::TemporariesOf(path).empty());
    // The lock file stays beside the configuration, readable by root alone.
    EXPECT_EQ(0600u, zepatest::FileMode(path + ".lock"));
}

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) lines.push_back(line);
    return lines;
}

// A recorder preloaded into a program that writes through the library sees
// the temporary file synced, then renamed onto the target, then the folder
// synced.
TEST_F(CrashSafeWrites, FileIsSyncedBeforeTheRenameAndTheFolderAfter) {
    const std::string log = root.path("/sync.log");
    const std::string folder = root.path("/conf");
    std::string command = "ZEPA_SYNC_LOG='" + log + "' LD_PRELOAD='" ZEPA_SYNC_RECORDER "' " +
                          "ASAN_OPTIONS=\"$ASAN_OPTIONS:verify_asan_link_order=0\" '" ZEPA_JSON_WRITER "' '" +
                          path + "' durable";
    ASSERT_EQ(0, system(command.c_str()));
    EXPECT_EQ("durable", zepatest::ParseJson(zepatest::ReadFile(path))["value"].asString());
    std::vector<std::string> lines = Lines(zepatest::ReadFile(log));
    ASSERT_EQ(3u, lines.size()) << zepatest::ReadFile(log);
    const std::string tmpPrefix = path + ".tmp.";
    EXPECT_EQ(0u, lines[0].find("fsync " + tmpPrefix)) << lines[0];
    const std::string tmp = lines[0].substr(std::string("fsync ").size());
    EXPECT_EQ("rename " + tmp + " " + path + " 0", lines[1]);
    EXPECT_EQ("fsync " + folder, lines[2]);
}

}  // namespace
