// Answers that a hostile server sends to a real request: too long to keep,
// nested beyond reason, or not JSON at all.
#include <string>

#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request.h>

#include "request_fixture.h"

using namespace ZEPA::Relay;
using namespace requesttest;

namespace {

class RequestBounds : public ServerTest {};

TEST_F(RequestBounds, AnswerLongerThanTheLimitFailsTheTransfer) {
    ASSERT_TRUE(server.script("/test/big", 200, std::string(3 * 1024 * 1024, 'x')));
    Request request(server.httpUrl("/test/big").c_str(), "", true);
    zepatest::StderrCapture capture;
    EXPECT_FALSE(request.Send());
    const std::string log = capture.stop();
    EXPECT_EQ(CURLE_WRITE_ERROR, request.GetCurlResult());
    EXPECT_TRUE(request.GetResponse().size() <= 1024u * 1024u);
    EXPECT_TRUE(zepatest::LogContains(log, "answer longer than 1048576 bytes refused")) << log;
}

TEST_F(RequestBounds, AnswerJustUnderTheLimitIsKept) {
    const std::string body = "\"" + std::string(1024 * 1024 - 2, 'y') + "\"";
    ASSERT_TRUE(server.script("/test/edge", 200, body));
    Request request(server.httpUrl("/test/edge").c_str(), "", true);
    ASSERT_TRUE(request.Send());
    EXPECT_EQ(body, request.GetResponse());
    Json::Value parsed;
    ASSERT_TRUE(request.GetResponse(parsed));
    EXPECT_TRUE(parsed.isString());
}

TEST_F(RequestBounds, DeeplyNestedAnswerIsNoJsonAndItsLogLineIsShort) {
    const std::string deep = "[{\"errno\":" + std::string(1000, '[') + "0" + std::string(1000, ']') + "}]";
    ASSERT_TRUE(server.script("/test/deep", 200, deep));
    Request request(server.httpUrl("/test/deep").c_str(), "", true);
    ASSERT_TRUE(request.Send());
    Daemon::_logLevel = 7;
    zepatest::StderrCapture capture;
    Json::Value parsed = "stale";
    EXPECT_FALSE(request.GetResponse(parsed));
    const std::string log = capture.stop();
    EXPECT_EQ(RELAYSERVER_ERR_UNKNOWN, ParseServerError(Json::Value()));
    EXPECT_TRUE(zepatest::LogContains(log, "failed to parse response: ")) << log;
    EXPECT_TRUE(zepatest::LogContains(log, "(" + std::to_string(deep.size()) + " bytes)")) << log;
    EXPECT_LT(log.size(), 1024u);
    // The description record carries no parse either, and no exception.
    Json::Value description;
    EXPECT_TRUE(request.Write(description));
}

TEST_F(RequestBounds, ErrnoReproducersThroughARealAnswer) {
    for (const char* body : {"[{\"errno\":0}]", "[{\"errno\":0.}]", "[{\"errno\":00}]"}) {
        ASSERT_TRUE(server.script("/test/errno", 200, body));
        Request request(server.httpUrl("/test/errno").c_str(), "", true);
        ASSERT_TRUE(request.Send());
        Json::Value parsed;
        if (request.GetResponse(parsed)) {
            EXPECT_EQ(RELAYSERVER_ERR_SUCCESS, ParseServerError(parsed)) << body;
        } else {
            EXPECT_EQ(RELAYSERVER_ERR_UNKNOWN, ParseServerError(parsed)) << body;
        }
    }
}

}  // namespace
