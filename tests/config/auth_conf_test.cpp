#include <gtest/gtest.h>
#include <zepasdk/identity.h>

#include <unistd.h>

#include <sstream>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>

#include "support/fake_sdk/fake_sdk.h"
#include "support/round_trip.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogContains;
using zepatest::ParseJson;

namespace {

const char SERIAL[] = "2150ABN123456";
const char TOKEN[] = "0123456789abcdef0123456789abcdef";
const char API_KEY[] = "k3y-abcdefabcdefabcdef-9876";

class AuthConfTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        zepafake::Reset();
        zepafake::Fake().mac = "02:11:22:33:44:55";
    }
    void WriteIdentity() {
        root.write("/etc/zepa/hubtoken.conf",
                   std::string("serial=\"") + SERIAL + "\"\ntoken=\"" + TOKEN + "\"\n");
        root.write("/etc.defaults/zepainfo.conf", "upnpmodelname=\"ZP-420\"\n");
        root.write("/etc/zepa/cloudservice.conf", std::string("api_key=\"") + API_KEY + "\"\n");
        root.write("/etc/zepainfo.conf", "timezone=\"Amsterdam\"\n");
    }
    std::string Generated(const std::string& serial) {
        char buf[33] = {0};
        EXPECT_EQ(0, ZEPAHubtokenGenerateToken(serial.c_str(), buf, sizeof(buf)));
        return buf;
    }
};

AuthConf Filled() {
    AuthConf conf(false);
    conf.Overwrite(ParseJson(std::string("{\"serial\":\"") + SERIAL + "\",\"token\":\"" + TOKEN +
                             "\",\"mac\":\"02:11:22:33:44:55\",\"key\":\"" + API_KEY +
                             "\",\"model\":\"ZP-420\"}"));
    return conf;
}

TEST_F(AuthConfTest, WrittenFormReadsBackEqual) {
    AuthConf original(false);
    ASSERT_TRUE(original.Overwrite(ParseJson("{\"serial\":\"ABC123\",\"token\":\"given\"}")));
    AuthConf fresh(false);
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

}  // namespace

TEST_F(AuthConfTest, ConstructorTakesTimeZoneOnly) {
    WriteIdentity();
    AuthConf conf(false);
    EXPECT_EQ("Amsterdam", conf.timezone);
    EXPECT_EQ("", conf.serial);
    EXPECT_EQ("", conf.token);
    EXPECT_EQ("", conf.mac);
    EXPECT_EQ("", conf.key);
    EXPECT_EQ("", conf.model);
    EXPECT_EQ(0, zepafake::Fake().macCalls);
    EXPECT_FALSE(conf.IsValid());
}

TEST_F(AuthConfTest, ConstructorWithReadFillsIdentity) {
    WriteIdentity();
    AuthConf conf(true);
    EXPECT_EQ(SERIAL, conf.serial);
    EXPECT_EQ(TOKEN, conf.token);
    EXPECT_EQ("02:11:22:33:44:55", conf.mac);
    EXPECT_EQ(API_KEY, conf.key);
    EXPECT_EQ("ZP-420", conf.model);
    EXPECT_EQ("Amsterdam", conf.timezone);
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(AuthConfTest, ReadConfDoesNotRefreshTimeZone) {
    WriteIdentity();
    AuthConf conf(false);
    root.write("/etc/zepainfo.conf", "timezone=\"Tokyo\"\n");
    EXPECT_TRUE(conf.ReadConf());
    EXPECT_EQ("Amsterdam", conf.timezone);
}

TEST_F(AuthConfTest, ReadConfWithoutTokenFileFailsAndKeepsMembers) {
    WriteIdentity();
    ASSERT_EQ(0, unlink(root.path("/etc/zepa/hubtoken.conf").c_str()));
    AuthConf conf = Filled();
    conf.model = "old";
    zepatest::StderrCapture cap;
    EXPECT_FALSE(conf.ReadConf());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "config:")) << log;
    EXPECT_TRUE(LogContains(log, "ZEPAHubtokenGetToken failed: [0x0300]")) << log;
    EXPECT_EQ("old", conf.model);
    EXPECT_EQ(SERIAL, conf.serial);
    EXPECT_EQ(0, zepafake::Fake().macCalls);
}

