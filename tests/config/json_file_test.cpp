#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <sstream>
#include <string>

#include <zeparelayd/config.h>

#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::FileExists;
using zepatest::FileMode;
using zepatest::LogContains;
using zepatest::ParseJson;
using zepatest::ReadFile;
using zepatest::RootTest;
using zepatest::StderrCapture;
using zepatest::StdoutCapture;

namespace {

class JsonFileTest : public RootTest {
protected:
    std::string conf(const std::string& content) {
        root.write("/conf/a.conf", content);
        return root.path("/conf/a.conf");
    }
};

TEST_F(JsonFileTest, EmptyPathIsTrueAndNull) {
    Json::Value v = "preset";
    StderrCapture cap;
    EXPECT_TRUE(RelaydConf::ReadJsonFile("", v));
    EXPECT_TRUE(v.isNull());
    EXPECT_EQ("", cap.stop());
}

TEST_F(JsonFileTest, MissingFileIsTrueAndNullWithoutMessage) {
    Json::Value v = 1;
    StderrCapture cap;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(root.path("/conf/none.conf"), v));
    EXPECT_TRUE(v.isNull());
    EXPECT_EQ("", cap.stop());
}

TEST_F(JsonFileTest, ReadsObject) {
    Json::Value v;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(conf(R"({"a": 1, "b": "x"})"), v));
    EXPECT_EQ(1, v["a"].asInt());
    EXPECT_EQ("x", v["b"].asString());
}

TEST_F(JsonFileTest, TruncatedFileIsRenamedToBad) {
    std::string path = conf(R"({"serverID": "abc", )");
    Json::Value v;
    StderrCapture cap;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(path, v));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "config:")) << log;
    EXPECT_TRUE(LogContains(log, " bad json format [" + path + "]")) << log;
    EXPECT_FALSE(FileExists(path));
    EXPECT_EQ(R"({"serverID": "abc", )", ReadFile(path + ".bad"));
    EXPECT_FALSE(v.isObject() && v.isMember("serverID") && v["serverID"].asString() != "abc");
}

TEST_F(JsonFileTest, OlderBadFileIsReplaced) {
    std::string path = conf("{broken");
    zepatest::WriteFile(path + ".bad", "old");
    Json::Value v;
    StderrCapture cap;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(path, v));
    cap.stop();
    EXPECT_EQ("{broken", ReadFile(path + ".bad"));
}

TEST_F(JsonFileTest, FailedRenameDeletesCorruptFile) {
    std::string path = conf("{broken");
    zepatest::MakeDirs(path + ".bad/inside");  // a folder cannot be replaced by a file
    Json::Value v;
    StderrCapture cap;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(path, v));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "rename " + path + " to .bad failed. ")) << log;
    EXPECT_FALSE(FileExists(path));
}

TEST_F(JsonFileTest, ArrayIsValidJsonAndNotRenamed) {
    std::string path = conf("[1, 2]");
    Json::Value v;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(path, v));
    EXPECT_TRUE(v.isArray());
    EXPECT_TRUE(FileExists(path));
    EXPECT_FALSE(FileExists(path + ".bad"));
}

TEST_F(JsonFileTest, EmptyFileIsCorrupt) {
    std::string path = conf("");
    Json::Value v;
    StderrCapture cap;
    EXPECT_TRUE(RelaydConf::ReadJsonFile(path, v));
    cap.stop();
    EXPECT_FALSE(v.isObject());
    EXPECT_TRUE(FileExists(path + ".bad"));
}

TEST_F(JsonFileTest, WriteIsStyledWithMode0644AndNoTemporaryLeft) {
    root.mkdir("/conf");
    std::string path = root.path("/conf/out.conf");
    Json::Value v = ParseJson(R"({"b": [1, 2], "a": {"x": "y"}})");
    umask(077);
    ASSERT_TRUE(RelaydConf::WriteJsonFile(path, v));
    EXPECT_EQ("{\n   \"a\" : {\n      \"x\" : \"y\"\n   },\n   \"b\" : [ 1, 2 ]\n}\n", ReadFile(path));
    EXPECT_EQ(0644u, FileMode(path));
    EXPECT_TRUE(zepatest::TemporariesOf(path).empty());
    Json::Value back;
    ASSERT_TRUE(RelaydConf::ReadJsonFile(path, back));
    EXPECT_EQ(v, back);
}

