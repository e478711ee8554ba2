// Answers a broken or hostile server may send, as the library's parsers and
// classifiers see them: none may throw, each gives a defined result.
#include <gtest/gtest.h>
#include <json/reader.h>

#include <memory>
#include <string>

#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request_alias.h>

using namespace ZEPA::Relay;

namespace {

// Parses like a careful caller: false (never an exception) for what jsoncpp refuses.
bool Parse(const std::string& text, Json::Value& out) {
    Json::CharReaderBuilder builder;
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    try {
        return reader->parse(text.data(), text.data() + text.size(), &out, nullptr);
    } catch (const Json::Exception&) {
        return false;
    }
}

Json::Value Deep(int depth) {
    Json::Value value(Json::arrayValue);
    for (int i = 0; i < depth; ++i) {
        Json::Value outer(Json::arrayValue);
        outer.append(value);
        value = outer;
    }
    return value;
}

TEST(HostileAnswers, ErrnoReproducersReadAsSuccess) {
    for (const char* text : {"[{\"errno\":0}]", "{\"errno\":0}", "[{\"errno\":0.0}]"}) {
        Json::Value answer;
        ASSERT_TRUE(Parse(text, answer)) << text;
        EXPECT_EQ(RELAYSERVER_ERR_SUCCESS, ParseServerError(answer)) << text;
        EXPECT_EQ(RELAYD_SUCCESS, RespErrMap(ParseServerError(answer))) << text;
    }
}

TEST(HostileAnswers, MalformedNumbersAreRefusedOrReadWithoutThrowing) {
    for (const char* text :
         {"[{\"errno\":0.}]", "[{\"errno\":00}]", "[{\"errno\":1e400}]", "[{\"errno\":-0}]",
          "[{\"errno\":4294967296}]", "[{\"errno\":-2147483649}]", "[{\"errno\":1.5}]"}) {
        Json::Value answer;
        bool parsed = Parse(text, answer);
        RELAYSERVER_ERR err = ParseServerError(answer);
        if (!parsed) answer = Json::Value();
        // Numbers outside int or with a fraction are no errno: unknown.
        const Json::Value& e = parsed && answer.isArray() && answer[0u].isObject()
                                   ? answer[0u]["errno"]
                                   : Json::Value::nullSingleton();
        RELAYSERVER_ERR expected =
            e.isInt() ? static_cast<RELAYSERVER_ERR>(e.asInt()) : RELAYSERVER_ERR_UNKNOWN;
        EXPECT_EQ(expected, err) << text;
        RespErrMap(err);
    }
}

TEST(HostileAnswers, WrongTypesEverywhereAreUnknown) {
    for (const char* text :
         {"[]", "[[]]", "[0]", "[\"x\"]", "[null]", "{\"errno\":\"0\"}", "{\"errno\":[0]}", "{\"errno\":{}}",
          "{\"errno\":true}", "{\"errno\":null}", "\"errno\"", "0", "null"}) {
        Json::Value answer;
        ASSERT_TRUE(Parse(text, answer)) << text;
        EXPECT_EQ(RELAYSERVER_ERR_UNKNOWN, ParseServerError(answer)) << text;
        EXPECT_EQ(RELAYD_ERR_UNKNOWN, RespErrMap(ParseServerError(answer))) << text;
    }
}

TEST(HostileAnswers, ThousandDeepAnswerIsUnknown) {
    Json::Value deep = Deep(1000);
    EXPECT_EQ(RELAYSERVER_ERR_UNKNOWN, ParseServerError(deep));
    Json::Value wrapped(Json::arrayValue);
    Json::Value holder;
    holder["errno"] = deep;
    wrapped.append(holder);
    EXPECT_EQ(RELAYSERVER_ERR_UNKNOWN, ParseServerError(wrapped));
}

TEST(HostileAnswers, AliasAnswersThatAreDeepHugeOrBinaryAreClassifiedWithoutThrowing) {
    Daemon::_logLevel = 2;
    const std::string deep = std::string(100000, '[') + std::string(100000, ']');
    const std::string deepObject = "{\"a\":" + std::string(1000, '[') + std::string(1000, ']') + "}";
    const std::string binary("\0\xff\xfe{\"x\":", 9);
    for (const std::string& body :
         {deep, deepObject, binary, std::string(4 << 20, 'x'), std::string("[{\"errno\":0}]")}) {
        HTTPResponse response(200, body, 0);
        ALIAS_RET ret = ALIAS_RET_SUCCESS;
        std::string text;
        int status = -1;
        EXPECT_TRUE(AliasRequest::ParseCURLHttp(response, ret, text, status));
        ALIAS_RET parsed = ALIAS_RET_SUCCESS;
        EXPECT_FALSE(AliasRequest::ParseServerResponse(body, parsed)) << body.substr(0, 40);
        std::string word;
        AliasRequest::ResponseToString(parsed, word);
    }
}

}  // namespace