TEST_F(AuthConfTest, ReadConfWithTokenMissingReportsKeyError) {
    WriteIdentity();
    root.write("/etc/zepa/hubtoken.conf", "serial=\"X1\"\n");
    AuthConf conf(false);
    zepatest::StderrCapture cap;
    EXPECT_FALSE(conf.ReadConf());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "ZEPAHubtokenGetToken failed: [0x0301]")) << log;
    EXPECT_EQ("", conf.serial);
}

TEST_F(AuthConfTest, ReadConfWithoutModelFileFailsAndKeepsMembers) {
    WriteIdentity();
    ASSERT_EQ(0, unlink(root.path("/etc.defaults/zepainfo.conf").c_str()));
    AuthConf conf(false);
    zepatest::StderrCapture cap;
    EXPECT_FALSE(conf.ReadConf());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "VLIBCFileGetKeyValue failed: [0x0300]")) << log;
    EXPECT_EQ("", conf.serial);
    EXPECT_EQ("", conf.token);
}

TEST_F(AuthConfTest, MissingModelKeyIsNotAnError) {
    WriteIdentity();
    root.write("/etc.defaults/zepainfo.conf", "other=\"1\"\n");
    AuthConf conf(false);
    conf.model = "old";
    EXPECT_TRUE(conf.ReadConf());
    EXPECT_EQ("", conf.model);
    EXPECT_EQ(SERIAL, conf.serial);
}

TEST_F(AuthConfTest, MissingApiKeyLeavesKeyEmpty) {
    WriteIdentity();
    ASSERT_EQ(0, unlink(root.path("/etc/zepa/cloudservice.conf").c_str()));
    AuthConf conf(false);
    conf.key = "old";
    EXPECT_TRUE(conf.ReadConf());
    EXPECT_EQ("", conf.key);
    // Reading never registers a key on its own.
    EXPECT_FALSE(root.exists("/etc/zepa/cloudservice.conf"));
}

TEST_F(AuthConfTest, MacFailureIsLoggedAndLeavesSectionInvalid) {
    WriteIdentity();
    zepafake::Fake().macFails = true;
    AuthConf conf(false);
    zepatest::StderrCapture cap;
    EXPECT_TRUE(conf.ReadConf());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "invalid mac address")) << log;
    EXPECT_EQ("", conf.mac);
    EXPECT_EQ(SERIAL, conf.serial);
    EXPECT_FALSE(conf.IsValid());
}

TEST_F(AuthConfTest, MacIsTheSameForEveryInterfaceName) {
    AuthConf conf(false);
    EXPECT_EQ("02:11:22:33:44:55", conf.RelaydGetMacAddressByIf("eth0"));
    EXPECT_EQ("02:11:22:33:44:55", conf.RelaydGetMacAddressByIf("nosuch9"));
    EXPECT_EQ("02:11:22:33:44:55", conf.GetMacAddress());
    zepafake::Fake().macFails = true;
    EXPECT_EQ("", conf.RelaydGetMacAddressByIf("eth0"));
}

TEST_F(AuthConfTest, SerialWithoutTokenGeneratesToken) {
    AuthConf conf(false);
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"serial\":\"ABC123\"}")));
    EXPECT_EQ("ABC123", conf.serial);
    EXPECT_EQ(32u, conf.token.size());
    EXPECT_EQ(Generated("ABC123"), conf.token);
    EXPECT_NE(Generated("ABC124"), conf.token);
}

TEST_F(AuthConfTest, EmptyTokenBesideSerialGeneratesToken) {
    AuthConf conf(false);
    conf.Overwrite(ParseJson("{\"serial\":\"ABC123\",\"token\":\"\"}"));
    EXPECT_EQ(Generated("ABC123"), conf.token);
}

