#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include <zeparelayd/config.h>

#include "conf_file_fixture.h"
#include "support/service_staging.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::FileMode;
using zepatest::LogContains;
using zepatest::ParseJson;
using zepatest::RootTest;
using zepatest::StderrCapture;

namespace {

using relaydtest::kConf;

class ConfigFileTest : public relaydtest::ConfFileTest {
protected:
    void SetUp() override {
        ConfFileTest::SetUp();
        zepatest::WriteStockFwDefinitions(root);
    }
};

TEST_F(ConfigFileTest, KeysOnlyWrittenWhenTheFileHadThem) {
    WriteConf(R"({"serverID": "s"})");
    RelaydConf c(conf().c_str());
    c.logLevel = 7;
    c.logFile = "/var/log/other.log";
    c.serverGlobal.host = "g.example";
    EXPECT_TRUE(c.WriteConfigFile());
    Json::Value disk = ConfOnDisk();
    for (const char* key : {"log_level", "log_file", "server_global", "server_waitcmd"})
        EXPECT_FALSE(disk.isMember(key)) << key;
    for (const char* key :
         {"server_control", "server_alias", "server_myhub", "support_channel", "serverID", "service"})
        EXPECT_TRUE(disk.isMember(key)) << key;
}

TEST_F(ConfigFileTest, KeysPresentInTheFileAreRewrittenWithCurrentValues) {
    WriteConf(R"({"log_level": 3, "log_file": "", "server_global": {"host": "old.example", "x": 1},
                  "server_waitcmd": {}})");
    RelaydConf c(conf().c_str());
    c.logLevel = 6;
    c.serverGlobal.host = "new.example";
    EXPECT_TRUE(c.WriteConfigFile(conf()));
    Json::Value disk = ConfOnDisk();
    EXPECT_EQ(6, disk["log_level"].asInt());
    EXPECT_EQ("", disk["log_file"].asString());
    EXPECT_EQ(ParseJson(R"({"host": "new.example"})"), disk["server_global"]);
    EXPECT_EQ(RelaydConf::GLOBAL_HOST, disk["server_waitcmd"]["host"].asString());
}

// WriteConfigFile rebuilds the file from memory: what the configuration does
// not know is dropped on purpose (the field writers keep it instead).
TEST_F(ConfigFileTest, UnknownTopLevelKeyIsDropped) {
    WriteConf(R"({"serverID": "s", "vendor_extension": {"a": 1}, "pid": 5, "enable": true})");
    RelaydConf c(conf().c_str());
    EXPECT_TRUE(c.WriteConfigFile());
    Json::Value disk = ConfOnDisk();
    EXPECT_FALSE(disk.isMember("vendor_extension"));
    EXPECT_FALSE(disk.isMember("pid"));
    EXPECT_FALSE(disk.isMember("enable"));
    EXPECT_EQ("s", disk["serverID"].asString());
}

TEST_F(ConfigFileTest, WrittenFileHasMode0644) {
    WriteConf("{}");
    chmod(conf().c_str(), 0600);
    RelaydConf c(conf().c_str());
    EXPECT_TRUE(c.WriteConfigFile());
    EXPECT_EQ(0644u, FileMode(conf()));
}

TEST_F(ConfigFileTest, CorruptTargetIsSetAsideThenRewritten) {
    RelaydConf c(nullptr);
    c.serverID = "fresh";
    WriteConf(R"({"serverID": "broken", )");
    StderrCapture cap;
    EXPECT_TRUE(c.WriteConfigFile(conf()));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "bad json format [" + conf() + "]")) << log;
    EXPECT_EQ(R"({"serverID": "broken", )", root.read(std::string(kConf) + ".bad"));
    Json::Value disk = ConfOnDisk();
    EXPECT_EQ("fresh", disk["serverID"].asString());
    EXPECT_TRUE(disk["service"].isArray());
    RelaydConf back(conf().c_str());
    EXPECT_EQ("fresh", back.serverID);
}

TEST_F(ConfigFileTest, NonObjectTargetIsReplaced) {
    WriteConf(R"(["log_level"])");
    RelaydConf c(nullptr);
    EXPECT_TRUE(c.WriteConfigFile(conf()));
    Json::Value disk = ConfOnDisk();
    EXPECT_TRUE(disk.isObject());
    EXPECT_FALSE(disk.isMember("log_level"));
}

TEST_F(ConfigFileTest, InvalidConfigurationLeavesTheFileAlone) {
    WriteConf(R"({"serverID": "on-disk"})");
    RelaydConf c(conf().c_str());
    c.serverID = "changed";
    c.serverControl.protocol = "gopher";
    StderrCapture cap;
    EXPECT_FALSE(c.WriteConfigFile());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "wrong control server config")) << log;
    EXPECT_TRUE(LogContains(log, "invalid relayd config")) << log;
    EXPECT_EQ(R"({"serverID": "on-disk"})", root.read(kConf));
}

TEST_F(ConfigFileTest, MissingFolderFailsAtTheTemporaryFile) {
    RelaydConf c(nullptr);
    std::string target = root.path("/no/such/dir/zeparelayd.conf");
    StderrCapture cap;
    EXPECT_FALSE(c.WriteConfigFile(target));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "open failed [" + target + ".tmp." + std::to_string(getpid()) + "]")) << log;
}

// An empty name is no file: the write fails at its temporary file, and
// nothing is created in the working folder.
TEST_F(ConfigFileTest, WriteWithoutStoredPathUsesTheEmptyName) {
    RelaydConf c(nullptr);
    const std::string stray = ".tmp." + std::to_string(getpid());
    StderrCapture cap;
    bool written = c.WriteConfigFile();
    std::string log = cap.stop();
    EXPECT_FALSE(written);
    EXPECT_TRUE(LogContains(log, "open failed [" + stray + "]")) << log;
    EXPECT_FALSE(zepatest::FileExists(stray));
}

TEST_F(ConfigFileTest, WrittenFileReadsBackToTheSameConfiguration) {
    WriteConf(R"({"log_level": 4, "log_file": "", "server_global": {}, "server_waitcmd": {}})");
    RelaydConf c(conf().c_str());
    c.serverID = "srv";
    c.serverGlobal.host = "";
    c.serverGlobal.ip = "192.0.2.10";
    c.serverControl.host = "control.example";
    c.serverWaitCmd.host = "wait.example";
    c.alias.SetAliasName("nas");
    c.myhub.SetMyHubAccount("owner");
    c.supportChannel.SetEnabled(true);
    c.logLevel = 6;
    c.logFile = "/var/log/relay.log";
    c.services.push_back(ServiceConf("nos"));
    c.services.push_back(ServiceConf("telnet"));
    ASSERT_TRUE(c.WriteConfigFile());
    RelaydConf back(conf().c_str());
    Json::Value a, b;
    c.Write(a, false);
    back.Write(b, false);
    EXPECT_EQ(a, b) << a.toStyledString() << b.toStyledString();
    EXPECT_TRUE(back.services == c.services);
}

}  // namespace
