#include <gtest/gtest.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request_alias.h>
#include <string>

#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogMessages;
using zepatest::ParseJson;
using zepatest::StderrCapture;

namespace {

class AliasDataTest : public zepatest::RootTest {
protected:
    static Json::Value Valid() {
        return ParseJson(
            R"({"alias":"myhome","serial":"SN0001","token":"tok","url":"https://alias.example.test",
                             "id":"cloud-id"})");
    }

    // The single message IsDataValid logged for data, without its "request_alias:<line> " prefix.
    static std::string RefusalOf(const Json::Value& data) {
        AliasRequest request;
        StderrCapture capture;
        bool valid = request.IsDataValid(data);
        const std::string log = capture.stop();
        EXPECT_FALSE(valid);
        auto messages = LogMessages(log);
        if (messages.size() != 1u) return "unexpected log: " + log;
        const std::string& m = messages[0];
        if (m.rfind("request_alias:", 0) != 0) return "unexpected source: " + m;
        const std::string::size_type blank = m.find(' ');
        return blank == std::string::npos ? m : m.substr(blank + 1);
    }
};

}  // namespace

TEST_F(AliasDataTest, CompleteDataIsValidWithoutLogging) {
    AliasRequest request;
    StderrCapture capture;
    EXPECT_TRUE(request.IsDataValid(Valid()));
    EXPECT_EQ("", capture.stop());
}

TEST_F(AliasDataTest, OptionalKeysAreNotChecked) {
    Json::Value data = Valid();
    data["force"] = true;
    data["myhub_account"] = 5;
    data["auth_key"] = Json::Value(Json::arrayValue);
    AliasRequest request;
    EXPECT_TRUE(request.IsDataValid(data));
}

TEST_F(AliasDataTest, DataMustBeAnObject) {
    EXPECT_EQ("data should be an object", RefusalOf(Json::Value()));
    EXPECT_EQ("data should be an object", RefusalOf(Json::Value("alias")));
    EXPECT_EQ("data should be an object", RefusalOf(ParseJson(R"(["alias","serial"])")));
    EXPECT_EQ("data should be an object", RefusalOf(Json::Value(3)));
}

TEST_F(AliasDataTest, EachMissingKeyHasItsMessage) {
    const std::pair<const char*, const char*> cases[] = {
        {"alias", "alias name is not found"}, {"serial", "serial is not found"},
        {"token", "token is not found"},      {"url", "url is not found"},
        {"id", "hopcloud_id is not found"},
    };
    for (const auto& c : cases) {
        Json::Value data = Valid();
        data.removeMember(c.first);
        EXPECT_EQ(c.second, RefusalOf(data)) << c.first;
    }
}

TEST_F(AliasDataTest, PresenceIsCheckedBeforeContent) {
    Json::Value data = Valid();
    data["alias"] = "";
    data.removeMember("id");
    EXPECT_EQ("hopcloud_id is not found", RefusalOf(data));
}

TEST_F(AliasDataTest, MissingKeysAreReportedInOrder) {
    Json::Value data(Json::objectValue);
    data["id"] = "x";
    data["url"] = "u";
    EXPECT_EQ("alias name is not found", RefusalOf(data));
    data["alias"] = "a";
    EXPECT_EQ("serial is not found", RefusalOf(data));
    data["serial"] = "s";
    EXPECT_EQ("token is not found", RefusalOf(data));
}

TEST_F(AliasDataTest, EachEmptyOrNonStringValueHasItsMessage) {
    const std::pair<const char*, const char*> cases[] = {
        {"alias", "alias name is not string or empty"},
        {"serial", "serial is not string or empty"},
        {"token", "token is not string or empty"},
        {"url", "url is not string or empty"},
        {"id", "id is not string or empty"},
    };
    for (const auto& c : cases) {
        for (const Json::Value& bad : {Json::Value(""), Json::Value(7), Json::Value(true), Json::Value(),
                                       Json::Value(Json::objectValue)}) {
            Json::Value data = Valid();
            data[c.first] = bad;
            EXPECT_EQ(c.second, RefusalOf(data)) << c.first << " = " << bad.toStyledString();
        }
    }
}

