#include <gtest/gtest.h>
#include <unistd.h>

#include <sstream>
#include <string>

#include <zeparelayd/config.h>

#include "conf_file_fixture.h"
#include "support/round_trip.h"
#include "support/service_staging.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::FileMode;
using zepatest::LogContains;
using zepatest::LogMessages;
using zepatest::ParseJson;
using zepatest::RootTest;
using zepatest::SetInfo;
using zepatest::StderrCapture;

namespace {

using relaydtest::kConf;

class RelaydConfTest : public relaydtest::ConfFileTest {
protected:
    void SetUp() override {
        ConfFileTest::SetUp();
        zepatest::WriteStockFwDefinitions(root);
    }

    static void ExpectDefaults(const RelaydConf& c) {
        EXPECT_EQ("", c.serverID);
        EXPECT_EQ("https", c.serverGlobal.protocol);
        EXPECT_EQ(RelaydConf::GLOBAL_HOST, c.serverGlobal.host);
        EXPECT_EQ("", c.serverGlobal.ip);
        EXPECT_EQ(443, c.serverGlobal.port);
        EXPECT_EQ("Serv.php", c.serverGlobal.page);
        EXPECT_EQ("https", c.serverControl.protocol);
        EXPECT_EQ(RelaydConf::GLOBAL_HOST, c.serverControl.host);
        EXPECT_EQ(443, c.serverControl.port);
        EXPECT_EQ("Serv.php", c.serverControl.page);
        EXPECT_EQ("http", c.serverWaitCmd.protocol);
        EXPECT_EQ(RelaydConf::GLOBAL_HOST, c.serverWaitCmd.host);
        EXPECT_EQ(80, c.serverWaitCmd.port);
        EXPECT_EQ("Serv.php", c.serverWaitCmd.page);
        EXPECT_EQ("", c.alias.GetAliasName());
        EXPECT_EQ("", c.myhub.GetMyHubAccount());
        EXPECT_FALSE(c.supportChannel.GetEnabled());
        EXPECT_TRUE(c.services.empty());
        EXPECT_EQ("", c.logFile);
        EXPECT_EQ(4, c.logLevel);
        EXPECT_FALSE(c.debug);
        EXPECT_FALSE(c.serverIdChanged);
    }
};

TEST_F(RelaydConfTest, GlobalHostIsAPlainDnsName) {
    std::string host = RelaydConf::GLOBAL_HOST;
    EXPECT_NE(std::string::npos, host.find('.'));
    EXPECT_EQ(std::string::npos, host.find_first_of(":/ "));
}

TEST_F(RelaydConfTest, DefaultsWithoutPath) {
    StderrCapture cap;
    RelaydConf c(nullptr);
    EXPECT_EQ("", cap.stop());
    ExpectDefaults(c);
    EXPECT_EQ("", c.path);
    EXPECT_FALSE(c.enable);
    EXPECT_TRUE(c.IsValid());
}

TEST_F(RelaydConfTest, EnableComesFromTheSystemSwitch) {
    SetInfo(root, "runrelayd", "YES");
    EXPECT_TRUE(RelaydConf(nullptr).enable);
    SetInfo(root, "runrelayd", "no");
    EXPECT_FALSE(RelaydConf(nullptr).enable);
    WriteConf(R"({"enable": true})");
    EXPECT_FALSE(RelaydConf(conf().c_str()).enable);
}

TEST_F(RelaydConfTest, TheAuthSectionIsNotReadFromTheSystem) {
    root.write("/etc/zepa/hubtoken.conf", "serial=\"S1\"\ntoken=\"T1\"\n");
    SetInfo(root, "timezone", "Europe/Paris");
    RelaydConf c(nullptr);
    EXPECT_EQ("", c.auth.serial);
    EXPECT_EQ("", c.auth.token);
    EXPECT_EQ("Europe/Paris", c.auth.timezone);
}

TEST_F(RelaydConfTest, MissingFileKeepsDefaults) {
    StderrCapture cap;
    RelaydConf c(conf().c_str());
    std::string log = cap.stop();
    ASSERT_EQ(1u, LogMessages(log).size()) << log;
    EXPECT_TRUE(LogContains(log, "invalid relayd config: can not overwrite default")) << log;
    ExpectDefaults(c);
    EXPECT_EQ(conf(), c.path);
    EXPECT_TRUE(c.IsValid());
}

TEST_F(RelaydConfTest, EmptyFileKeepsDefaults) {
    WriteConf("");
    StderrCapture cap;
    RelaydConf c(conf().c_str());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "invalid relayd config: can not overwrite default")) << log;
    ExpectDefaults(c);
}

