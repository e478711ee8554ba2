#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>
#include <vector>

#include <zeparelayd/config.h>

#include "conf_file_fixture.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogContains;
using zepatest::ParseJson;
using zepatest::RootTest;
using zepatest::StderrCapture;

namespace {

using relaydtest::kConf;
constexpr const char kNotifier[] = "/usr/zepa/bin/zepanosnotify";
constexpr const char kNotices[] = "/notices.log";

class FieldWriterTest : public relaydtest::ConfFileTest {
protected:
    void SetUp() override {
        ConfFileTest::SetUp();
        // A stand-in notifier that records its arguments, one line per run.
        root.write(kNotifier,
                   "#!/bin/sh\n"
                   "{ printf '%s' \"$(basename \"$0\")\"; for a in \"$@\"; do printf '|%s' \"$a\"; done; "
                   "echo; } >> '" +
                       root.path(kNotices) + "'\n",
                   0755);
    }
    std::vector<std::string> Notices() const {
        std::vector<std::string> lines;
        if (!root.exists(kNotices)) return lines;
        std::string text = root.read(kNotices), line;
        std::istringstream in(text);
        while (std::getline(in, line)) lines.push_back(line);
        return lines;
    }
};

const char kNotice[] =
    "zepanosnotify|@administrators|relayservice:relayservice_serverid_change_title|"
    "relayservice:relayservice_serverid_change_msg";

TEST_F(FieldWriterTest, ServerIdIntoNoFileCreatesAFileWithOnlyIt) {
    RelaydConf c(nullptr);
    c.serverID = "srv-1";
    EXPECT_TRUE(c.WriteServerId(conf()));
    EXPECT_EQ(ParseJson(R"({"serverID": "srv-1"})"), ConfOnDisk());
    EXPECT_TRUE(Notices().empty());
}

TEST_F(FieldWriterTest, EmptyServerIdIsWrittenToo) {
    WriteConf(R"({"serverID": "old", "other": [1, 2]})");
    RelaydConf c(conf().c_str());
    c.serverID = "";
    EXPECT_TRUE(c.WriteServerId(""));
    EXPECT_EQ(ParseJson(R"({"serverID": "", "other": [1, 2]})"), ConfOnDisk());
}

TEST_F(FieldWriterTest, ControlHostKeepsOtherKeysOfTheSection) {
    WriteConf(R"({"server_control": {"host": "old.example", "extra": "kept", "port": 1},
                  "unknown": true, "log_level": 7})");
    RelaydConf c(conf().c_str());
    c.serverControl.ip = "192.0.2.4";
    EXPECT_TRUE(c.WriteControlServerHost("", "new.example"));
    EXPECT_EQ(ParseJson(R"({"server_control": {"host": "new.example", "extra": "kept", "port": 1},
                            "unknown": true, "log_level": 7})"),
              ConfOnDisk());
    EXPECT_EQ("new.example", c.serverControl.host);
}

TEST_F(FieldWriterTest, ControlHostEmptyWritesIp) {
    WriteConf(R"({"server_control": {"host": "old.example"}})");
    RelaydConf c(conf().c_str());
    c.serverControl.ip = "192.0.2.4";
    EXPECT_TRUE(c.WriteControlServerHost("", ""));
    EXPECT_EQ(ParseJson(R"({"host": "", "ip": "192.0.2.4"})"), ConfOnDisk()["server_control"]);
}

TEST_F(FieldWriterTest, SectionKeyThatIsNoObjectIsReplaced) {
    WriteConf(R"({"server_control": "text"})");
    RelaydConf c(conf().c_str());
    EXPECT_TRUE(c.WriteControlServerHost("", "h.example"));
    EXPECT_EQ(ParseJson(R"({"host": "h.example"})"), ConfOnDisk()["server_control"]);
}

TEST_F(FieldWriterTest, AliasNameWritesTheFullAliasSection) {
    WriteConf(R"({"server_alias": {"alias": "old", "note": 1}, "serverID": "s"})");
    RelaydConf c(conf().c_str());
    EXPECT_TRUE(c.WriteAliasName("", "newname"));
    EXPECT_EQ("newname", c.alias.GetAliasName());
    Json::Value expected = ParseJson(R"({"note": 1})");
    c.alias.Write(expected, true);
    Json::Value disk = ConfOnDisk();
    EXPECT_EQ(expected, disk["server_alias"]);
    EXPECT_EQ("newname", disk["server_alias"]["alias"].asString());
    EXPECT_EQ("s", disk["serverID"].asString());
}

TEST_F(FieldWriterTest, AccountWritesTheFullAccountSection) {
    RelaydConf c(nullptr);
    EXPECT_TRUE(c.WriteMyHubAccount(conf(), "owner@example.org"));
    Json::Value expected;
    c.myhub.Write(expected, true);
    EXPECT_EQ("owner@example.org", c.myhub.GetMyHubAccount());
    EXPECT_EQ(ParseJson(R"({"server_myhub": {"account": "owner@example.org"}})")["server_myhub"]["account"],
              ConfOnDisk()["server_myhub"]["account"]);
    EXPECT_EQ(expected, ConfOnDisk()["server_myhub"]);
}

