#include <gtest/gtest.h>

#include <cstring>
#include <set>

#include <zeparelayd/config_alias.h>
#include <zeparelayd/daemon.h>

#include "support/round_trip.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;

namespace {

class AliasConfTest : public zepatest::RootTest {};

AliasConf Configured() {
    AliasConf conf;
    conf.Overwrite(
        ParseJson("{\"alias\":\"box\",\"url\":\"https://alias.example.net\",\"poll_seconds\":600}"));
    return conf;
}

TEST_F(AliasConfTest, WrittenFormReadsBackEqual) {
    AliasConf original;
    ASSERT_TRUE(original.Overwrite(
        ParseJson("{\"alias\":\"mybox\",\"poll_seconds\":600,\"url\":\"https://alias.example.net/\"}")));
    AliasConf fresh;
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

}  // namespace

TEST_F(AliasConfTest, Defaults) {
    AliasConf conf;
    EXPECT_EQ("", conf.GetAliasName());
    EXPECT_FALSE(conf.IsAliasEnabled());
    EXPECT_FALSE(conf.IsChanged());
    EXPECT_EQ(28800, conf.GetPollSeconds());
    EXPECT_EQ(AliasConf::DEFAULT_URL, conf.GetUrl());
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(AliasConfTest, DefaultUrlIsSchemeAndHostOf30Characters) {
    std::string url = AliasConf::DEFAULT_URL;
    EXPECT_EQ(30u, url.size());
    EXPECT_EQ(0u, url.find("https://"));
    EXPECT_EQ(std::string::npos, url.find('/', 8));
    EXPECT_NE(std::string::npos, url.find('.', 8));
}

TEST_F(AliasConfTest, OverwriteTakesAllKeys) {
    AliasConf conf = Configured();
    EXPECT_EQ("box", conf.GetAliasName());
    EXPECT_TRUE(conf.IsAliasEnabled());
    EXPECT_EQ("https://alias.example.net", conf.GetUrl());
    EXPECT_EQ(600, conf.GetPollSeconds());
}

TEST_F(AliasConfTest, ZeroOrStringPeriodKeepsOldPeriod) {
    AliasConf conf = Configured();
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"alias\":\"box\",\"poll_seconds\":0}")));
    EXPECT_EQ(600, conf.GetPollSeconds());
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"alias\":\"box\",\"poll_seconds\":\"600\"}")));
    EXPECT_EQ(600, conf.GetPollSeconds());
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"alias\":\"box\",\"poll_seconds\":-5}")));
    EXPECT_EQ(600, conf.GetPollSeconds());
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"alias\":\"box\",\"poll_seconds\":null}")));
    EXPECT_EQ(600, conf.GetPollSeconds());
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"alias\":\"box\",\"poll_seconds\":[30]}")));
    EXPECT_EQ(600, conf.GetPollSeconds());
}

TEST_F(AliasConfTest, EmptyObjectClearsAliasKeepsUrlAndPeriod) {
    AliasConf conf = Configured();
    EXPECT_TRUE(conf.Overwrite(ParseJson("{}")));
    EXPECT_EQ("", conf.GetAliasName());
    EXPECT_FALSE(conf.IsAliasEnabled());
    EXPECT_EQ("https://alias.example.net", conf.GetUrl());
    EXPECT_EQ(600, conf.GetPollSeconds());
}

TEST_F(AliasConfTest, NonStringAliasClearsAliasToo) {
    AliasConf conf = Configured();
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"alias\":5}")));
    EXPECT_EQ("", conf.GetAliasName());
}

TEST_F(AliasConfTest, NonObjectClearsAliasKeepsRest) {
    for (const char* text : {"[\"alias\"]", "null", "\"box\"", "3"}) {
        AliasConf conf = Configured();
        EXPECT_TRUE(conf.Overwrite(ParseJson(text))) << text;
        EXPECT_EQ("", conf.GetAliasName()) << text;
        EXPECT_EQ("https://alias.example.net", conf.GetUrl()) << text;
        EXPECT_EQ(600, conf.GetPollSeconds()) << text;
    }
}