TEST_F(AliasDataTest, ContentsAreReportedInOrder) {
    Json::Value data = Valid();
    data["id"] = 1;
    data["serial"] = "";
    EXPECT_EQ("serial is not string or empty", RefusalOf(data));
}

TEST_F(AliasDataTest, RefusalsAreErrorLevel) {
    Daemon::_logLevel = 2;
    AliasRequest request;
    StderrCapture capture;
    EXPECT_FALSE(request.IsDataValid(Json::Value()));
    EXPECT_EQ("", capture.stop());
}

TEST_F(AliasDataTest, FormBodyInKeyOrderWithAmpersands) {
    Json::Value fields = ParseJson(R"({"token":"t","action":"keep_alive_alias","alias":"a","mac":"m"})");
    std::string body;
    AliasRequest::ToPostRequest(fields, body);
    EXPECT_EQ("action=keep_alive_alias&alias=a&mac=m&token=t", body);
}

TEST_F(AliasDataTest, FormBodyKeyOrderIsByteOrder) {
    Json::Value fields = ParseJson(R"({"b":"1","B":"2","a_b":"3","aa":"4","_":"5"})");
    std::string body;
    AliasRequest::ToPostRequest(fields, body);
    EXPECT_EQ("B=2&_=5&a_b=3&aa=4&b=1", body);
}

TEST_F(AliasDataTest, ValuesArePercentEncodedKeysAreNot) {
    Json::Value fields(Json::objectValue);
    fields["my key&=x"] = "a&b=c d+e/\xc3\xa9~-._";
    std::string body;
    AliasRequest::ToPostRequest(fields, body);
    EXPECT_EQ("my key&=x=a%26b%3Dc%20d%2Be%2F%C3%A9~-._", body);
}

TEST_F(AliasDataTest, EmptyValueGivesKeyAndEqualsSign) {
    Json::Value fields = ParseJson(R"({"a":"","b":"x"})");
    std::string body;
    AliasRequest::ToPostRequest(fields, body);
    EXPECT_EQ("a=&b=x", body);
}

TEST_F(AliasDataTest, FormBodyIsAppended) {
    std::string body = "prefix";
    AliasRequest::ToPostRequest(ParseJson(R"({"a":"1"})"), body);
    EXPECT_EQ("prefixa=1", body);
    AliasRequest::ToPostRequest(ParseJson(R"({"b":"2"})"), body);
    EXPECT_EQ("prefixa=1b=2", body);
}

TEST_F(AliasDataTest, EmptyObjectAddsNothing) {
    std::string body = "kept";
    AliasRequest::ToPostRequest(Json::Value(Json::objectValue), body);
    EXPECT_EQ("kept", body);
}

TEST_F(AliasDataTest, NonObjectFieldsLeaveTheBodyAlone) {
    std::string body = "kept";
    AliasRequest::ToPostRequest(ParseJson(R"(["a","b"])"), body);
    AliasRequest::ToPostRequest(Json::Value("a=b"), body);
    EXPECT_EQ("kept", body);
}

TEST_F(AliasDataTest, NumbersAreWordedAndStructuresSentEmpty) {
    std::string body;
    AliasRequest::ToPostRequest(ParseJson(R"({"n":12,"o":{"x":1},"t":true})"), body);
    EXPECT_EQ("n=12&o=&t=true", body);
}

TEST_F(AliasDataTest, GetRequestBeforeSetRequestIsRefused) {
    AliasRequest request;
    Json::Value data("untouched");
    std::string url = "untouched";
    std::string body = "untouched";
    EXPECT_FALSE(request.GetRequest(data, url));
    EXPECT_FALSE(request.GetRequest(body, url));
    EXPECT_EQ("untouched", data.asString());
    EXPECT_EQ("untouched", url);
    EXPECT_EQ("untouched", body);
}

TEST_F(AliasDataTest, FreshObjectHasNoAnswer) {
    AliasRequest request;
    int code = 0;
    std::string text = "x";
    Json::Value value(5);
    request.GetResponse(code);
    request.GetResponse(text);
    request.GetResponse(value);
    EXPECT_EQ(-1, code);
    EXPECT_EQ("", text);
    EXPECT_TRUE(value.isNull());
}