TEST_F(RelaydConfTest, CorruptFileIsSetAsideAndDefaultsKept) {
    WriteConf(R"({"serverID": "abc", "log_level": 7, )");
    StderrCapture cap;
    RelaydConf c(conf().c_str());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "bad json format [" + conf() + "]")) << log;
    EXPECT_TRUE(LogContains(log, "invalid relayd config: can not overwrite default")) << log;
    EXPECT_TRUE(root.exists(std::string(kConf) + ".bad"));
    EXPECT_FALSE(root.exists(kConf));
    ExpectDefaults(c);

    StderrCapture again;
    EXPECT_FALSE(c.ReadConfigFile(conf()));
    std::string log2 = again.stop();
    EXPECT_TRUE(LogContains(log2, "invalid relayd config: can not overwrite default")) << log2;
    EXPECT_FALSE(LogContains(log2, "bad json format")) << log2;
    ExpectDefaults(c);
}

TEST_F(RelaydConfTest, ArrayFileIsNotRenamedAndFailsAtOverwrite) {
    WriteConf(R"([{"serverID": "abc"}])");
    StderrCapture cap;
    RelaydConf c(nullptr);
    EXPECT_FALSE(c.ReadConfigFile(conf()));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "invalid relayd config: can not overwrite default")) << log;
    EXPECT_FALSE(LogContains(log, "bad json format")) << log;
    EXPECT_TRUE(root.exists(kConf));
    EXPECT_FALSE(root.exists(std::string(kConf) + ".bad"));
    ExpectDefaults(c);
    EXPECT_FALSE(c.Overwrite(ParseJson("[]")));
    EXPECT_FALSE(c.Overwrite(Json::Value("text")));
}

TEST_F(RelaydConfTest, WrongTypedKeysLeaveDefaults) {
    WriteConf(R"({"serverID": 12, "log_level": "7", "log_file": false, "server_global": "x",
                  "server_control": [1], "server_waitcmd": {"port": "81", "protocol": 1},
                  "server_myhub": {"account": 5}, "support_channel": {"enabled": "true"},
                  "enable": "yes", "debug": 1, "pid": "x", "network": 3})");
    StderrCapture cap;
    RelaydConf c(conf().c_str());
    EXPECT_EQ("", cap.stop());
    ExpectDefaults(c);
    EXPECT_TRUE(c.IsValid());
}

