// Payload, JSON views, the description record, copies and assignment.
#include <curl/curl.h>
#include <gtest/gtest.h>

#include <memory>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>

#include "request/request_fixture.h"

using namespace ZEPA::Relay;
using requesttest::ServerTest;
using zepatest::LogMessages;
using zepatest::RecordedBody;
using zepatest::StderrCapture;

namespace {

std::vector<std::string> Keys(const Json::Value& v) { return v.getMemberNames(); }

}  // namespace

using RequestPayload = ServerTest;

TEST_F(RequestPayload, JsonBodyIsTheCompactTextWithItsNewline) {
    Json::Value body;
    body["a"] = 1;
    body["b"] = "x y&z=1";
    body["list"].append(true);
    Request request(server.httpUrl("/test/echo"), body, true);
    const std::string expected = "{\"a\":1,\"b\":\"x y&z=1\",\"list\":[true]}\n";
    EXPECT_EQ(expected, request.GetData());
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("POST", rec["method"].asString());
    EXPECT_EQ(expected, RecordedBody(rec));
    Json::Value parsed;
    ASSERT_TRUE(request.GetData(parsed));
    EXPECT_EQ(body, parsed);
}

TEST_F(RequestPayload, JsonSetDataReplacesTheBody) {
    Request request(server.httpUrl("/test/echo").c_str(), "old=1", true);
    Json::Value body(Json::arrayValue);
    body.append(1);
    EXPECT_TRUE(request.SetData(body, true));
    EXPECT_EQ("[1]\n", request.GetData());
    ASSERT_TRUE(request.Send());
    EXPECT_EQ("[1]\n", RecordedBody(OnlyRecord("/test/echo")));
}

TEST_F(RequestPayload, JsonSetRetargets) {
    Request request(nullptr, nullptr, false);
    Json::Value body;
    body["k"] = "v";
    EXPECT_FALSE(request.Set("", body, true));
    EXPECT_FALSE(request.IsValid());
    ASSERT_TRUE(request.Set(server.httpUrl("/test/echo"), body, true));
    ASSERT_TRUE(request.Send());
    EXPECT_EQ("{\"k\":\"v\"}\n", RecordedBody(OnlyRecord("/test/echo")));
}

TEST_F(RequestPayload, StringSetDataReplacesTheQuery) {
    Request request(server.httpUrl("/test/echo").c_str(), "a=1", false);
    EXPECT_TRUE(request.SetData(std::string("b=2&c"), false));
    EXPECT_EQ("b=2&c", request.GetData());
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("GET", rec["method"].asString());
    EXPECT_EQ("/test/echo?b=2&c", rec["target"].asString());
}

TEST_F(RequestPayload, SetDataOnAnInvalidRequestChangesNothing) {
    Request request(nullptr, "kept", true);
    EXPECT_FALSE(request.SetData(std::string("new"), true));
    EXPECT_EQ("", request.GetData());
    Json::Value body;
    body["a"] = 1;
    EXPECT_FALSE(request.SetData(body, false));
    EXPECT_EQ("", request.GetData());
}

TEST_F(RequestPayload, NonJsonBodyFailsToParseWithTheSharedMessage) {
    Request request(server.httpUrl("/test/echo").c_str(), "a=1&b=2", true);
    Daemon::_logLevel = 7;
    StderrCapture capture;
    Json::Value out("untouched");
    EXPECT_FALSE(request.GetData(out));
    std::vector<std::string> messages = LogMessages(capture.stop());
    ASSERT_EQ(1u, messages.size());
    EXPECT_EQ(0u, messages[0].find("request:"));
    EXPECT_NE(std::string::npos, messages[0].find(" failed to parse response: a=1&b=2"));
    EXPECT_EQ(Json::Value("untouched"), out);
}

TEST_F(RequestPayload, ResponseOfAnUnsentRequestIsNotParsed) {
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    Daemon::_logLevel = 7;
    StderrCapture capture;
    Json::Value out("untouched");
    EXPECT_FALSE(request.GetResponse(out));
    EXPECT_EQ("", capture.stop());
    EXPECT_EQ(Json::Value("untouched"), out);
    EXPECT_EQ("", request.GetResponse());
}

