#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstring>
#include <string>

#include <zeparelayd/daemon.h>

#include "daemon_fixture.h"

using namespace daemontest;

namespace {

const char CONF[] = "/usr/zepa/etc/zeparelayd/zeparelayd.conf";

class EntryPointTest : public DaemonTest {
protected:
    std::string Conf() const { return root.path(CONF); }
    void WriteConf(const std::string& text) const { root.write(CONF, text); }
    Json::Value ReadConf() const { return zepatest::ParseJson(root.read(CONF)); }
    // Makes the next write fail: a file size limit of one byte (root is
    // bound by it too) stops the temporary file's content; undone in TearDown.
    void BlockTheWrite() {
        getrlimit(RLIMIT_FSIZE, &_savedLimit);
        _limited = true;
        signal(SIGXFSZ, SIG_IGN);
        struct rlimit one = {1, _savedLimit.rlim_max};
        setrlimit(RLIMIT_FSIZE, &one);
    }
    void TearDown() override {
        if (_limited) setrlimit(RLIMIT_FSIZE, &_savedLimit);
        signal(SIGXFSZ, SIG_DFL);
        DaemonTest::TearDown();
    }

private:
    struct rlimit _savedLimit = {};
    bool _limited = false;
};

// ---- VLIBRelaydLogStart ----------------------------------------------------

TEST_F(EntryPointTest, LogStartSetsDebugLevelAndFileAndKeepsTheRest) {
    WriteConf("{\"serverID\": \"abc\", \"log_level\": 3, \"log_file\": \"/old.log\"}");
    zepatest::StderrCapture capture;
    EXPECT_EQ(0, VLIBRelaydLogStart("/var/log/debug.log"));
    // No daemon runs: Hup says so on stderr, and the result stays 0.
    EXPECT_EQ("zeparelayd not running\n", capture.stop());
    Json::Value conf = ReadConf();
    EXPECT_EQ(7, conf["log_level"].asInt());
    EXPECT_EQ("/var/log/debug.log", conf["log_file"].asString());
    EXPECT_EQ("abc", conf["serverID"].asString());
}

TEST_F(EntryPointTest, LogStartAsksTheRunningDaemonToReload) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    WriteConf("{}");
    EXPECT_EQ(0, VLIBRelaydLogStart("/x.log"));
    EXPECT_EQ(SIGHUP, daemon.NextSignal());
}

TEST_F(EntryPointTest, LogStartWithNullPathLeavesTheFileUntouched) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    WriteConf("{\"log_level\": 3}");
    EXPECT_EQ(-1, VLIBRelaydLogStart(nullptr));
    EXPECT_EQ("{\"log_level\": 3}", root.read(CONF));
    EXPECT_TRUE(daemon.NothingReported());
}

TEST_F(EntryPointTest, LogStartWithMissingFileFailsAndCreatesNothing) {
    EXPECT_EQ(-1, VLIBRelaydLogStart("/x.log"));
    EXPECT_FALSE(root.exists(CONF));
}

TEST_F(EntryPointTest, LogStartOnEmptyCorruptOrNonObjectFilesFails) {
    WriteConf("");
    EXPECT_EQ(-1, VLIBRelaydLogStart("/x.log"));
    WriteConf("[1, 2]");
    EXPECT_EQ(-1, VLIBRelaydLogStart("/x.log"));
    EXPECT_EQ("[1, 2]", root.read(CONF));
    WriteConf("not json");
    EXPECT_EQ(-1, VLIBRelaydLogStart("/x.log"));
    // The reader moved the corrupt file aside; nothing new was written.
    EXPECT_FALSE(root.exists(CONF));
    EXPECT_TRUE(root.exists(std::string(CONF) + ".bad"));
}

TEST_F(EntryPointTest, LogStartFailsWhenTheFileCannotBeWritten) {
    WriteConf("{\"serverID\": \"abc\"}");
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    BlockTheWrite();
    EXPECT_EQ(-1, VLIBRelaydLogStart("/x.log"));
    EXPECT_EQ("{\"serverID\": \"abc\"}", root.read(CONF));
    EXPECT_TRUE(daemon.NothingReported());
}