TEST_F(AliasConfTest, EmptyOrWrongTypeUrlKeepsUrl) {
    AliasConf conf = Configured();
    for (const char* text : {"{\"url\":\"\"}", "{\"url\":7}", "{\"url\":null}", "{\"url\":{\"a\":\"b\"}}"}) {
        EXPECT_TRUE(conf.Overwrite(ParseJson(text))) << text;
        EXPECT_EQ("https://alias.example.net", conf.GetUrl()) << text;
    }
}

TEST_F(AliasConfTest, CompactWriteOfDefaultIsAliasOnly) {
    AliasConf conf;
    Json::Value out;
    EXPECT_TRUE(conf.Write(out, true));
    EXPECT_EQ(ParseJson("{\"alias\":\"\"}"), out);
}

TEST_F(AliasConfTest, CompactWriteAddsNonDefaults) {
    AliasConf conf = Configured();
    Json::Value out;
    conf.Write(out, true);
    EXPECT_EQ(ParseJson("{\"alias\":\"box\",\"url\":\"https://alias.example.net\",\"poll_seconds\":600}"),
              out);
}

TEST_F(AliasConfTest, FullWriteHasEveryKey) {
    AliasConf conf;
    Json::Value out;
    EXPECT_TRUE(conf.Write(out, false));
    EXPECT_EQ("", out["alias"].asString());
    EXPECT_EQ(28800, out["poll_seconds"].asInt());
    EXPECT_EQ(AliasConf::DEFAULT_URL, out["url"].asString());
    EXPECT_EQ(3u, out.size());
}

TEST_F(AliasConfTest, RoundTripInBothForms) {
    for (bool compact : {false, true}) {
        AliasConf conf = Configured();
        Json::Value out;
        conf.Write(out, compact);
        AliasConf back;
        back.Overwrite(out);
        EXPECT_EQ(conf.GetAliasName(), back.GetAliasName());
        EXPECT_EQ(conf.GetUrl(), back.GetUrl());
        EXPECT_EQ(conf.GetPollSeconds(), back.GetPollSeconds());
    }
}

TEST_F(AliasConfTest, SetAliasNameKeepsChangedFlag) {
    AliasConf conf;
    EXPECT_TRUE(conf.SetAliasName("nas"));
    EXPECT_EQ("nas", conf.GetAliasName());
    EXPECT_TRUE(conf.IsAliasEnabled());
    EXPECT_FALSE(conf.IsChanged());
    conf.CommitChange();
    EXPECT_FALSE(conf.IsChanged());
}

TEST_F(AliasConfTest, PollingTimeWithPeriodOneIsOne) {
    AliasConf conf;
    conf.Overwrite(ParseJson("{\"poll_seconds\":1}"));
    for (int i = 0; i < 200; ++i) EXPECT_EQ(1, conf.GetPollingTime());
}

TEST_F(AliasConfTest, PollingTimeWithDefaultPeriodStaysInRange) {
    AliasConf conf;
    std::set<int> seen;
    for (int i = 0; i < 2000; ++i) {
        int t = conf.GetPollingTime();
        ASSERT_GE(t, 28800);
        ASSERT_LE(t, 57599);
        seen.insert(t);
    }
    EXPECT_GT(seen.size(), 1u);
}

// Periods past half the int range: the delay is never below the period
// and never wraps into a negative number.
TEST_F(AliasConfTest, PollingTimeOfAHugePeriodStaysAtLeastThePeriod) {
    for (const char* period : {"1799981407", "2147483647", "1073741824"}) {
        SCOPED_TRACE(period);
        AliasConf conf;
        ASSERT_TRUE(conf.Overwrite(ParseJson(std::string("{\"poll_seconds\":") + period + "}")));
        const int poll = conf.GetPollSeconds();
        ASSERT_EQ(std::stoll(period), poll);
        for (int i = 0; i < 2000; ++i) ASSERT_GE(conf.GetPollingTime(), poll);
    }
}

TEST_F(AliasConfTest, ValidSectionLogsNothing) {
    AliasConf conf;
    zepatest::StderrCapture cap;
    EXPECT_TRUE(conf.IsValid());
    EXPECT_EQ("", cap.stop());
}

TEST_F(AliasConfTest, IsValidIgnoresEmptyAlias) {
    AliasConf conf = Configured();
    conf.SetAliasName("");
    EXPECT_TRUE(conf.IsValid());
}