TEST_F(JsonFileTest, WriteToDashPrintsAndCreatesNoFile) {
    StdoutCapture out;
    EXPECT_TRUE(RelaydConf::WriteJsonFile("-", ParseJson(R"({"k": 1})")));
    EXPECT_EQ("{\n   \"k\" : 1\n}\n", out.stop());
    EXPECT_FALSE(FileExists("-"));
}

TEST_F(JsonFileTest, WriteIntoMissingDirectoryFailsAtOpen) {
    std::string path = root.path("/missing/dir/x.conf");
    StderrCapture cap;
    EXPECT_FALSE(RelaydConf::WriteJsonFile(path, Json::Value(1)));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "open failed [" + path + ".tmp." + std::to_string(getpid()) + "]")) << log;
}

TEST_F(JsonFileTest, AStaleTemporaryOfThisWriterIsTruncatedAndRenamed) {
    root.mkdir("/conf");
    const std::string path = root.path("/conf/out.conf");
    const std::string tmp = path + ".tmp." + std::to_string(getpid());
    zepatest::WriteFile(tmp, std::string(5000, 'x'), 0600);
    ASSERT_TRUE(RelaydConf::WriteJsonFile(path, ParseJson(R"({"k": 1})")));
    EXPECT_EQ("{\n   \"k\" : 1\n}\n", ReadFile(path));
    EXPECT_EQ(0644u, FileMode(path));
    EXPECT_FALSE(FileExists(tmp));
}

TEST_F(JsonFileTest, EmptyPathFailsAtTheOpenEvenInAWritableFolder) {
    root.mkdir("/work");
    char saved[4096];
    ASSERT_NE(nullptr, getcwd(saved, sizeof(saved)));
    ASSERT_EQ(0, chdir(root.path("/work").c_str()));
    StderrCapture cap;
    bool ok = RelaydConf::WriteJsonFile("", Json::Value(1));
    std::string log = cap.stop();
    ASSERT_EQ(0, chdir(saved));
    EXPECT_FALSE(ok);
    EXPECT_TRUE(LogContains(log, "open failed [.tmp." + std::to_string(getpid()) + "]")) << log;
    EXPECT_FALSE(root.exists("/work/.tmp." + std::to_string(getpid())));
}

TEST_F(JsonFileTest, FailedRenameIsLoggedButReportedTrue) {
    std::string path = root.path("/conf/target");
    zepatest::MakeDirs(path + "/occupied");  // a non-empty folder cannot be replaced
    StderrCapture cap;
    EXPECT_TRUE(RelaydConf::WriteJsonFile(path, Json::Value(1)));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "rename to " + path + " failed ")) << log;
    EXPECT_TRUE(zepatest::TemporariesOf(path).empty());
}

TEST_F(JsonFileTest, FailedWriteLeavesOldFileWholeAndNoTemporary) {
    std::string path = conf(R"({"old": true})");
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        // A file size limit makes the write of the temporary file fail midway.
        signal(SIGXFSZ, SIG_IGN);
        struct rlimit lim = {64, 64};
        setrlimit(RLIMIT_FSIZE, &lim);
        Json::Value big;
        big["data"] = std::string(100000, 'x');
        bool ok = RelaydConf::WriteJsonFile(path, big);
        bool tmpLeft = !zepatest::TemporariesOf(path).empty();
        _exit(ok ? 1 : (tmpLeft ? 2 : 0));
    }
    int status = 0;
    waitpid(child, &status, 0);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
    EXPECT_EQ(R"({"old": true})", ReadFile(path));
}

class Sample : public Config {
public:
    bool Overwrite(const Json::Value&) override { return true; }
    bool IsValid() const override { return true; }
    bool Write(Json::Value& out, bool full) const override {
        out["kept"] = 1;
        if (full) out["secretOnlyInFull"] = "s";
        return true;
    }
};

TEST(ConfigStream, PrintsFullFormAsOneCompactLine) {
    Sample s;
    std::ostringstream os;
    os << s << s;
    EXPECT_EQ("{\"kept\":1,\"secretOnlyInFull\":\"s\"}\n{\"kept\":1,\"secretOnlyInFull\":\"s\"}\n", os.str());
}

}  // namespace