TEST_F(AuthConfTest, SerialWithTokenTakesBothWithoutGenerating) {
    AuthConf conf(false);
    conf.Overwrite(ParseJson("{\"serial\":\"ABC123\",\"token\":\"given\"}"));
    EXPECT_EQ("ABC123", conf.serial);
    EXPECT_EQ("given", conf.token);
    // Generation would have created the device secret.
    EXPECT_FALSE(root.exists("/etc/zepa/hubtoken.secret"));
}

TEST_F(AuthConfTest, TokenWithoutSerialChangesNeither) {
    AuthConf conf = Filled();
    conf.Overwrite(ParseJson("{\"token\":\"other\"}"));
    EXPECT_EQ(SERIAL, conf.serial);
    EXPECT_EQ(TOKEN, conf.token);
    conf.Overwrite(ParseJson("{\"serial\":\"\",\"token\":\"other\"}"));
    EXPECT_EQ(SERIAL, conf.serial);
    EXPECT_EQ(TOKEN, conf.token);
}

TEST_F(AuthConfTest, FailedGenerationLogsAndEmptiesToken) {
    // A file where the secret's folder belongs: the secret cannot be created.
    root.write("/etc/zepa", "not a folder");
    AuthConf conf = Filled();
    zepatest::StderrCapture cap;
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"serial\":\"NEW1\"}")));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "gen token failed")) << log;
    EXPECT_EQ("NEW1", conf.serial);
    EXPECT_EQ("", conf.token);
    EXPECT_FALSE(conf.IsValid());
}

TEST_F(AuthConfTest, OverwriteNeverChangesTimeZone) {
    root.write("/etc/zepainfo.conf", "timezone=\"Amsterdam\"\n");
    AuthConf conf(false);
    conf.Overwrite(ParseJson("{\"timezone\":\"Tokyo\",\"serial\":\"S\",\"token\":\"T\"}"));
    EXPECT_EQ("Amsterdam", conf.timezone);
}

TEST_F(AuthConfTest, OverwriteTakesMacKeyModelDirectly) {
    AuthConf conf(false);
    conf.Overwrite(ParseJson("{\"mac\":\"m\",\"key\":\"k\",\"model\":\"x\"}"));
    EXPECT_EQ("m", conf.mac);
    EXPECT_EQ("k", conf.key);
    EXPECT_EQ("x", conf.model);
    EXPECT_EQ("", conf.serial);
}

TEST_F(AuthConfTest, WrongTypesAndNullsLeaveMembers) {
    AuthConf conf = Filled();
    EXPECT_TRUE(conf.Overwrite(
        ParseJson("{\"serial\":7,\"token\":null,\"mac\":[\"x\"],\"key\":{\"a\":1},\"model\":false}")));
    EXPECT_EQ(SERIAL, conf.serial);
    EXPECT_EQ(TOKEN, conf.token);
    EXPECT_EQ("02:11:22:33:44:55", conf.mac);
    EXPECT_EQ(API_KEY, conf.key);
    EXPECT_EQ("ZP-420", conf.model);
    // A serial of the wrong type does not let a string token through either.
    conf.Overwrite(ParseJson("{\"serial\":[\"S\"],\"token\":\"T\"}"));
    EXPECT_EQ(SERIAL, conf.serial);
    EXPECT_EQ(TOKEN, conf.token);
}

TEST_F(AuthConfTest, NonObjectsChangeNothing) {
    for (const char* text : {"[{\"serial\":\"S\"}]", "\"S\"", "null", "12"}) {
        AuthConf conf = Filled();
        EXPECT_TRUE(conf.Overwrite(ParseJson(text))) << text;
        EXPECT_EQ(SERIAL, conf.serial) << text;
        EXPECT_EQ(TOKEN, conf.token) << text;
        EXPECT_EQ(API_KEY, conf.key) << text;
    }
}

