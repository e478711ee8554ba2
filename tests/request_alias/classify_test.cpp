#include <curl/curl.h>
#include <gtest/gtest.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request_alias.h>
#include <boost/shared_ptr.hpp>
#include <string>

#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogContains;
using zepatest::LogMessages;
using zepatest::StderrCapture;

namespace {

class ClassifyTest : public zepatest::RootTest {};

struct Outcome {
    bool ok;
    ALIAS_RET ret;
    std::string body;
    int status;
    std::string log;
};

Outcome Classify(int curlCode, int httpStatus, const std::string& text) {
    Outcome o{false, ALIAS_RET_NOT_SET, "untouched", -7, ""};
    HTTPResponse r(httpStatus, text, curlCode);
    StderrCapture capture;
    o.ok = AliasRequest::ParseCURLHttp(r, o.ret, o.body, o.status);
    o.log = capture.stop();
    return o;
}

}  // namespace

TEST_F(ClassifyTest, HttpResponseDefaults) {
    HTTPResponse r;
    EXPECT_EQ(-1, r.httpStatus);
    EXPECT_EQ("", r.body);
    EXPECT_EQ(0, r.curlCode);
}

TEST_F(ClassifyTest, Status200GivesTrimmedBodyAndLeavesResult) {
    Outcome o = Classify(CURLE_OK, 200, " \r\n good \r\n");
    EXPECT_TRUE(o.ok);
    EXPECT_EQ(ALIAS_RET_NOT_SET, o.ret);
    EXPECT_EQ("good", o.body);
    EXPECT_EQ(200, o.status);
    EXPECT_EQ("", o.log);
}

TEST_F(ClassifyTest, TheResponseRecordIsTrimmedInPlace) {
    HTTPResponse r(200, "\tgood\n", 0);
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string body;
    int status = 0;
    EXPECT_TRUE(AliasRequest::ParseCURLHttp(r, ret, body, status));
    EXPECT_EQ("good", r.body);
}

TEST_F(ClassifyTest, DebugLineShowsStatusAndBody) {
    Daemon::_logLevel = 7;
    Outcome o = Classify(CURLE_OK, 200, "alias_inused:other\n");
    auto messages = LogMessages(o.log);
    ASSERT_EQ(1u, messages.size()) << o.log;
    EXPECT_EQ(0u, messages[0].rfind("request_alias:", 0));
    EXPECT_NE(std::string::npos, messages[0].find(" HTTP: 200, Response: alias_inused:other")) << messages[0];
}

TEST_F(ClassifyTest, EveryOtherStatusIsUnknown) {
    for (int status : {404, 500, 502, 503, 504, 302, 201, 204, 400, 401, 403, 0, -1}) {
        Outcome o = Classify(CURLE_OK, status, "good");
        EXPECT_FALSE(o.ok) << status;
        EXPECT_EQ(ALIAS_RET_UNKNOWN, o.ret) << status;
        EXPECT_EQ(status, o.status) << status;
        EXPECT_EQ("untouched", o.body) << status;
        EXPECT_TRUE(LogContains(o.log, "request_alias:")) << o.log;
        EXPECT_TRUE(LogContains(o.log, " http status: " + std::to_string(status))) << o.log;
    }
}

TEST_F(ClassifyTest, ResolveFailureIsDns) {
    Outcome o = Classify(CURLE_COULDNT_RESOLVE_HOST, 0, "");
    EXPECT_FALSE(o.ok);
    EXPECT_EQ(ALIAS_RET_DNS, o.ret);
    EXPECT_EQ(-7, o.status);
    EXPECT_EQ("untouched", o.body);
    EXPECT_TRUE(
        LogContains(o.log, "curl error: 6, " + std::string(curl_easy_strerror(CURLE_COULDNT_RESOLVE_HOST))))
        << o.log;
}

TEST_F(ClassifyTest, TransportFailuresAreNetwork) {
    for (int code : {7, 28, 35, 55, 56, 81}) {
        Outcome o = Classify(code, 0, "");
        EXPECT_FALSE(o.ok) << code;
        EXPECT_EQ(ALIAS_RET_NETWORK, o.ret) << code;
        EXPECT_EQ(-7, o.status) << code;
    }
}

TEST_F(ClassifyTest, OtherCurlFailuresAreUnknown) {
    for (int code : {1, 3, 5, 22, 47, 52, 60, 77, 99}) {
        Outcome o = Classify(code, 200, "good");
        EXPECT_FALSE(o.ok) << code;
        EXPECT_EQ(ALIAS_RET_UNKNOWN, o.ret) << code;
        EXPECT_EQ("untouched", o.body) << code;
    }
}

// HTTPResponse takes any int: numbers that are no libcurl code (two bytes of
// an answer taken as one, a negative number) are logged with libcurl's words
// for an unknown code and classified as unknown, never turned into CURLcode.
TEST_F(ClassifyTest, CodesOutsideLibcurlsRangeAreUnknown) {
    const int kSlash = ('K' << 8) | '/';
    for (int code : {kSlash, -1, static_cast<int>(CURL_LAST), 0x7fffffff}) {
        Outcome o = Classify(code, -1, "K/");
        EXPECT_FALSE(o.ok) << code;
        EXPECT_EQ(ALIAS_RET_UNKNOWN, o.ret) << code;
        EXPECT_TRUE(LogContains(o.log, "curl error: " + std::to_string(code) + ", Unknown error")) << o.log;
    }
}

TEST_F(ClassifyTest, RepeatedCurlErrorIsLoggedOnce) {
    Outcome first = Classify(CURLE_COULDNT_CONNECT, 0, "");
    Outcome second = Classify(CURLE_COULDNT_CONNECT, 0, "");
    EXPECT_TRUE(LogContains(first.log, "curl error: 7, ")) << first.log;
    EXPECT_EQ("", second.log);
    EXPECT_EQ(ALIAS_RET_NETWORK, second.ret);
}

TEST_F(ClassifyTest, DifferentCurlErrorIsLoggedAgain) {
    Classify(CURLE_COULDNT_CONNECT, 0, "");
    Outcome other = Classify(CURLE_OPERATION_TIMEDOUT, 0, "");
    EXPECT_TRUE(LogContains(other.log, "curl error: 28, ")) << other.log;
    Outcome back = Classify(CURLE_COULDNT_CONNECT, 0, "");
    EXPECT_TRUE(LogContains(back.log, "curl error: 7, ")) << back.log;
}

TEST_F(ClassifyTest, SuccessfulTransferResetsTheMemory) {
    Classify(CURLE_COULDNT_CONNECT, 0, "");
    Classify(CURLE_OK, 503, "");
    Outcome again = Classify(CURLE_COULDNT_CONNECT, 0, "");
    EXPECT_TRUE(LogContains(again.log, "curl error: 7, ")) << again.log;
}

TEST_F(ClassifyTest, HttpStatusLinesAreLoggedEveryTime) {
    Outcome first = Classify(CURLE_OK, 500, "");
    Outcome second = Classify(CURLE_OK, 500, "");
    EXPECT_TRUE(LogContains(first.log, "http status: 500"));
    EXPECT_TRUE(LogContains(second.log, "http status: 500"));
}

TEST_F(ClassifyTest, NullRequestIsAProgrammingError) {
#ifdef NDEBUG
    GTEST_SKIP() << "the shared pointer's assertion is compiled out";
#else
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string body;
    EXPECT_DEATH(AliasRequest::ParseCURLHttp(boost::shared_ptr<Request>(), ret, body), "px != 0");
#endif
}
