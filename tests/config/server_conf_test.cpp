#include <gtest/gtest.h>

#include <sstream>

#include <zeparelayd/config.h>

#include "support/round_trip.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;

namespace {

class ServerConfTest : public zepatest::RootTest {};

std::vector<std::string> Keys(const Json::Value& v) { return v.getMemberNames(); }

TEST_F(ServerConfTest, WrittenFormReadsBackEqual) {
    // Only the host is stored; the rest stays at what a reader starts from.
    ServerConf original(nullptr, nullptr);
    ASSERT_TRUE(original.Overwrite(ParseJson("{\"host\":\"relay.example.net\"}")));
    ServerConf fresh(nullptr, nullptr);
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

}  // namespace

TEST_F(ServerConfTest, DefaultsAndNullArguments) {
    ServerConf conf(nullptr, nullptr);
    EXPECT_EQ("http", conf.protocol);
    EXPECT_EQ("", conf.host);
    EXPECT_EQ("", conf.ip);
    EXPECT_EQ(80, conf.port);
    EXPECT_EQ("Serv.php", conf.page);
    EXPECT_FALSE(conf.IsValid());
}

TEST_F(ServerConfTest, HostAndPageArgumentsReplaceDefaults) {
    ServerConf conf("relay.example.net", "wait.php");
    EXPECT_EQ("relay.example.net", conf.host);
    EXPECT_EQ("wait.php", conf.page);
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(ServerConfTest, IpOnlyIsValid) {
    ServerConf conf(nullptr, nullptr);
    conf.ip = "192.0.2.7";
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(ServerConfTest, ProtocolMustBeLowerCaseHttpOrHttps) {
    ServerConf conf("h", nullptr);
    conf.protocol = "HTTPS";
    EXPECT_FALSE(conf.IsValid());
    conf.protocol = "Http";
    EXPECT_FALSE(conf.IsValid());
    conf.protocol = "ftp";
    EXPECT_FALSE(conf.IsValid());
    conf.protocol = "";
    EXPECT_FALSE(conf.IsValid());
    conf.protocol = "https";
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(ServerConfTest, PortZeroValidNegativeInvalid) {
    ServerConf conf("h", nullptr);
    conf.port = 0;
    EXPECT_TRUE(conf.IsValid());
    conf.port = -1;
    EXPECT_FALSE(conf.IsValid());
}

TEST_F(ServerConfTest, FullFormOfDefaultSectionHasAllKeysInOrder) {
    ServerConf conf(nullptr, nullptr);
    Json::Value out;
    EXPECT_TRUE(conf.Write(out, true));
    ASSERT_EQ(5u, out.size());
    EXPECT_EQ("", out["host"].asString());
    EXPECT_EQ("", out["ip"].asString());
    EXPECT_EQ("http", out["protocol"].asString());
    EXPECT_TRUE(out["port"].isInt());
    EXPECT_EQ(80, out["port"].asInt());
    EXPECT_EQ("Serv.php", out["page"].asString());
    std::ostringstream os;
    os << conf;
    EXPECT_EQ("{\"host\":\"\",\"ip\":\"\",\"page\":\"Serv.php\",\"port\":80,\"protocol\":\"http\"}\n",
              os.str());
}

TEST_F(ServerConfTest, PersistentFormWithHostHasOnlyHost) {
    ServerConf conf("relay.example.net", nullptr);
    conf.ip = "192.0.2.1";
    Json::Value out;
    EXPECT_TRUE(conf.Write(out, false));
    EXPECT_EQ(std::vector<std::string>{"host"}, Keys(out));
    EXPECT_EQ("relay.example.net", out["host"].asString());
}

TEST_F(ServerConfTest, PersistentFormWithoutHostAddsIp) {
    ServerConf conf(nullptr, nullptr);
    conf.ip = "192.0.2.1";
    Json::Value out;
    conf.Write(out, false);
    EXPECT_EQ(2u, out.size());
    EXPECT_EQ("", out["host"].asString());
    EXPECT_EQ("192.0.2.1", out["ip"].asString());
}

TEST_F(ServerConfTest, WriteLeavesOtherKeysAlone) {
    ServerConf conf("h", nullptr);
    Json::Value out = ParseJson("{\"other\": 5, \"host\": \"old\"}");
    conf.Write(out, false);
    EXPECT_EQ(5, out["other"].asInt());
    EXPECT_EQ("h", out["host"].asString());
}

TEST_F(ServerConfTest, PersistentRoundTripDropsProtocolPortPage) {
    ServerConf conf("relay.example.net", "x.php");
    conf.protocol = "https";
    conf.port = 443;
    Json::Value out;
    conf.Write(out, false);
    ServerConf back(out);
    EXPECT_EQ("relay.example.net", back.host);
    EXPECT_EQ("http", back.protocol);
    EXPECT_EQ(80, back.port);
    EXPECT_EQ("Serv.php", back.page);
}

TEST_F(ServerConfTest, FullRoundTripKeepsEverything) {
    ServerConf conf("relay.example.net", "x.php");
    conf.protocol = "https";
    conf.port = 8443;
    conf.ip = "192.0.2.9";
    Json::Value out;
    conf.Write(out, true);
    ServerConf back(out);
    EXPECT_EQ(conf.host, back.host);
    EXPECT_EQ(conf.ip, back.ip);
    EXPECT_EQ(conf.protocol, back.protocol);
    EXPECT_EQ(conf.port, back.port);
    EXPECT_EQ(conf.page, back.page);
}

TEST_F(ServerConfTest, OverwriteTakesKeysOfExpectedType) {
    ServerConf conf(nullptr, nullptr);
    EXPECT_TRUE(
        conf.Overwrite(ParseJson("{\"protocol\":\"https\",\"host\":\"h.example\",\"ip\":\"192.0.2.3\","
                                 "\"port\":443,\"page\":\"p.php\"}")));
    EXPECT_EQ("https", conf.protocol);
    EXPECT_EQ("h.example", conf.host);
    EXPECT_EQ("192.0.2.3", conf.ip);
    EXPECT_EQ(443, conf.port);
    EXPECT_EQ("p.php", conf.page);
}

TEST_F(ServerConfTest, OverwriteIgnoresWrongTypesAndNulls) {
    ServerConf conf("h.example", "p.php");
    conf.ip = "192.0.2.3";
    EXPECT_TRUE(conf.Overwrite(
        ParseJson("{\"protocol\":1,\"host\":null,\"ip\":[\"x\"],\"port\":\"443\",\"page\":{\"a\":1}}")));
    EXPECT_EQ("http", conf.protocol);
    EXPECT_EQ("h.example", conf.host);
    EXPECT_EQ("192.0.2.3", conf.ip);
    EXPECT_EQ(80, conf.port);
    EXPECT_EQ("p.php", conf.page);
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"port\":true}")));
    EXPECT_EQ(80, conf.port);
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"port\":null}")));
    EXPECT_EQ(80, conf.port);
}