// ---- VLIBRelaydLogStop -----------------------------------------------------

TEST_F(EntryPointTest, LogStopRemovesBothKeysAndSignalsTheDaemon) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    WriteConf("{\"serverID\": \"abc\", \"log_level\": 7, \"log_file\": \"/x.log\"}");
    EXPECT_EQ(0, VLIBRelaydLogStop());
    Json::Value conf = ReadConf();
    EXPECT_FALSE(conf.isMember("log_level"));
    EXPECT_FALSE(conf.isMember("log_file"));
    EXPECT_EQ("abc", conf["serverID"].asString());
    EXPECT_EQ(SIGHUP, daemon.NextSignal());
}

TEST_F(EntryPointTest, LogStopWithMissingFileWritesNullUnlikeLogStart) {
    zepatest::StderrCapture capture;
    EXPECT_EQ(0, VLIBRelaydLogStop());
    EXPECT_EQ("zeparelayd not running\n", capture.stop());
    ASSERT_TRUE(root.exists(CONF));
    EXPECT_TRUE(ReadConf().isNull());
    EXPECT_EQ("null\n", root.read(CONF));
}

TEST_F(EntryPointTest, LogStopWithoutTheKeysRewritesTheSameContentAndStillSignals) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    WriteConf("{\"serverID\": \"abc\", \"service\": [{\"id\": \"photo\"}]}");
    Json::Value before = ReadConf();
    EXPECT_EQ(0, VLIBRelaydLogStop());
    EXPECT_EQ(before, ReadConf());
    EXPECT_EQ(SIGHUP, daemon.NextSignal());
}

TEST_F(EntryPointTest, LogStopOnANonObjectRewritesItUnchanged) {
    WriteConf("[1, 2]");
    EXPECT_EQ(0, VLIBRelaydLogStop());
    EXPECT_EQ(zepatest::ParseJson("[1, 2]"), ReadConf());
}

TEST_F(EntryPointTest, LogStopFailsWhenTheFileCannotBeWritten) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    WriteConf("{\"log_level\": 7}");
    BlockTheWrite();
    EXPECT_EQ(-1, VLIBRelaydLogStop());
    EXPECT_EQ("{\"log_level\": 7}", root.read(CONF));
    EXPECT_TRUE(daemon.NothingReported());
}

// ---- VLIBRelaydGetServerId -------------------------------------------------

class ServerIdTest : public EntryPointTest {
protected:
    void SetUp() override {
        EntryPointTest::SetUp();
        memset(buf, 'z', sizeof(buf));
        buf[sizeof(buf) - 1] = '\0';
    }
    char buf[32];
};

TEST_F(ServerIdTest, ShortBufferKeepsThePrefixAndTheTerminator) {
    WriteConf("{\"serverID\": \"abcdef\"}");
    EXPECT_EQ(1, VLIBRelaydGetServerId(nullptr, buf, 4));
    EXPECT_STREQ("abc", buf);
    EXPECT_EQ('z', buf[4]);
}

TEST_F(ServerIdTest, BuffersOfSizeZeroAndOne) {
    WriteConf("{\"serverID\": \"abcdef\"}");
    EXPECT_EQ(1, VLIBRelaydGetServerId(nullptr, buf, 0));
    EXPECT_EQ('z', buf[0]);
    EXPECT_EQ(1, VLIBRelaydGetServerId(nullptr, buf, 1));
    EXPECT_EQ('\0', buf[0]);
    EXPECT_EQ('z', buf[1]);
}

TEST_F(ServerIdTest, NullBufferStillAnswers) {
    WriteConf("{\"serverID\": \"abc\", \"service\": [{\"id\": \"photo\"}]}");
    EXPECT_EQ(1, VLIBRelaydGetServerId(nullptr, nullptr, 10));
    EXPECT_EQ(1, VLIBRelaydGetServerId("photo", nullptr, 10));
    EXPECT_EQ(0, VLIBRelaydGetServerId("web", nullptr, 0));
}