TEST_F(AuthConfTest, PersistentFormHasFiveKeysFullFormSix) {
    AuthConf conf = Filled();
    Json::Value persistent;
    EXPECT_TRUE(conf.Write(persistent, false));
    EXPECT_EQ(5u, persistent.size());
    EXPECT_FALSE(persistent.isMember("token"));
    for (const char* k : {"serial", "mac", "timezone", "key", "model"})
        EXPECT_TRUE(persistent.isMember(k)) << k;
    Json::Value full;
    EXPECT_TRUE(conf.Write(full, true));
    EXPECT_EQ(6u, full.size());
    EXPECT_EQ(TOKEN, full["token"].asString());
}

TEST_F(AuthConfTest, FullFormReadsBack) {
    AuthConf conf = Filled();
    Json::Value full;
    conf.Write(full, true);
    AuthConf back(false);
    back.Overwrite(full);
    EXPECT_EQ(conf.serial, back.serial);
    EXPECT_EQ(conf.token, back.token);
    EXPECT_EQ(conf.mac, back.mac);
    EXPECT_EQ(conf.key, back.key);
    EXPECT_EQ(conf.model, back.model);
}

TEST_F(AuthConfTest, ValidityNeedsSerialMacAndToken) {
    AuthConf conf = Filled();
    EXPECT_TRUE(conf.IsValid());
    conf.mac.clear();
    EXPECT_FALSE(conf.IsValid());
    conf = Filled();
    conf.serial.clear();
    EXPECT_FALSE(conf.IsValid());
    conf = Filled();
    conf.token.clear();
    EXPECT_FALSE(conf.IsValid());
    conf = Filled();
    conf.key.clear();
    conf.model.clear();
    conf.timezone.clear();
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(AuthConfTest, GenerateApiKeyRegistersAndKeepsFreshKey) {
    AuthConf conf(false);
    conf.GenerateApiKey();
    EXPECT_EQ(64u, conf.key.size());
    EXPECT_NE(std::string::npos, root.read("/etc/zepa/cloudservice.conf").find(conf.key));
    std::string first = conf.key;
    conf.GenerateApiKey();
    EXPECT_NE(first, conf.key);
}

TEST_F(AuthConfTest, CredentialsNeverReachTheLog) {
    Daemon::_logLevel = 7;
    WriteIdentity();
    zepatest::StderrCapture cap;
    AuthConf conf(true);
    conf.IsValid();
    Json::Value out;
    conf.Write(out, true);
    std::ostringstream printed;
    printed << conf;

    AuthConf other(false);
    other.Overwrite(ParseJson("{\"serial\":\"S-LOG\"}"));
    other.GenerateApiKey();
    other.ReadConf();

    // Failure paths: no secret for generation, no MAC, no identity file.
    ASSERT_EQ(0, unlink(root.path("/etc/zepa/hubtoken.secret").c_str()));
    root.mkdir("/etc/zepa/hubtoken.secret");
    conf.Overwrite(ParseJson("{\"serial\":\"S-FAIL\"}"));
    zepafake::Fake().macFails = true;
    conf.ReadConf();
    ASSERT_EQ(0, unlink(root.path("/etc/zepa/hubtoken.conf").c_str()));
    conf.ReadConf();
    std::string log = cap.stop();

    EXPECT_TRUE(LogContains(log, "gen token failed")) << log;
    EXPECT_TRUE(LogContains(log, "invalid mac address")) << log;
    EXPECT_TRUE(LogContains(log, "ZEPAHubtokenGetToken failed")) << log;
    EXPECT_NE(std::string::npos, printed.str().find(TOKEN));
    EXPECT_NE(std::string::npos, printed.str().find(API_KEY));
    ASSERT_EQ(32u, other.token.size());
    ASSERT_EQ(64u, other.key.size());
    for (const std::string& secret : {std::string(TOKEN), std::string(API_KEY), other.token, other.key})
        EXPECT_EQ(std::string::npos, log.find(secret)) << log;
}