TEST_F(RelaydConfTest, ReadsEveryKnownKey) {
    WriteConf(R"({"serverID": "srv-1", "log_level": 7, "log_file": "/var/log/x.log",
                  "server_global": {"host": "g.example", "port": 8443},
                  "server_control": {"host": "c.example"}, "server_waitcmd": {"ip": "192.0.2.7", "host": ""},
                  "server_alias": {"alias": "myname"}, "server_myhub": {"account": "me@example.org"},
                  "support_channel": {"enabled": true},
                  "service": [{"id": "nos"}, {"id": "nos_https", "ext_port": 8443}]})");
    RelaydConf c(conf().c_str());
    EXPECT_EQ("srv-1", c.serverID);
    EXPECT_EQ(7, c.logLevel);
    EXPECT_EQ("/var/log/x.log", c.logFile);
    EXPECT_EQ("g.example", c.serverGlobal.host);
    EXPECT_EQ(8443, c.serverGlobal.port);
    EXPECT_EQ("c.example", c.serverControl.host);
    EXPECT_EQ("192.0.2.7", c.serverWaitCmd.ip);
    EXPECT_EQ("myname", c.alias.GetAliasName());
    EXPECT_EQ("me@example.org", c.myhub.GetMyHubAccount());
    EXPECT_TRUE(c.supportChannel.GetEnabled());
    ASSERT_EQ(2u, c.services.size());
    EXPECT_EQ("nos", c.services.front().id);
    EXPECT_EQ(5000, c.services.front().port);
    EXPECT_EQ("Management:HTTP", c.services.front().name);
    EXPECT_EQ(5001, c.services.back().port);
    EXPECT_EQ(8443, c.services.back().ext_port);
}

TEST_F(RelaydConfTest, ServiceKeyDecidesWhetherTheListIsReplaced) {
    RelaydConf c(nullptr);
    ASSERT_TRUE(c.Overwrite(ParseJson(R"({"service": [{"id": "nos"}]})")));
    ASSERT_EQ(1u, c.services.size());
    EXPECT_TRUE(c.Overwrite(ParseJson(R"({"serverID": "x"})")));
    EXPECT_EQ(1u, c.services.size());
    EXPECT_TRUE(c.Overwrite(ParseJson(R"({"service": []})")));
    EXPECT_TRUE(c.services.empty());
    ASSERT_TRUE(c.Overwrite(ParseJson(R"({"service": [{"id": "nos"}]})")));
    EXPECT_TRUE(c.Overwrite(ParseJson(R"({"service": "nos"})")));
    EXPECT_TRUE(c.services.empty());
}

TEST_F(RelaydConfTest, DuplicateServiceIdsKeepTheFirstSilently) {
    RelaydConf c(nullptr);
    StderrCapture cap;
    EXPECT_TRUE(c.Overwrite(ParseJson(R"({"service": [{"id": "nos", "ext_port": 1}, {"id": "nos_https"},
                                                       {"id": "nos", "ext_port": 2}]})")));
    EXPECT_EQ("", cap.stop());
    ASSERT_EQ(2u, c.services.size());
    EXPECT_EQ(1, c.services.front().ext_port);
    EXPECT_EQ("nos_https", c.services.back().id);
}

TEST_F(RelaydConfTest, InvalidServiceElementIsReportedByIndex) {
    RelaydConf c(nullptr);
    StderrCapture cap;
    EXPECT_TRUE(c.Overwrite(ParseJson(R"({"service": [{"id": "nos"}, {"id": "nosuch"}, 7,
                                                       {"id": "ssh"}]})")));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "invalid service config: 1")) << log;
    EXPECT_TRUE(LogContains(log, "invalid service config: 2")) << log;
    EXPECT_EQ(2u, LogMessages(log).size()) << log;
    ASSERT_EQ(2u, c.services.size());
    EXPECT_EQ("nos", c.services.front().id);
    EXPECT_EQ("ssh", c.services.back().id);
}

TEST_F(RelaydConfTest, ServiceFromFileWithPortStaysWhenSystemLacksIt) {
    RelaydConf c(nullptr);
    EXPECT_TRUE(c.Overwrite(ParseJson(R"({"service": [{"id": "custom", "port": 9000}]})")));
    ASSERT_EQ(1u, c.services.size());
    EXPECT_EQ(9000, c.services.front().port);
}