TEST_F(ServerIdTest, RelayedServiceIsOneAndOtherServicesZeroWithTheIdFilledIn) {
    WriteConf("{\"serverID\": \"abc\", \"service\": [{\"id\": \"web\"}, {\"id\": \"photo\"}]}");
    EXPECT_EQ(1, VLIBRelaydGetServerId("photo", buf, sizeof(buf)));
    EXPECT_STREQ("abc", buf);
    memset(buf, 'z', 8);
    EXPECT_EQ(0, VLIBRelaydGetServerId("music", buf, sizeof(buf)));
    EXPECT_STREQ("abc", buf);
}

TEST_F(ServerIdTest, OnlyObjectsWithAStringIdCount) {
    WriteConf("{\"serverID\": \"abc\", \"service\": [42, \"photo\", {\"id\": 42}, {\"name\": \"photo\"}]}");
    EXPECT_EQ(0, VLIBRelaydGetServerId("42", buf, sizeof(buf)));
    EXPECT_EQ(0, VLIBRelaydGetServerId("photo", buf, sizeof(buf)));
    WriteConf("{\"serverID\": \"abc\", \"service\": {\"id\": \"photo\"}}");
    EXPECT_EQ(0, VLIBRelaydGetServerId("photo", buf, sizeof(buf)));
    EXPECT_STREQ("abc", buf);
}

TEST_F(ServerIdTest, NoServerIdMeansNoRelayIdentityYet) {
    const char* confs[] = {"{}", "{\"serverID\": \"\"}", "{\"serverID\": 12}",
                           "{\"serverID\": null, \"service\": [{\"id\": \"photo\"}]}"};
    for (const char* conf : confs) {
        WriteConf(conf);
        memset(buf, 'z', 8);
        EXPECT_EQ(0, VLIBRelaydGetServerId("photo", buf, sizeof(buf))) << conf;
        EXPECT_STREQ("", buf) << conf;
        EXPECT_EQ(0, VLIBRelaydGetServerId(nullptr, buf, sizeof(buf))) << conf;
    }
}

TEST_F(ServerIdTest, MissingCorruptOrNonObjectFilesFailWithAnEmptyBuffer) {
    EXPECT_EQ(-1, VLIBRelaydGetServerId(nullptr, buf, sizeof(buf)));
    EXPECT_STREQ("", buf);
    const char* confs[] = {"", "[\"abc\"]", "\"abc\"", "not json"};
    for (const char* conf : confs) {
        WriteConf(conf);
        memset(buf, 'z', 8);
        EXPECT_EQ(-1, VLIBRelaydGetServerId(nullptr, buf, sizeof(buf))) << conf;
        EXPECT_STREQ("", buf) << conf;
    }
}

TEST_F(ServerIdTest, AnswersWhetherOrNotTheDaemonRunsAndSendsNothing) {
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    WriteConf("{\"serverID\": \"abc\"}");
    EXPECT_EQ(1, VLIBRelaydGetServerId(nullptr, buf, sizeof(buf)));
    EXPECT_TRUE(daemon.NothingReported());
}

// ---- from C ----------------------------------------------------------------

TEST_F(EntryPointTest, EntryPointsAreCallableFromAPlainCProgram) {
    WriteConf("{\"serverID\": \"abcdefghij\", \"service\": [{\"id\": \"photo\"}]}");
    StandInDaemon daemon;
    WritePidFile(daemon.pid());
    std::string command = std::string(ZEPA_C_ENTRY_PROGRAM) + " " + root.dir() + " /c.log photo 2>&1";
    FILE* pipe = popen(command.c_str(), "r");
    ASSERT_NE(nullptr, pipe);
    std::string output;
    char chunk[256];
    while (fgets(chunk, sizeof(chunk), pipe) != nullptr) output += chunk;
    EXPECT_EQ(0, pclose(pipe));
    EXPECT_EQ("id 1 [abcdefg]\nstart 0\nstop 0\nnull -1\n", output);
    // Start and stop each send SIGHUP; two still pending at once arrive as one.
    EXPECT_EQ(SIGHUP, daemon.NextSignal());
    Json::Value conf = ReadConf();
    EXPECT_FALSE(conf.isMember("log_file"));
    EXPECT_EQ("abcdefghij", conf["serverID"].asString());
}

}  // namespace