TEST_F(FieldWriterTest, CorruptFileIsSetAsideAndItsPartialContentUsed) {
    WriteConf("not json at all");
    RelaydConf c(nullptr);
    c.serverID = "x";
    StderrCapture cap;
    EXPECT_TRUE(c.WriteServerId(conf()));
    EXPECT_TRUE(LogContains(cap.stop(), "bad json format"));
    EXPECT_TRUE(root.exists(std::string(kConf) + ".bad"));
    EXPECT_EQ(ParseJson(R"({"serverID": "x"})"), ConfOnDisk());
}

TEST_F(FieldWriterTest, InvalidConfigurationChangesNothing) {
    WriteConf(R"({"server_alias": {"alias": "a"}, "server_myhub": {"account": "m"}})");
    RelaydConf c(conf().c_str());
    c.serverGlobal.port = -1;
    StderrCapture cap;
    EXPECT_FALSE(c.WriteAliasName("", "b"));
    EXPECT_FALSE(c.WriteMyHubAccount("", "n"));
    EXPECT_FALSE(c.WriteControlServerHost("", "h.example"));
    EXPECT_FALSE(c.WriteServerId(""));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "invalid relayd config")) << log;
    EXPECT_EQ("a", c.alias.GetAliasName());
    EXPECT_EQ("m", c.myhub.GetMyHubAccount());
    EXPECT_EQ(RelaydConf::GLOBAL_HOST, c.serverControl.host);
    EXPECT_EQ(R"({"server_alias": {"alias": "a"}, "server_myhub": {"account": "m"}})", root.read(kConf));
}

// An empty name is no file: the write fails at its temporary file, and
// nothing is created in the working folder.
TEST_F(FieldWriterTest, EmptyPathsFailAtTheTemporaryFile) {
    RelaydConf c(nullptr);
    const std::string stray = ".tmp." + std::to_string(getpid());
    StderrCapture cap;
    bool written = c.WriteServerId("");
    std::string log = cap.stop();
    EXPECT_FALSE(written);
    EXPECT_TRUE(LogContains(log, "open failed [" + stray + "]")) << log;
    EXPECT_FALSE(zepatest::FileExists(stray));
}

TEST_F(FieldWriterTest, MemoryChangesEvenWhenTheWriteFails) {
    RelaydConf c(nullptr);
    StderrCapture cap;
    EXPECT_FALSE(c.WriteAliasName(root.path("/missing/dir/x.conf"), "alias1"));
    EXPECT_FALSE(c.WriteMyHubAccount(root.path("/missing/dir/x.conf"), "acct1"));
    EXPECT_FALSE(c.WriteControlServerHost(root.path("/missing/dir/x.conf"), "ctl.example"));
    cap.stop();
    EXPECT_EQ("alias1", c.alias.GetAliasName());
    EXPECT_EQ("acct1", c.myhub.GetMyHubAccount());
    EXPECT_EQ("ctl.example", c.serverControl.host);
}

TEST_F(FieldWriterTest, OneNoticeForOneChange) {
    RelaydConf c(nullptr);
    c.serverID = "new-id";
    c.serverIdChanged = true;
    EXPECT_TRUE(c.WriteServerId(conf()));
    EXPECT_FALSE(c.serverIdChanged);
    EXPECT_TRUE(c.WriteAliasName(conf(), "nas"));
    EXPECT_EQ(std::vector<std::string>({kNotice}), Notices());
}

TEST_F(FieldWriterTest, NoticeWaitsForTheFirstSuccessfulWrite) {
    RelaydConf c(nullptr);
    c.serverID = "new-id";
    c.serverIdChanged = true;
    StderrCapture cap;
    EXPECT_FALSE(c.WriteServerId(root.path("/missing/dir/x.conf")));
    cap.stop();
    EXPECT_TRUE(c.serverIdChanged);
    EXPECT_TRUE(Notices().empty());
    EXPECT_TRUE(c.WriteConfigFile(conf()));
    EXPECT_FALSE(c.serverIdChanged);
    EXPECT_TRUE(c.WriteConfigFile(conf()));
    EXPECT_EQ(std::vector<std::string>({kNotice}), Notices());
}

TEST_F(FieldWriterTest, FailingNotifierStillClearsTheFlag) {
    root.write(kNotifier, "#!/bin/sh\nexit 3\n", 0755);
    RelaydConf c(nullptr);
    c.serverIdChanged = true;
    EXPECT_TRUE(c.WriteJsonFileWithNotification(conf(), ParseJson(R"({"a": 1})")));
    EXPECT_FALSE(c.serverIdChanged);
    unlink(root.path(kNotifier).c_str());
    c.serverIdChanged = true;
    EXPECT_TRUE(c.WriteJsonFileWithNotification(conf(), ParseJson(R"({"a": 2})")));
    EXPECT_FALSE(c.serverIdChanged);
    EXPECT_EQ(ParseJson(R"({"a": 2})"), ConfOnDisk());
}

}  // namespace