TEST_F(ServerConfTest, OverwriteWithNonObjectChangesNothing) {
    for (const char* text : {"[{\"host\":\"x\"}]", "\"host\"", "7", "null", "true"}) {
        ServerConf conf("h.example", nullptr);
        EXPECT_TRUE(conf.Overwrite(ParseJson(text))) << text;
        EXPECT_EQ("h.example", conf.host) << text;
        EXPECT_EQ(80, conf.port) << text;
    }
}

TEST_F(ServerConfTest, OverwriteWithAbsentKeysKeepsMembers) {
    ServerConf conf("h.example", "p.php");
    conf.port = 1234;
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"unknown\":1}")));
    EXPECT_EQ("h.example", conf.host);
    EXPECT_EQ("p.php", conf.page);
    EXPECT_EQ(1234, conf.port);
}

TEST_F(ServerConfTest, GetUrlWithExplicitPage) {
    ServerConf conf("h", nullptr);
    conf.protocol = "https";
    conf.port = 443;
    EXPECT_EQ("https://h:443/alias_query.php", conf.GetUrl("alias_query.php"));
    EXPECT_EQ("https://h:443/Serv.php", conf.GetUrl(nullptr));
}

TEST_F(ServerConfTest, GetUrlWritesDefaultPortAndUsesIpWithoutHost) {
    ServerConf conf(nullptr, "x.php");
    conf.ip = "192.0.2.5";
    EXPECT_EQ("http://192.0.2.5:80/x.php", conf.GetUrl(nullptr));
}