TEST_F(RelaydConfTest, InvalidMergedConfigurationIsReportedAndStaysMerged) {
    WriteConf(R"({"serverID": "kept", "server_global": {"protocol": "HTTPS"}})");
    StderrCapture cap;
    RelaydConf c(conf().c_str());
    std::string log = cap.stop();
    std::vector<std::string> msgs = LogMessages(log);
    ASSERT_EQ(2u, msgs.size()) << log;
    EXPECT_NE(std::string::npos, msgs[0].find("wrong global server config")) << log;
    EXPECT_NE(std::string::npos, msgs[1].find("invalid relayd config")) << log;
    EXPECT_EQ("kept", c.serverID);
    EXPECT_EQ("HTTPS", c.serverGlobal.protocol);
}

TEST_F(RelaydConfTest, ValidityChecksInOrder) {
    struct {
        const char* json;
        const char* message;
    } cases[] = {
        {R"({"server_global": {"port": -1}, "server_control": {"port": -1}})", "wrong global server config"},
        {R"({"server_control": {"host": ""}, "server_waitcmd": {"port": -1}})",
         "wrong control server config"},
        {R"({"server_waitcmd": {"protocol": "ftp"}})", "wrong wait cmd server config"},
    };
    for (const auto& c : cases) {
        RelaydConf conf(nullptr);
        conf.Overwrite(ParseJson(c.json));
        StderrCapture cap;
        EXPECT_FALSE(conf.IsValid());
        std::string log = cap.stop();
        ASSERT_EQ(1u, LogMessages(log).size()) << log;
        EXPECT_TRUE(LogContains(log, c.message)) << log;
    }
    RelaydConf conf(nullptr);
    conf.services.push_back(ServiceConf(ParseJson(R"({"id": "good", "port": 1})"), false));
    conf.services.push_back(ServiceConf(ParseJson(R"({"id": "broken"})"), false));
    StderrCapture cap;
    EXPECT_FALSE(conf.IsValid());
    EXPECT_TRUE(LogContains(cap.stop(), "wrong service [broken] config"));
}

TEST_F(RelaydConfTest, PersistentFormLayout) {
    RelaydConf c(nullptr);
    c.serverID = "srv";
    c.logFile = "/var/log/r.log";
    c.logLevel = 6;
    c.serverControl.host = "";
    c.serverControl.ip = "192.0.2.1";
    c.alias.SetAliasName("nas");
    c.myhub.SetMyHubAccount("me");
    c.supportChannel.SetEnabled(true);
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "nos", "name": "N", "port": 5000})"), false));
    c.network.mode = "m";
    Json::Value out;
    EXPECT_TRUE(c.Write(out, false));
    Json::Value alias, myhub;
    c.alias.Write(alias, true);
    c.myhub.Write(myhub, true);
    Json::Value expected = ParseJson(R"({
        "server_global": {"host": "global.zeparelay.example"},
        "server_control": {"host": "", "ip": "192.0.2.1"},
        "server_waitcmd": {"host": "global.zeparelay.example"},
        "support_channel": {"enabled": true},
        "serverID": "srv",
        "service": [{"id": "nos"}],
        "log_level": 6,
        "log_file": "/var/log/r.log"})");
    expected["server_global"]["host"] = RelaydConf::GLOBAL_HOST;
    expected["server_waitcmd"]["host"] = RelaydConf::GLOBAL_HOST;
    expected["server_alias"] = alias;
    expected["server_myhub"] = myhub;
    EXPECT_EQ(expected, out) << out.toStyledString();
}

TEST_F(RelaydConfTest, PersistentFormNeverHoldsRuntimeKeys) {
    RelaydConf c(nullptr);
    c.debug = true;
    c.enable = true;
    Json::Value out;
    c.Write(out, false);
    for (const char* key : {"enable", "debug", "pid", "network"}) EXPECT_FALSE(out.isMember(key)) << key;
    EXPECT_FALSE(out.isMember("serverID"));
    EXPECT_EQ(Json::Value(Json::arrayValue), out["service"]);
}

