// Server answers of any shape are read without an exception.
#include <gtest/gtest.h>
#include <json/reader.h>

#include <string>

#include "server_answer.h"

using zeparelayd::AnswerInt;
using zeparelayd::AnswerObject;
using zeparelayd::AnswerSection;
using zeparelayd::AnswerString;

namespace {

Json::Value Parse(const std::string& text) {
    Json::Value value;
    Json::Reader reader;
    EXPECT_TRUE(reader.parse(text, value, false)) << text;
    return value;
}

TEST(ServerAnswer, ObjectMembersOfTheRightTypeAreRead) {
    std::string id = "before";
    EXPECT_TRUE(AnswerString(Parse(R"({"errno": 0, "serverID": "abc"})"), "serverID", id));
    EXPECT_EQ("abc", id);
    // An array answer is read through its first element, as its error number is.
    EXPECT_TRUE(AnswerString(Parse(R"([{"serverID": "xyz"}, {"serverID": "no"}])"), "serverID", id));
    EXPECT_EQ("xyz", id);
}

TEST(ServerAnswer, AnythingElseIsAnAnswerWithoutTheMember) {
    const char* const answers[] = {
        R"([{"errno":0}])",
        R"([{"errno":0.}])",
        R"({"serverID": 5})",
        R"({"serverID": ["a"]})",
        R"({"serverID": {}})",
        R"([])",
        R"([[{"serverID": "a"}]])",
        R"("serverID")",
        R"(17)",
        R"(null)",
        R"([null, {"serverID": "a"}])",
        R"({"other": "a"})",
    };
    for (const char* text : answers) {
        std::string id = "untouched";
        EXPECT_FALSE(AnswerString(Parse(text), "serverID", id)) << text;
        EXPECT_EQ("untouched", id) << text;
    }
}

TEST(ServerAnswer, DeepNestingIsNoObject) {
    std::string deep;
    for (int i = 0; i < 900; ++i) deep += "[";
    deep += "{\"serverID\": \"a\"}";
    for (int i = 0; i < 900; ++i) deep += "]";
    Json::Value value = Parse(deep);
    EXPECT_FALSE(AnswerObject(value).isObject());
    std::string id;
    EXPECT_FALSE(AnswerString(value, "serverID", id));
}

TEST(ServerAnswer, IntegersAndSectionsAreTypeChecked) {
    int beat = -1;
    EXPECT_TRUE(AnswerInt(Parse(R"({"heartbeat": 30})"), "heartbeat", beat));
    EXPECT_EQ(30, beat);
    EXPECT_FALSE(AnswerInt(Parse(R"({"heartbeat": "30"})"), "heartbeat", beat));
    EXPECT_FALSE(AnswerInt(Parse(R"({"heartbeat": 1e30})"), "heartbeat", beat));
    EXPECT_FALSE(AnswerInt(Parse(R"([1, 2])"), "heartbeat", beat));
    EXPECT_EQ(30, beat);

    const Json::Value tunnel = AnswerSection(Parse(R"([{"tunnel": {"relay_ip": "10.0.0.1"}}])"), "tunnel");
    EXPECT_EQ("10.0.0.1", tunnel["relay_ip"].asString());
    EXPECT_TRUE(AnswerSection(Parse(R"({"tunnel": ["10.0.0.1"]})"), "tunnel").isObject());
    EXPECT_TRUE(AnswerSection(Parse(R"({"tunnel": ["10.0.0.1"]})"), "tunnel").empty());
    EXPECT_TRUE(AnswerSection(Parse(R"("tunnel")"), "tunnel").empty());
}

}  // namespace