TEST_F(ServerConfTest, GetUrlOfInvalidSectionIsEmpty) {
    ServerConf conf("h", nullptr);
    conf.protocol = "HTTPS";
    EXPECT_EQ("", conf.GetUrl("a.php"));
    EXPECT_EQ("", ServerConf(nullptr, nullptr).GetUrl(nullptr));
}

TEST_F(ServerConfTest, EqualityComparesHostPortProtocolOnly) {
    ServerConf a("h", "a.php");
    ServerConf b("h", "b.php");
    a.ip = "192.0.2.1";
    b.ip = "192.0.2.2";
    EXPECT_TRUE(a == b);
    EXPECT_FALSE(a != b);
    b.port = 81;
    EXPECT_FALSE(a == b);
    EXPECT_TRUE(a != b);
    b.port = 80;
    b.protocol = "https";
    EXPECT_TRUE(a != b);
    b.protocol = "http";
    b.host = "H";
    EXPECT_TRUE(a != b);
}

TEST_F(ServerConfTest, RegionDropsCharacterBeforeFirstDot) {
    EXPECT_EQ("ab", ServerConf("ab1.x.y", nullptr).GetRegion());
    EXPECT_EQ("abc", ServerConf("abc1.relay.example", nullptr).GetRegion());
    EXPECT_EQ("a", ServerConf("ab.x", nullptr).GetRegion());
}

TEST_F(ServerConfTest, RegionOfHostWithoutDotIsEmpty) {
    EXPECT_EQ("", ServerConf("localhost", nullptr).GetRegion());
    EXPECT_EQ("", ServerConf(nullptr, nullptr).GetRegion());
}

TEST_F(ServerConfTest, RegionOfLeadingDotIsWholeHost) {
    EXPECT_EQ(".x.y", ServerConf(".x.y", nullptr).GetRegion());
}

TEST_F(ServerConfTest, EnvConfRegionOverridesHost) {
    root.write("/usr/zepa/etc/zeparelayd/env.conf", "{\"relay_region\": \"eu\"}");
    EXPECT_EQ("eu", ServerConf("ab1.x.y", nullptr).GetRegion());
    EXPECT_EQ("eu", ServerConf("nodot", nullptr).GetRegion());
}

TEST_F(ServerConfTest, EnvConfEmptyRegionOverridesToo) {
    root.write("/usr/zepa/etc/zeparelayd/env.conf", "{\"relay_region\": \"\"}");
    EXPECT_EQ("", ServerConf("ab1.x.y", nullptr).GetRegion());
}

TEST_F(ServerConfTest, EnvConfNonStringRegionIsIgnored) {
    root.write("/usr/zepa/etc/zeparelayd/env.conf", "{\"relay_region\": 5, \"other\": \"eu\"}");
    EXPECT_EQ("ab", ServerConf("ab1.x.y", nullptr).GetRegion());
    root.write("/usr/zepa/etc/zeparelayd/env.conf", "[\"relay_region\"]");
    EXPECT_EQ("ab", ServerConf("ab1.x.y", nullptr).GetRegion());
}

TEST_F(ServerConfTest, CorruptEnvConfKeepsHostRegionAndIsRenamed) {
    root.write("/usr/zepa/etc/zeparelayd/env.conf", "relay_region=eu");
    EXPECT_EQ("ab", ServerConf("ab1.x.y", nullptr).GetRegion());
    EXPECT_FALSE(root.exists("/usr/zepa/etc/zeparelayd/env.conf"));
    EXPECT_TRUE(root.exists("/usr/zepa/etc/zeparelayd/env.conf.bad"));
}

TEST_F(ServerConfTest, StreamPrintsFullForm) {
    ServerConf conf("h", nullptr);
    std::ostringstream os;
    os << conf;
    Json::Value printed = ParseJson(os.str());
    EXPECT_EQ("h", printed["host"].asString());
    EXPECT_EQ(80, printed["port"].asInt());
}
