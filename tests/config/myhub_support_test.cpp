#include <gtest/gtest.h>

#include <cstring>

#include <zeparelayd/config.h>

#include "support/round_trip.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;

namespace {
class MyHubConfTest : public zepatest::RootTest {};
class SupportChannelConfTest : public zepatest::RootTest {};
TEST_F(MyHubConfTest, WrittenFormReadsBackEqual) {
    MyHubConf original;
    ASSERT_TRUE(
        original.Overwrite(ParseJson("{\"account\":\"me@example.org\",\"host\":\"acct.example.net\"}")));
    MyHubConf fresh;
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

TEST_F(SupportChannelConfTest, WrittenFormReadsBackEqual) {
    SupportChannelConf original;
    ASSERT_TRUE(original.Overwrite(ParseJson("{\"enabled\":true}")));
    SupportChannelConf fresh;
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

}  // namespace

TEST_F(MyHubConfTest, Defaults) {
    MyHubConf conf;
    EXPECT_EQ("", conf.GetMyHubAccount());
    EXPECT_EQ(MyHubConf::DEFAULT_HOST, conf.GetHost());
    EXPECT_NE(nullptr, strchr(MyHubConf::DEFAULT_HOST, '.'));
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(MyHubConfTest, OverwriteTakesStrings) {
    MyHubConf conf;
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"account\":\"me@example.org\",\"host\":\"acct.example.net\"}")));
    EXPECT_EQ("me@example.org", conf.GetMyHubAccount());
    EXPECT_EQ("acct.example.net", conf.GetHost());
}

TEST_F(MyHubConfTest, NumericAccountLeavesAccountUnchanged) {
    MyHubConf conf;
    conf.SetMyHubAccount("me");
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"account\":12345}")));
    EXPECT_EQ("me", conf.GetMyHubAccount());
}

TEST_F(MyHubConfTest, WrongTypesNullsAndNonObjectsChangeNothing) {
    MyHubConf conf;
    conf.SetMyHubAccount("me");
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"account\":null,\"host\":[\"h\"]}")));
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"account\":{\"a\":1},\"host\":false}")));
    EXPECT_TRUE(conf.Overwrite(ParseJson("[{\"account\":\"x\"}]")));
    EXPECT_TRUE(conf.Overwrite(ParseJson("\"account\"")));
    EXPECT_TRUE(conf.Overwrite(Json::Value()));
    EXPECT_TRUE(conf.Overwrite(ParseJson("{}")));
    EXPECT_EQ("me", conf.GetMyHubAccount());
    EXPECT_EQ(MyHubConf::DEFAULT_HOST, conf.GetHost());
}

TEST_F(MyHubConfTest, PersistentFormHoldsOnlyAccount) {
    MyHubConf conf;
    conf.Overwrite(ParseJson("{\"account\":\"me\",\"host\":\"acct.example.net\"}"));
    Json::Value out;
    EXPECT_TRUE(conf.Write(out, false));
    EXPECT_EQ(std::vector<std::string>{"account"}, out.getMemberNames());
    EXPECT_EQ("me", out["account"].asString());
}

TEST_F(MyHubConfTest, FullFormWritesOnlyNonDefaultHost) {
    MyHubConf conf;
    Json::Value out;
    conf.Write(out, true);
    EXPECT_EQ(std::vector<std::string>{"account"}, out.getMemberNames());

    conf.Overwrite(ParseJson("{\"host\":\"acct.example.net\"}"));
    Json::Value out2;
    conf.Write(out2, true);
    EXPECT_EQ("acct.example.net", out2["host"].asString());
    EXPECT_EQ("", out2["account"].asString());
}

TEST_F(MyHubConfTest, DefaultHostReadFromFileIsLeftOutOnNextWrite) {
    Json::Value in(Json::objectValue);
    in["account"] = "me";
    in["host"] = MyHubConf::DEFAULT_HOST;
    MyHubConf conf;
    conf.Overwrite(in);
    EXPECT_EQ(MyHubConf::DEFAULT_HOST, conf.GetHost());
    Json::Value out;
    conf.Write(out, true);
    EXPECT_FALSE(out.isMember("host"));
    EXPECT_EQ("me", out["account"].asString());
}

TEST_F(MyHubConfTest, FullRoundTrip) {
    MyHubConf conf;
    conf.Overwrite(ParseJson("{\"account\":\"me\",\"host\":\"acct.example.net\"}"));
    Json::Value out;
    conf.Write(out, true);
    MyHubConf back;
    back.Overwrite(out);
    EXPECT_EQ(conf.GetHost(), back.GetHost());
    EXPECT_EQ(conf.GetMyHubAccount(), back.GetMyHubAccount());
}

TEST_F(MyHubConfTest, SetAccount) {
    MyHubConf conf;
    EXPECT_TRUE(conf.SetMyHubAccount("someone"));
    EXPECT_EQ("someone", conf.GetMyHubAccount());
    EXPECT_TRUE(conf.SetMyHubAccount(""));
    EXPECT_EQ("", conf.GetMyHubAccount());
}

TEST_F(SupportChannelConfTest, DefaultDisabledAndValid) {
    SupportChannelConf conf;
    EXPECT_FALSE(conf.GetEnabled());
    EXPECT_TRUE(conf.IsValid());
}

TEST_F(SupportChannelConfTest, OverwriteTakesBool) {
    SupportChannelConf conf;
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"enabled\":true}")));
    EXPECT_TRUE(conf.GetEnabled());
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"enabled\":false}")));
    EXPECT_FALSE(conf.GetEnabled());
}

TEST_F(SupportChannelConfTest, StringTrueLeavesDisabled) {
    SupportChannelConf conf;
    EXPECT_TRUE(conf.Overwrite(ParseJson("{\"enabled\":\"true\"}")));
    EXPECT_FALSE(conf.GetEnabled());
}

TEST_F(SupportChannelConfTest, WrongTypesNullsAndNonObjectsChangeNothing) {
    SupportChannelConf conf;
    conf.SetEnabled(true);
    for (const char* text :
         {"{\"enabled\":1}", "{\"enabled\":0}", "{\"enabled\":null}", "{\"enabled\":[false]}",
          "{\"enabled\":{}}", "{\"enabled\":\"false\"}", "[false]", "false", "null", "{}"}) {
        EXPECT_TRUE(conf.Overwrite(ParseJson(text))) << text;
        EXPECT_TRUE(conf.GetEnabled()) << text;
    }
}

TEST_F(SupportChannelConfTest, WriteSameInBothForms) {
    SupportChannelConf conf;
    conf.SetEnabled(true);
    for (bool full : {false, true}) {
        Json::Value out;
        EXPECT_TRUE(conf.Write(out, full));
        EXPECT_EQ(std::vector<std::string>{"enabled"}, out.getMemberNames());
        EXPECT_TRUE(out["enabled"].isBool());
        EXPECT_TRUE(out["enabled"].asBool());
    }
}

TEST_F(SupportChannelConfTest, RoundTrip) {
    SupportChannelConf conf;
    conf.SetEnabled(true);
    Json::Value out;
    conf.Write(out, false);
    SupportChannelConf back;
    back.Overwrite(out);
    EXPECT_TRUE(back.GetEnabled());
}
