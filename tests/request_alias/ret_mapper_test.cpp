#include <gtest/gtest.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request_alias.h>
#include <string>

#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogContains;
using zepatest::LogMessages;
using zepatest::StderrCapture;

namespace {

class RetMapperTest : public zepatest::RootTest {};

struct Row {
    int code;
    int retry;
    const char* status;
    const char* server;
};

const Row kExpectedRows[] = {
    {1, 2, "success", "good"},
    {9, 2, "error_911", "911"},
    {4, 2, "error_system", "badsys"},
    {6, 2, "error_network", ""},
    {7, 1, "error_dns", ""},
    {10, 2, "error_server_busy", ""},
    {8, 3, "error_auth", "badauth"},
    {11, 3, "error_bad_ip", "badip"},
    {2, 2, "error_not_found", "alias_not_found"},
    {3, 3, "error_inused", "alias_inused"},
    {12, 3, "error_self_inused", "alias_self_inused"},
    {5, 2, "error_bad_param", "badparam"},
    {255, 2, "error_unknown", ""},
    {14, 2, "error_api_key_expired", "api_key_expired"},
    {13, 0, "not_set", ""},
    {0, 0, "", ""},
};

}  // namespace

TEST_F(RetMapperTest, TableRowsInOrder) {
    ASSERT_EQ(16, ALIAS_RET_MAPPER_ROWS);
    for (int i = 0; i < ALIAS_RET_MAPPER_ROWS; ++i) {
        SCOPED_TRACE(i);
        EXPECT_EQ(kExpectedRows[i].code, static_cast<int>(gRetMapper[i].code));
        EXPECT_EQ(kExpectedRows[i].retry, static_cast<int>(gRetMapper[i].retryType));
        EXPECT_EQ(kExpectedRows[i].status, gRetMapper[i].statusWord);
        EXPECT_EQ(kExpectedRows[i].server, gRetMapper[i].serverWord);
    }
}

TEST_F(RetMapperTest, EnumerationValues) {
    EXPECT_EQ(0, ALIAS_REQ_NONE);
    EXPECT_EQ(1, ALIAS_REQ_MAP);
    EXPECT_EQ(2, ALIAS_REQ_DELETE);
    EXPECT_EQ(3, ALIAS_REQ_KEEP_ALIVE);
    EXPECT_EQ(4, ALIAS_REQ_QUERY);
    EXPECT_EQ(5, ALIAS_REQ_UNSPECIFIED);
    EXPECT_EQ(0, ALIAS_RETRY_NONE);
    EXPECT_EQ(1, ALIAS_RETRY_RESOLVE);
    EXPECT_EQ(2, ALIAS_RETRY_NORMAL);
    EXPECT_EQ(3, ALIAS_RETRY_STOP);
    EXPECT_EQ(1, ALIAS_RESP_JSON);
    EXPECT_EQ(2, ALIAS_RESP_TEXT);
    EXPECT_EQ(3, ALIAS_RESP_NONE);
}

TEST_F(RetMapperTest, RetryTypeOfEveryCode) {
    for (int i = 0; i < ALIAS_RET_MAPPER_ROWS - 1; ++i) {
        ALIAS_RETRY_TYPE type = static_cast<ALIAS_RETRY_TYPE>(-1);
        ASSERT_TRUE(AliasRequest::GetRetryType(static_cast<ALIAS_RET>(kExpectedRows[i].code), type)) << i;
        EXPECT_EQ(kExpectedRows[i].retry, static_cast<int>(type)) << i;
    }
}

TEST_F(RetMapperTest, DnsFailureRetriesByResolving) {
    ALIAS_RETRY_TYPE type = ALIAS_RETRY_NONE;
    EXPECT_TRUE(AliasRequest::GetRetryType(ALIAS_RET_DNS, type));
    EXPECT_EQ(ALIAS_RETRY_RESOLVE, type);
    std::string word;
    EXPECT_TRUE(AliasRequest::ResponseToString(ALIAS_RET_DNS, word));
    EXPECT_EQ("error_dns", word);
}

TEST_F(RetMapperTest, AuthFailureStopsRetrying) {
    ALIAS_RETRY_TYPE type = ALIAS_RETRY_NONE;
    EXPECT_TRUE(AliasRequest::GetRetryType(ALIAS_RET_AUTH, type));
    EXPECT_EQ(ALIAS_RETRY_STOP, type);
}

TEST_F(RetMapperTest, RetryTypeOfUnknownCodeFails) {
    for (int code : {0, 15, 16, 254, -1}) {
        ALIAS_RETRY_TYPE type = ALIAS_RETRY_STOP;
        StderrCapture capture;
        EXPECT_FALSE(AliasRequest::GetRetryType(static_cast<ALIAS_RET>(code), type)) << code;
        const std::string log = capture.stop();
        EXPECT_EQ(ALIAS_RETRY_STOP, type);
        auto messages = LogMessages(log);
        ASSERT_EQ(1u, messages.size()) << log;
        EXPECT_EQ(0u, messages[0].rfind("request_alias:", 0)) << messages[0];
        EXPECT_NE(std::string::npos, messages[0].find(" Cannot convert retry type " + std::to_string(code)))
            << messages[0];
    }
}

TEST_F(RetMapperTest, StatusWordOfEveryCode) {
    for (int i = 0; i < ALIAS_RET_MAPPER_ROWS - 1; ++i) {
        std::string word = "untouched";
        ASSERT_TRUE(AliasRequest::ResponseToString(static_cast<ALIAS_RET>(kExpectedRows[i].code), word)) << i;
        EXPECT_EQ(kExpectedRows[i].status, word);
    }
}