TEST_F(RequestPayload, RecordOfAnUnsentRequestHasThreeKeys) {
    Request request(server.httpUrl("/test/json").c_str(), "a=1", false);
    Json::Value record;
    record["other"] = 5;
    EXPECT_TRUE(request.Write(record));
    EXPECT_EQ(5, record["other"].asInt());
    record.removeMember("other");
    EXPECT_EQ((std::vector<std::string>{"data", "mode", "url"}), Keys(record));
    EXPECT_EQ(server.httpUrl("/test/json"), record["url"].asString());
    EXPECT_EQ("a=1", record["data"].asString());
    EXPECT_EQ("sync", record["mode"].asString());
}

TEST_F(RequestPayload, RecordAfterASuccessCarriesStatusAndResponse) {
    Request request(server.httpUrl("/test/text").c_str(), "", false);
    ASSERT_TRUE(request.Send());
    Json::Value record;
    request.Write(record);
    EXPECT_EQ((std::vector<std::string>{"data", "http_status", "mode", "response", "url"}), Keys(record));
    EXPECT_EQ(200, record["http_status"].asInt());
    EXPECT_EQ("hello, world\n", record["response"].asString());
}

TEST_F(RequestPayload, RecordAfterAnErrorStatusHasNoResponse) {
    Request request(server.httpUrl("/test/notfound").c_str(), "", false);
    EXPECT_FALSE(request.Send());
    Json::Value record;
    request.Write(record);
    EXPECT_EQ(404, record["http_status"].asInt());
    EXPECT_EQ("", record["response"].asString());
}

TEST_F(RequestPayload, RecordAfterAFailedSynchronousTransferHasThreeKeys) {
    const std::string url = "http://127.0.0.1:" + std::to_string(requesttest::ClosedLoopbackPort()) + "/";
    Request request(url.c_str(), "", false);
    EXPECT_FALSE(request.Send());
    Json::Value record;
    request.Write(record);
    EXPECT_EQ((std::vector<std::string>{"data", "mode", "url"}), Keys(record));
}

TEST_F(RequestPayload, JobDoneWithAFailureMakesTheRequestDone) {
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    EXPECT_TRUE(request.JobDone(CURLE_COULDNT_CONNECT));
    EXPECT_EQ(CURLE_COULDNT_CONNECT, request.GetCurlResult());
    Json::Value record;
    request.Write(record);
    // No transfer ran on the handle: libcurl reports 0 as response code.
    EXPECT_EQ(0, record["http_status"].asInt());
    EXPECT_EQ("", record["response"].asString());
    EXPECT_EQ(RELAYD_ERR_NETWORK, request.GetError());
}

TEST_F(RequestPayload, CopyOwnsItsBodyAndHandle) {
    std::unique_ptr<Request> source(new Request(server.httpUrl("/test/echo").c_str(), "copied=1&x=2", true));
    ASSERT_TRUE(source->Send());
    Request copy(*source);
    EXPECT_TRUE(copy.IsValid());
    EXPECT_NE(source->GetCurlHandle(), copy.GetCurlHandle());
    // The copy starts without the source's answer.
    EXPECT_EQ("", copy.GetResponse());
    EXPECT_EQ(-1, copy.GetHttpStatus());
    std::list<std::string> cookies;
    EXPECT_FALSE(copy.GetCookies(cookies));
    source.reset();
    ASSERT_TRUE(copy.Send());
    Json::Value records = server.requests("/test/echo");
    ASSERT_EQ(2u, records.size());
    EXPECT_EQ("copied=1&x=2", RecordedBody(records[1]));
    EXPECT_EQ("POST", records[1]["method"].asString());
    EXPECT_EQ(copy.GetUrl(), server.httpUrl("/test/echo"));
}

TEST_F(RequestPayload, CopyOfAGetKeepsItsQuery) {
    Request source(server.httpUrl("/test/echo").c_str(), "q=1", false);
    Request copy(source);
    ASSERT_TRUE(copy.Send());
    EXPECT_EQ("/test/echo?q=1", OnlyRecord("/test/echo")["target"].asString());
    EXPECT_EQ("q=1", copy.GetData());
}

TEST_F(RequestPayload, CopyOfAnInvalidRequestIsInvalid) {
    Request source(nullptr, nullptr, false);
    Request copy(source);
    EXPECT_FALSE(copy.IsValid());
    EXPECT_FALSE(copy.Send());
}

TEST_F(RequestPayload, AssignmentToARequestWithoutHandle) {
    Request target(nullptr, nullptr, false);
    {
        Request source(server.httpsUrl("/test/echo").c_str(), "assigned=1", true);
        target = source;
        EXPECT_NE(source.GetCurlHandle(), target.GetCurlHandle());
    }
    EXPECT_EQ(server.httpsUrl("/test/echo"), target.GetUrl());
    EXPECT_EQ("assigned=1", target.GetData());
    ASSERT_TRUE(target.Send());
    EXPECT_EQ("assigned=1", RecordedBody(OnlyRecord("/test/echo")));
}