TEST_F(RelaydConfTest, FullFormAddsRuntimeKeys) {
    RelaydConf c(nullptr);
    c.debug = true;
    c.enable = true;
    c.network.mode = "relay";
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "nos", "name": "N", "port": 5000})"), false));
    Json::Value out;
    EXPECT_TRUE(c.Write(out, true));
    EXPECT_TRUE(out["enable"].asBool());
    EXPECT_TRUE(out["debug"].asBool());
    EXPECT_EQ(getpid(), out["pid"].asInt());
    EXPECT_EQ("relay", out["network"]["mode"].asString());
    EXPECT_TRUE(out["network"]["interface"].isArray());
    EXPECT_EQ(443, out["server_global"]["port"].asInt());
    EXPECT_EQ("https", out["server_control"]["protocol"].asString());
    EXPECT_EQ(ParseJson(R"([{"id": "nos", "name": "N", "port": 5000}])"), out["service"]);
    std::ostringstream os;
    os << c;
    EXPECT_EQ(out, ParseJson(os.str()));
}

TEST_F(RelaydConfTest, RuntimeKeysAreNeverReadBack) {
    RelaydConf c(nullptr);
    Json::Value full;
    c.debug = true;
    c.Write(full, true);
    full["enable"] = true;
    full["network"]["mode"] = "x";
    RelaydConf other(nullptr);
    EXPECT_TRUE(other.Overwrite(full));
    EXPECT_FALSE(other.debug);
    EXPECT_FALSE(other.enable);
    EXPECT_EQ("", other.network.mode);
}

TEST_F(RelaydConfTest, ReloadKeepsRuntimeServersAndIdentity) {
    WriteConf(R"({"serverID": "old", "server_global": {"host": "g1.example"},
                  "server_control": {"host": "c1.example"}})");
    RelaydConf c(conf().c_str());
    c.serverControl.host = "runtime-control.example";
    c.serverControl.port = 8443;
    c.serverWaitCmd.host = "runtime-wait.example";
    c.auth.serial = "S";
    c.auth.token = "T";
    c.auth.mac = "00:11:22:33:44:55";
    c.debug = true;
    c.network.mode = "tunnel";
    c.logLevel = 7;
    WriteConf(R"({"serverID": "new", "log_level": 5, "server_global": {"host": "g2.example"},
                  "server_control": {"host": "c2.example"}, "server_waitcmd": {"host": "w2.example"},
                  "support_channel": {"enabled": true}, "service": [{"id": "ssh"}]})");
    SetInfo(root, "runrelayd", "yes");
    EXPECT_TRUE(c.Reload());
    EXPECT_EQ("new", c.serverID);
    EXPECT_EQ(5, c.logLevel);
    EXPECT_EQ("g2.example", c.serverGlobal.host);
    EXPECT_TRUE(c.supportChannel.GetEnabled());
    ASSERT_EQ(1u, c.services.size());
    EXPECT_EQ("ssh", c.services.front().id);
    EXPECT_TRUE(c.enable);
    EXPECT_EQ("runtime-control.example", c.serverControl.host);
    EXPECT_EQ(8443, c.serverControl.port);
    EXPECT_EQ("runtime-wait.example", c.serverWaitCmd.host);
    EXPECT_EQ("S", c.auth.serial);
    EXPECT_EQ("T", c.auth.token);
    EXPECT_TRUE(c.debug);
    EXPECT_EQ("tunnel", c.network.mode);
    EXPECT_EQ(conf(), c.path);
}

TEST_F(RelaydConfTest, ReloadReadsTheNetworkStateFromTheSystem) {
    WriteConf("{}");
    RelaydConf c(conf().c_str());
    EXPECT_TRUE(c.network.interfaces.empty());
    c.network.gateway = "stale";
    c.network.mode = "kept";
    ASSERT_TRUE(c.Reload());
    NetworkConf live(true);
    EXPECT_TRUE(c.network == live);
    EXPECT_EQ(live.interfaces.size(), c.network.interfaces.size());
    EXPECT_NE("stale", c.network.gateway);
    EXPECT_EQ("kept", c.network.mode);
}