TEST_F(RetMapperTest, StatusWordOfZeroFailsAtTheEndMark) {
    std::string word = "untouched";
    StderrCapture capture;
    EXPECT_FALSE(AliasRequest::ResponseToString(static_cast<ALIAS_RET>(0), word));
    const std::string log = capture.stop();
    EXPECT_EQ("untouched", word);
    auto messages = LogMessages(log);
    ASSERT_EQ(1u, messages.size()) << log;
    EXPECT_EQ(0u, messages[0].rfind("request_alias:", 0)) << messages[0];
    EXPECT_NE(std::string::npos, messages[0].find(" Cannot convert response 0")) << messages[0];
}

TEST_F(RetMapperTest, LookupMessagesAreErrorLevel) {
    Daemon::_logLevel = 2;
    std::string word;
    StderrCapture capture;
    EXPECT_FALSE(AliasRequest::ResponseToString(static_cast<ALIAS_RET>(77), word));
    EXPECT_EQ("", capture.stop());
}

TEST_F(RetMapperTest, ServerWordsAloneMatch) {
    const std::pair<const char*, ALIAS_RET> cases[] = {
        {"good", ALIAS_RET_SUCCESS},        {"911", ALIAS_RET_911},
        {"badsys", ALIAS_RET_SYSTEM},       {"badauth", ALIAS_RET_AUTH},
        {"badip", ALIAS_RET_BAD_IP},        {"alias_not_found", ALIAS_RET_NOT_FOUND},
        {"alias_inused", ALIAS_RET_INUSED}, {"alias_self_inused", ALIAS_RET_SELF_INUSED},
        {"badparam", ALIAS_RET_BAD_PARAM},  {"api_key_expired", ALIAS_RET_API_KEY_EXPIRED},
    };
    for (const auto& c : cases) {
        ALIAS_RET ret = ALIAS_RET_NOT_SET;
        EXPECT_TRUE(AliasRequest::ParseServerResponse(c.first, ret)) << c.first;
        EXPECT_EQ(c.second, ret) << c.first;
    }
}

TEST_F(RetMapperTest, ServerWordWithColonAndDetailMatches) {
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    EXPECT_TRUE(AliasRequest::ParseServerResponse("badauth:token does not fit", ret));
    EXPECT_EQ(ALIAS_RET_AUTH, ret);
    ret = ALIAS_RET_NOT_SET;
    EXPECT_TRUE(AliasRequest::ParseServerResponse("good:", ret));
    EXPECT_EQ(ALIAS_RET_SUCCESS, ret);
    ret = ALIAS_RET_NOT_SET;
    EXPECT_TRUE(AliasRequest::ParseServerResponse("alias_inused:a:b", ret));
    EXPECT_EQ(ALIAS_RET_INUSED, ret);
}

TEST_F(RetMapperTest, WordPrefixWithoutColonDoesNotMatch) {
    for (const char* text : {"alias_inusedx", "goods", "good morning", "badauthority", "9110", "badip2"}) {
        ALIAS_RET ret = ALIAS_RET_NOT_SET;
        EXPECT_FALSE(AliasRequest::ParseServerResponse(text, ret)) << text;
        EXPECT_EQ(ALIAS_RET_NOT_SET, ret) << text;
    }
}

TEST_F(RetMapperTest, UnmatchedTextsLeaveResultUntouched) {
    for (const char* text : {"", "GOOD", " good", "error_dns", "success", "alias", ":good", "alias_self"}) {
        ALIAS_RET ret = ALIAS_RET_BAD_IP;
        EXPECT_FALSE(AliasRequest::ParseServerResponse(text, ret)) << text;
        EXPECT_EQ(ALIAS_RET_BAD_IP, ret) << text;
    }
}

TEST_F(RetMapperTest, ParseServerResponseLogsNothing) {
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    StderrCapture capture;
    AliasRequest::ParseServerResponse("nonsense", ret);
    AliasRequest::ParseServerResponse("good", ret);
    EXPECT_EQ("", capture.stop());
}

TEST_F(RetMapperTest, TrimRemovesControlBytesAndBlanksAround) {
    std::string s = " \r\n\tgood \r\n";
    std::string& result = AliasRequest::Trim(s);
    EXPECT_EQ(&s, &result);
    EXPECT_EQ("good", s);

    s = std::string("\x01\x1f good:a b \x20\x0b", 15);
    EXPECT_EQ("good:a b", AliasRequest::Trim(s));
}

TEST_F(RetMapperTest, TrimKeepsInnerBlanksAndHighBytes) {
    std::string s = "\xc3\xa9t\xc3\xa9 x \xff";
    EXPECT_EQ("\xc3\xa9t\xc3\xa9 x \xff", AliasRequest::Trim(s));
    s = " \x80 ";
    EXPECT_EQ("\x80", AliasRequest::Trim(s));
}

TEST_F(RetMapperTest, TrimOfBlanksOnlyIsEmpty) {
    std::string s = " \t\r\n ";
    EXPECT_EQ("", AliasRequest::Trim(s));
    s = "";
    EXPECT_EQ("", AliasRequest::Trim(s));
}

TEST_F(RetMapperTest, TrimStopsAtTheFirstNul) {
    std::string s("  good \0 tail", 13);
    EXPECT_EQ("good", AliasRequest::Trim(s));
    EXPECT_EQ(4u, s.size());
    std::string leading("\0good", 5);
    EXPECT_EQ("", AliasRequest::Trim(leading));
}