TEST_F(RequestPayload, ErrorBufferOfACopyIsItsOwn) {
    std::unique_ptr<Request> source(new Request(
        ("http://127.0.0.1:" + std::to_string(requesttest::ClosedLoopbackPort()) + "/").c_str(), "", false));
    Request copy(*source);
    source.reset();
    // libcurl writes its error text into the copy's own buffer here.
    EXPECT_FALSE(copy.Send());
    EXPECT_EQ(CURLE_COULDNT_CONNECT, copy.GetCurlResult());
}

TEST_F(RequestPayload, CurlCodesAreClassified) {
    struct Case {
        CURLcode code;
        int expected;
    } cases[] = {{CURLE_COULDNT_RESOLVE_HOST, 7},
                 {CURLE_COULDNT_CONNECT, 6},
                 {CURLE_OPERATION_TIMEDOUT, 6},
                 {CURLE_SSL_CONNECT_ERROR, 6},
                 {CURLE_SEND_ERROR, 6},
                 {CURLE_RECV_ERROR, 6},
                 {CURLE_AGAIN, 6},
                 {CURLE_URL_MALFORMAT, 2},
                 {CURLE_GOT_NOTHING, 2},
                 {CURLE_PEER_FAILED_VERIFICATION, 2},
                 {CURLE_COULDNT_RESOLVE_PROXY, 2}};
    for (const Case& c : cases) {
        Request request(server.httpUrl("/test/json").c_str(), "", false);
        StderrCapture capture;
        request.JobDone(c.code);
        EXPECT_EQ(c.expected, static_cast<int>(request.GetError())) << c.code;
        std::string log = capture.stop();
        EXPECT_TRUE(zepatest::LogContains(
            log, " curl error: " + std::to_string(c.code) + ", " + curl_easy_strerror(c.code)))
            << log;
    }
}

TEST_F(RequestPayload, JsonQueryWithTheWritersNewlineIsRefusedByLibcurl) {
    // The data is placed unescaped, so the serialised text's newline ends up
    // in the URL, which libcurl refuses before connecting.
    Json::Value body;
    body["a"] = 1;
    Request request(server.httpUrl("/test/echo"), body, false);
    EXPECT_EQ("{\"a\":1}\n", request.GetData());
    EXPECT_TRUE(request.IsValid());
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_URL_MALFORMAT, request.GetCurlResult());
    EXPECT_EQ(2, static_cast<int>(request.GetError()));
    EXPECT_EQ(0u, server.requests().size());
}

TEST_F(RequestPayload, RecordMasksCredentialsOfAFormBody) {
    Request request(server.httpUrl("/test/json").c_str(), "alias=home&token=t0k3n&key=k%2B1", true);
    Json::Value record;
    request.Write(record);
    EXPECT_EQ("alias=home&token=***&key=***", record["data"].asString());
    // The body sent is the real one.
    EXPECT_EQ("alias=home&token=t0k3n&key=k%2B1", request.GetData());
}

TEST_F(RequestPayload, RecordMasksCredentialsOfAJsonBody) {
    Json::Value body(Json::objectValue);
    body["identity"]["key"] = "api-k3y";
    body["identity"]["serial"] = "SN1";
    body["relay_pass"] = "pw";
    Request request(server.httpUrl("/test/json"), body, true);
    Json::Value record;
    request.Write(record);
    const std::string data = record["data"].asString();
    EXPECT_EQ(std::string::npos, data.find("api-k3y")) << data;
    const Json::Value shown = zepatest::ParseJson(data);
    EXPECT_EQ("***", shown["identity"]["key"].asString());
    EXPECT_EQ("SN1", shown["identity"]["serial"].asString());
    EXPECT_EQ("***", shown["relay_pass"].asString());
    Json::Value sent;
    ASSERT_TRUE(request.GetData(sent));
    EXPECT_EQ(body, sent);
}

TEST_F(RequestPayload, RecordKeepsABodyWithoutCredentialsAsItStands) {
    const char text[] = "{ \"a\" : [1, 2] }";
    Request request(server.httpUrl("/test/json").c_str(), text, true);
    Json::Value record;
    request.Write(record);
    EXPECT_EQ(text, record["data"].asString());
}