TEST_F(RelaydConfTest, ReloadAlwaysUsesTheDefaultFile) {
    root.write("/elsewhere/relayd.conf", R"({"serverID": "elsewhere"})");
    RelaydConf c(root.path("/elsewhere/relayd.conf").c_str());
    ASSERT_EQ("elsewhere", c.serverID);
    WriteConf(R"({"serverID": "default"})");
    EXPECT_TRUE(c.Reload());
    EXPECT_EQ("default", c.serverID);
    EXPECT_EQ(conf(), c.path);
}

TEST_F(RelaydConfTest, ReloadOfAMissingFileGivesDefaults) {
    WriteConf(R"({"serverID": "x", "service": [{"id": "nos"}]})");
    RelaydConf c(conf().c_str());
    ASSERT_EQ(1u, c.services.size());
    unlink(conf().c_str());
    StderrCapture cap;
    EXPECT_TRUE(c.Reload());
    EXPECT_TRUE(LogContains(cap.stop(), "can not overwrite default"));
    EXPECT_EQ("", c.serverID);
    EXPECT_TRUE(c.services.empty());
}

TEST_F(RelaydConfTest, FailedReloadChangesNothing) {
    WriteConf(R"({"serverID": "before"})");
    RelaydConf c(conf().c_str());
    WriteConf(R"({"serverID": "after", "server_global": {"port": -5}})");
    StderrCapture cap;
    EXPECT_FALSE(c.Reload());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "wrong global server config")) << log;
    EXPECT_TRUE(LogContains(log, "reload config failed")) << log;
    EXPECT_EQ("before", c.serverID);
    EXPECT_EQ(443, c.serverGlobal.port);
}

TEST_F(RelaydConfTest, AliasRequestDataReadsIdentityWhenMissing) {
    root.write("/etc/zepa/hubtoken.conf",
               "serial=\"1234ABCD\"\ntoken=\"0123456789abcdef0123456789abcdef\"\n");
    root.write("/etc.defaults/zepainfo.conf", "upnpmodelname=\"ZN-400\"\n");
    SetInfo(root, "timezone", "Asia/Taipei");
    RelaydConf c(nullptr);
    c.serverID = "srv-9";
    c.alias.SetAliasName("nas");
    Json::Value out;
    c.DumpDataForAliasReq(out);
    Json::Value alias;
    c.alias.Write(alias, false);
    for (const std::string& key : alias.getMemberNames()) EXPECT_EQ(alias[key], out[key]) << key;
    EXPECT_EQ("1234ABCD", out["serial"].asString());
    EXPECT_EQ("0123456789abcdef0123456789abcdef", out["token"].asString());
    EXPECT_EQ("Asia/Taipei", out["timezone"].asString());
    EXPECT_EQ("ZN-400", out["model"].asString());
    EXPECT_EQ("srv-9", out["id"].asString());
    EXPECT_EQ("1234ABCD", c.auth.serial);
}

TEST_F(RelaydConfTest, AliasRequestDataKeepsKnownIdentity) {
    root.write("/etc/zepa/hubtoken.conf", "serial=\"FROMSYSTEM\"\ntoken=\"t\"\n");
    RelaydConf c(nullptr);
    c.auth.serial = "KNOWN";
    c.auth.token = "tok";
    Json::Value out;
    c.DumpDataForAliasReq(out);
    EXPECT_EQ("KNOWN", out["serial"].asString());
    EXPECT_EQ("tok", out["token"].asString());
    EXPECT_EQ("", out["id"].asString());
}

TEST_F(RelaydConfTest, WrittenFormReadsBackEqual) {
    RelaydConf original(conf().c_str());
    original.serverID = "relay-42";
    original.serverGlobal.host = "relay.example.net";
    original.serverWaitCmd.port = 8080;
    ASSERT_TRUE(original.AddServiceById("nos"));
    RelaydConf fresh(conf().c_str());
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

}  // namespace
