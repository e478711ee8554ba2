// The typed getters every section's Overwrite reads its keys with.
#include <gtest/gtest.h>

#include <string>

#include "config/json_take.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;

TEST(JsonTake, TakesKeysOfTheExpectedType) {
    const Json::Value v = ParseJson(R"({"s": "text", "i": 42, "b": true})");
    std::string s = "old";
    int i = -1;
    bool b = false;
    JsonTake::TakeAll(v, {{"s", s}, {"i", i}, {"b", b}});
    EXPECT_EQ("text", s);
    EXPECT_EQ(42, i);
    EXPECT_TRUE(b);
}

TEST(JsonTake, WrongTypeOrMissingKeyLeavesTheTarget) {
    const Json::Value v = ParseJson(R"({"s": 5, "i": "42", "b": 1, "d": 1.5, "n": null, "big": 4294967296})");
    std::string s = "old";
    int i = -1;
    int d = -2;
    int big = -3;
    bool b = false;
    std::string missing = "keep";
    std::string null = "keep";
    JsonTake::TakeAll(
        v, {{"s", s}, {"i", i}, {"b", b}, {"d", d}, {"big", big}, {"missing", missing}, {"n", null}});
    EXPECT_EQ("old", s);
    EXPECT_EQ(-1, i);
    EXPECT_EQ(-2, d);
    EXPECT_EQ(-3, big);
    EXPECT_FALSE(b);
    EXPECT_EQ("keep", missing);
    EXPECT_EQ("keep", null);
}

TEST(JsonTake, NonObjectsGiveNothing) {
    for (const char* text : {"null", "[\"s\"]", "\"s\"", "3"}) {
        std::string s = "old";
        EXPECT_FALSE(JsonTake::Take(ParseJson(text), "s", s)) << text;
        EXPECT_EQ("old", s);
    }
}

TEST(JsonTake, ResultTellsWhetherTheKeyWasTaken) {
    const Json::Value v = ParseJson(R"({"i": 7, "s": "x"})");
    int i = 0;
    EXPECT_TRUE(JsonTake::Take(v, "i", i));
    EXPECT_EQ(7, i);
    EXPECT_FALSE(JsonTake::Take(v, "s", i));
    EXPECT_EQ(7, i);
}
