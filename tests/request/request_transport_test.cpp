// Synchronous transfers against the local server: wire forms, statuses,
// error classification and its logging, TLS.
#include <curl/curl.h>
#include <gtest/gtest.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>

#include "request/request_fixture.h"

using namespace ZEPA::Relay;
using requesttest::ServerTest;
using zepatest::LogContains;
using zepatest::LogMessages;
using zepatest::RecordedBody;
using zepatest::StderrCapture;

namespace {

Json::Value Headers(std::initializer_list<std::pair<std::string, std::string>> list) {
    Json::Value headers(Json::arrayValue);
    for (const auto& h : list) {
        Json::Value pair(Json::arrayValue);
        pair.append(h.first);
        pair.append(h.second);
        headers.append(pair);
    }
    return headers;
}

int CountMessages(const std::string& log, const std::string& needle) {
    int n = 0;
    for (const std::string& m : LogMessages(log))
        if (m.find(needle) != std::string::npos) ++n;
    return n;
}

}  // namespace

using RequestTransport = ServerTest;

TEST_F(RequestTransport, NullUrlMakesAnInvalidRequestThatSendsNothingQuietly) {
    StderrCapture capture;
    Request request(nullptr, "a=1", true);
    EXPECT_FALSE(request.IsValid());
    EXPECT_FALSE(request.Send());
    EXPECT_EQ("", capture.stop());
    EXPECT_EQ(-1, request.GetHttpStatus());
    EXPECT_EQ(0u, server.requests().size());
}

TEST_F(RequestTransport, EmptyUrlMakesAnInvalidRequest) {
    StderrCapture capture;
    Request request("", "a=1", true);
    EXPECT_FALSE(request.IsValid());
    EXPECT_FALSE(request.Send());
    EXPECT_EQ("", capture.stop());
    EXPECT_EQ("", request.GetUrl());
}

TEST_F(RequestTransport, GetCarriesTheDataAsQueryAndNoBody) {
    Request request(server.httpUrl("/test/echo").c_str(), "a=1&b=2", false);
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("GET", rec["method"].asString());
    EXPECT_EQ("/test/echo?a=1&b=2", rec["target"].asString());
    EXPECT_EQ("HTTP/1.1", rec["version"].asString());
    EXPECT_EQ(Headers({{"Host", "127.0.0.1:" + std::to_string(server.httpPort())},
                       {"User-Agent", requesttest::kFallbackUserAgent},
                       {"Accept", "*/*"}}),
              rec["headers"]);
    EXPECT_EQ("", RecordedBody(rec));
    // The URL member never carries the query.
    EXPECT_EQ(server.httpUrl("/test/echo"), request.GetUrl());
    EXPECT_EQ("a=1&b=2", request.GetData());
}

TEST_F(RequestTransport, PostCarriesTheDataAsFormBody) {
    Request request(server.httpUrl("/test/echo").c_str(), "a=1&b=2", true);
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("POST", rec["method"].asString());
    EXPECT_EQ("/test/echo", rec["target"].asString());
    EXPECT_EQ(Headers({{"Host", "127.0.0.1:" + std::to_string(server.httpPort())},
                       {"User-Agent", requesttest::kFallbackUserAgent},
                       {"Accept", "*/*"},
                       {"Content-Length", "7"},
                       {"Content-Type", "application/x-www-form-urlencoded"}}),
              rec["headers"]);
    EXPECT_EQ("a=1&b=2", RecordedBody(rec));
}

TEST_F(RequestTransport, PostWithEmptyDataIsAPlainGetWithoutBody) {
    Request request(server.httpUrl("/test/echo").c_str(), "", true);
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("GET", rec["method"].asString());
    EXPECT_EQ("/test/echo", rec["target"].asString());
    EXPECT_EQ("", zepatest::RecordedHeader(rec, "Content-Length"));
    EXPECT_EQ(0, rec["body_length"].asInt());
}

TEST_F(RequestTransport, GetWithEmptyDataEndsInAQuestionMark) {
    Request request(server.httpUrl("/test/echo").c_str(), "", false);
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("GET", rec["method"].asString());
    EXPECT_EQ("/test/echo?", rec["target"].asString());
}

TEST_F(RequestTransport, NullDataIsTakenAsEmpty) {
    Request request(server.httpUrl("/test/echo").c_str(), nullptr, false);
    ASSERT_TRUE(request.Send());
    EXPECT_EQ("/test/echo?", OnlyRecord("/test/echo")["target"].asString());
    EXPECT_EQ("", request.GetData());
}

TEST_F(RequestTransport, BodyBytesGoOutExactlyAsGiven) {
    const std::string body = "a=1&b= x y =&c=\xc3\xa9\xff\x01&d";
    Request request(server.httpUrl("/test/echo").c_str(), body.c_str(), true);
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ(body, RecordedBody(rec));
    EXPECT_EQ(std::to_string(body.size()), zepatest::RecordedHeader(rec, "Content-Length"));
}

TEST_F(RequestTransport, QueryIsNotEscapedByTheRequest) {
    // Callers encode their query themselves; "&", "=", "%" and non-ASCII
    // bytes reach the server unchanged.
    const std::string query = "a=1&b=%20&c=\xc3\xa9=x";
    Request request(server.httpUrl("/test/echo").c_str(), query.c_str(), false);
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("GET /test/echo?" + query + " HTTP/1.1", zepatest::RecordedRequestLine(rec));
}

TEST_F(RequestTransport, AnswerOf200IsTheResponse) {
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    EXPECT_EQ(-1, request.GetHttpStatus());
    ASSERT_TRUE(request.Send());
    EXPECT_EQ(200, request.GetHttpStatus());
    EXPECT_EQ(CURLE_OK, request.GetCurlResult());
    EXPECT_EQ(RELAYD_SUCCESS, request.GetError());
    EXPECT_EQ("{\"errno\": 0, \"message\": \"ok\", \"list\": [1, 2, 3]}", request.GetResponse());
    Json::Value out;
    ASSERT_TRUE(request.GetResponse(out));
    EXPECT_EQ(0, out["errno"].asInt());
    EXPECT_EQ(3u, out["list"].size());
}

TEST_F(RequestTransport, NotFoundIsANetworkErrorWithoutResponse) {
    Daemon::_logLevel = 6;
    Request request(server.httpUrl("/test/notfound").c_str(), "", false);
    StderrCapture capture;
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(404, request.GetHttpStatus());
    EXPECT_EQ(RELAYD_ERR_NETWORK, request.GetError());
    EXPECT_EQ(RELAYD_ERR_NETWORK, request.GetError());
    std::string log = capture.stop();
    // Status lines are logged every time.
    EXPECT_EQ(2, CountMessages(log, "request:")) << log;
    EXPECT_EQ(2, CountMessages(log, " http status: 404")) << log;
    EXPECT_EQ("", request.GetResponse());
    Json::Value out("untouched");
    EXPECT_FALSE(request.GetResponse(out));
    EXPECT_EQ(Json::Value("untouched"), out);
}

TEST_F(RequestTransport, ServiceUnavailableIsServerBusy) {
    Request request(server.httpUrl("/test/busy").c_str(), "", false);
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(503, request.GetHttpStatus());
    EXPECT_EQ(RELAYD_ERR_SERVER_BUSY, request.GetError());
    EXPECT_EQ("", request.GetResponse());
}

TEST_F(RequestTransport, RedirectIsNotFollowedAndIsUnknown) {
    Request request(server.httpUrl("/test/redirect").c_str(), "", false);
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(302, request.GetHttpStatus());
    EXPECT_EQ(RELAYD_ERR_UNKNOWN, request.GetError());
    EXPECT_EQ("", request.GetResponse());
    EXPECT_EQ(0u, server.requests("/test/text").size());
}

TEST_F(RequestTransport, ScriptedStatusesAreClassified) {
    const std::string path = "/test/json";
    struct Case {
        int status;
        RELAYD_RET expected;
    } cases[] = {{400, RELAYD_ERR_NETWORK},     {499, RELAYD_ERR_NETWORK}, {500, RELAYD_ERR_SERVER_BUSY},
                 {599, RELAYD_ERR_SERVER_BUSY}, {201, RELAYD_ERR_UNKNOWN}, {204, RELAYD_ERR_UNKNOWN}};
    for (const Case& c : cases) {
        ASSERT_TRUE(server.script(path, c.status, c.status == 204 ? "" : "{}"));
        Request request(server.httpUrl(path).c_str(), "", false);
        EXPECT_FALSE(request.Send()) << c.status;
        EXPECT_EQ(c.status, request.GetHttpStatus());
        EXPECT_EQ(c.expected, request.GetError()) << c.status;
    }
}

TEST_F(RequestTransport, NonJsonAnswerFailsToParseWithADebugLine) {
    Request request(server.httpUrl("/test/nonjson").c_str(), "", false);
    ASSERT_TRUE(request.Send());
    EXPECT_EQ("<html>not json</html>", request.GetResponse());
    Json::Value out;
    {
        StderrCapture capture;
        EXPECT_FALSE(request.GetResponse(out));
        EXPECT_EQ("", capture.stop());  // debug level is above the default 4
    }
    Daemon::_logLevel = 7;
    StderrCapture capture;
    EXPECT_FALSE(request.GetResponse(out));
    std::vector<std::string> messages = LogMessages(capture.stop());
    ASSERT_EQ(1u, messages.size());
    EXPECT_EQ(0u, messages[0].find("request:"));
    EXPECT_NE(std::string::npos, messages[0].find(" failed to parse response: <html>not json</html>"));
}

// Answers are kept up to 1 MiB: a 10 MiB answer fails the transfer.
TEST_F(RequestTransport, TenMegabyteAnswerIsRefused) {
    Request request(server.httpUrl("/test/big").c_str(), "", false);
    zepatest::StderrCapture capture;
    EXPECT_FALSE(request.Send());
    capture.stop();
    EXPECT_EQ(CURLE_WRITE_ERROR, request.GetCurlResult());
    EXPECT_LE(request.GetResponse().size(), 1024u * 1024u);
    Json::Value out;
    EXPECT_FALSE(request.GetResponse(out));
}

TEST_F(RequestTransport, SendingAgainStartsAfresh) {
    Request request(server.httpUrl("/test/echo").c_str(), "x=1", true);
    ASSERT_TRUE(request.Send());
    const std::string first = request.GetResponse();
    ASSERT_TRUE(server.script("/test/echo", 503, "busy"));
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(503, request.GetHttpStatus());
    EXPECT_EQ("", request.GetResponse());
    ASSERT_TRUE(request.Send());
    Json::Value records = server.requests("/test/echo");
    ASSERT_EQ(3u, records.size());
    for (const Json::Value& rec : records) EXPECT_EQ("x=1", RecordedBody(rec));
    EXPECT_EQ(first.size(), request.GetResponse().size());
}

TEST_F(RequestTransport, SetRetargetsWithoutOptionsOfTheEarlierUse) {
    Request request(server.httpUrl("/test/echo").c_str(), "a=1", true);
    ASSERT_TRUE(request.Send());
    ASSERT_TRUE(request.Set(server.httpUrl("/test/text"), std::string("q=2"), false));
    ASSERT_TRUE(request.Send());
    Json::Value rec = OnlyRecord("/test/text");
    EXPECT_EQ("GET", rec["method"].asString());
    EXPECT_EQ("/test/text?q=2", rec["target"].asString());
    EXPECT_EQ("hello, world\n", request.GetResponse());
}

TEST_F(RequestTransport, ConnectionRefusedIsANetworkError) {
    const std::string url = "http://127.0.0.1:" + std::to_string(requesttest::ClosedLoopbackPort()) + "/x";
    Request request(url.c_str(), "", false);
    StderrCapture capture;
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_COULDNT_CONNECT, request.GetCurlResult());
    EXPECT_EQ(RELAYD_ERR_NETWORK, request.GetError());
    std::string log = capture.stop();
    EXPECT_TRUE(LogContains(log, " curl_easy_perform failed (7): [" + url + "]")) << log;
    EXPECT_TRUE(LogContains(log, " curl error: 7, Couldn't connect to server")) << log;
    EXPECT_EQ(-1, request.GetHttpStatus());
}

TEST_F(RequestTransport, UnresolvableHostIsAResolveError) {
    const std::string url = "http://" + requesttest::UnresolvableHost() + "/x";
    Request request(url.c_str(), "", true);
    StderrCapture capture;
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_COULDNT_RESOLVE_HOST, request.GetCurlResult());
    EXPECT_EQ(RELAYD_ERR_RESOLV, request.GetError());
    EXPECT_TRUE(LogContains(capture.stop(), " curl error: 6, Couldn't resolve host name"));
}

TEST_F(RequestTransport, SameCurlErrorIsLoggedOnceUntilASuccess) {
    const std::string refused = "http://127.0.0.1:" + std::to_string(requesttest::ClosedLoopbackPort()) + "/";
    Request bad1(refused.c_str(), "", false);
    Request bad2(refused.c_str(), "", false);
    Request good(server.httpUrl("/test/json").c_str(), "", false);
    StderrCapture capture;
    bad1.Send();
    bad2.Send();
    EXPECT_EQ(RELAYD_ERR_NETWORK, bad1.GetError());
    EXPECT_EQ(RELAYD_ERR_NETWORK, bad2.GetError());
    EXPECT_EQ(RELAYD_ERR_NETWORK, bad1.GetError());
    std::string log = capture.stop();
    EXPECT_EQ(1, CountMessages(log, " curl error: 7,")) << log;

    StderrCapture again;
    ASSERT_TRUE(good.Send());
    EXPECT_EQ(RELAYD_SUCCESS, good.GetError());
    EXPECT_EQ(RELAYD_ERR_NETWORK, bad2.GetError());
    log = again.stop();
    EXPECT_EQ(1, CountMessages(log, " curl error: 7,")) << log;
}

TEST_F(RequestTransport, DifferentCurlErrorsAreEachLogged) {
    const std::string refused = "http://127.0.0.1:" + std::to_string(requesttest::ClosedLoopbackPort()) + "/";
    Request bad(refused.c_str(), "", false);
    Request unresolved(("http://" + requesttest::UnresolvableHost() + "/").c_str(), "", false);
    bad.Send();
    unresolved.Send();
    StderrCapture capture;
    bad.GetError();
    unresolved.GetError();
    bad.GetError();
    std::string log = capture.stop();
    EXPECT_EQ(2, CountMessages(log, " curl error: 7,")) << log;
    EXPECT_EQ(1, CountMessages(log, " curl error: 6,")) << log;
}

TEST_F(RequestTransport, ServerClosingWithoutAnswerIsOtherError) {
    ASSERT_TRUE(server.hang("/test/json", 0.2));
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_GOT_NOTHING, request.GetCurlResult());
    EXPECT_EQ(2, static_cast<int>(request.GetError()));
}

TEST_F(RequestTransport, ConnectionResetIsANetworkError) {
    ASSERT_TRUE(server.scriptAction("/test/json", "reset"));
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_RECV_ERROR, request.GetCurlResult());
    EXPECT_EQ(RELAYD_ERR_NETWORK, request.GetError());
}

TEST_F(RequestTransport, TimedOutTransferIsANetworkError) {
    ASSERT_TRUE(server.hang("/test/json", 5));
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    // The 90-second limit is the daemon's; shorten it on the handle itself.
    ASSERT_EQ(CURLE_OK, curl_easy_setopt(request.GetCurlHandle(), CURLOPT_TIMEOUT_MS, 300L));
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_OPERATION_TIMEDOUT, request.GetCurlResult());
    EXPECT_EQ(RELAYD_ERR_NETWORK, request.GetError());
}

TEST_F(RequestTransport, HttpsWorksWithTheTrustedTestCa) {
    Request request(server.httpsUrl("/test/echo").c_str(), "k=v", true);
    ASSERT_TRUE(request.Send()) << request.GetCurlResult();
    Json::Value rec = OnlyRecord("/test/echo");
    EXPECT_EQ("https", rec["scheme"].asString());
    EXPECT_EQ("k=v", RecordedBody(rec));
    EXPECT_EQ(RELAYD_SUCCESS, request.GetError());
}

TEST_F(RequestTransport, HttpsToAnUnknownCaIsRejectedDespiteTheAcceptingCallback) {
    Request::SetExtraCaFile("");
    Request request(server.httpsUrl("/test/json").c_str(), "", false);
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_PEER_FAILED_VERIFICATION, request.GetCurlResult());
    EXPECT_EQ(2, static_cast<int>(request.GetError()));
    EXPECT_EQ(0u, server.requests().size());
}

// The trust store is kept between connections: it must follow both the
// choice of the extra CA file and a new content at the same path.
TEST_F(RequestTransport, TrustFollowsTheExtraCaFileAndItsContent) {
    zepatest::LocalServer other;
    ASSERT_TRUE(other.ok()) << other.error();
    auto sendTo = [](const zepatest::LocalServer& to) {
        Request request(to.httpsUrl("/test/json").c_str(), "", false);
        request.Send();
        return request.GetCurlResult();
    };
    EXPECT_EQ(CURLE_OK, sendTo(server));
    EXPECT_EQ(CURLE_PEER_FAILED_VERIFICATION, sendTo(other));

    Request::SetExtraCaFile(other.caFile());
    EXPECT_EQ(CURLE_OK, sendTo(other));
    EXPECT_EQ(CURLE_PEER_FAILED_VERIFICATION, sendTo(server));

    const std::string ca = root.path("/etc/extra-ca.pem");
    root.write("/etc/extra-ca.pem", zepatest::ReadFile(other.caFile()));
    Request::SetExtraCaFile(ca);
    EXPECT_EQ(CURLE_OK, sendTo(other));
    zepatest::WriteFile(ca + ".new", zepatest::ReadFile(server.caFile()));
    ASSERT_EQ(0, rename((ca + ".new").c_str(), ca.c_str()));
    EXPECT_EQ(CURLE_OK, sendTo(server));
    EXPECT_EQ(CURLE_PEER_FAILED_VERIFICATION, sendTo(other));
}

TEST_F(RequestTransport, UpperCaseHttpsGetsNoContextCallback) {
    // Without the callback the test CA is never added, so the system's trust
    // store alone decides, and it does not know the throwaway CA.
    const std::string url = "HTTPS://127.0.0.1:" + std::to_string(server.httpsPort()) + "/test/json";
    Request request(url.c_str(), "", false);
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_PEER_FAILED_VERIFICATION, request.GetCurlResult());
}

TEST_F(RequestTransport, HttpsToAPlainPortIsAnSslConnectError) {
    const std::string url = "https://127.0.0.1:" + std::to_string(server.httpPort()) + "/test/json";
    Request request(url.c_str(), "", false);
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_SSL_CONNECT_ERROR, request.GetCurlResult());
    EXPECT_EQ(RELAYD_ERR_NETWORK, request.GetError());
}

TEST_F(RequestTransport, UserAgentComesFromTheDeviceFiles) {
    root.write("/etc.defaults/zepainfo.conf", "upnpmodelname=\"ZS220\"\n");
    root.write("/etc.defaults/VERSION", "productversion=\"7.2\"\nbuildnumber=\"64570\"\n");
    Request request(server.httpUrl("/test/echo").c_str(), "", true);
    ASSERT_TRUE(request.Send());
    EXPECT_EQ("Farlink/7.2-64570 (ZS220)", zepatest::RecordedHeader(OnlyRecord("/test/echo"), "User-Agent"));
}

TEST_F(RequestTransport, UserAgentFallsBackWhenTheDeviceFilesLackAKey) {
    root.write("/etc.defaults/zepainfo.conf", "upnpmodelname=\"ZS220\"\n");
    root.write("/etc.defaults/VERSION", "productversion=\"7.2\"\n");
    Request request(server.httpUrl("/test/echo").c_str(), "", true);
    ASSERT_TRUE(request.Send());
    EXPECT_EQ(requesttest::kFallbackUserAgent,
              zepatest::RecordedHeader(OnlyRecord("/test/echo"), "User-Agent"));
}

TEST_F(RequestTransport, UrlWithoutSlashIsSentAsHttp) {
    // libcurl guesses the scheme; cookie saving finds no host in such a URL.
    const std::string url = "127.0.0.1:" + std::to_string(server.httpPort());
    Request request(url.c_str(), "", true);
    ASSERT_TRUE(request.IsValid());
    EXPECT_FALSE(request.Send());  // nothing is served at "/"
    EXPECT_EQ("/", OnlyRecord("/")["target"].asString());
    EXPECT_EQ(404, request.GetHttpStatus());
}

TEST_F(RequestTransport, OverlongUrlFailsTheUrlOption) {
    const std::string url = server.httpUrl("/test/echo?") + std::string(9 * 1024 * 1024, 'x');
    StderrCapture capture;
    Request request(url.c_str(), "", true);
    std::vector<std::string> messages = LogMessages(capture.stop());
    ASSERT_EQ(1u, messages.size());
    EXPECT_EQ(0u, messages[0].find("request:"));
    EXPECT_NE(std::string::npos, messages[0].find(" set CURLOPT_URLto curl handle failed"));
    EXPECT_FALSE(request.IsValid());
    EXPECT_FALSE(request.Send());
}

TEST_F(RequestTransport, OverlongQueryLeavesTheBareUrl) {
    const std::string query(9 * 1024 * 1024, 'q');
    StderrCapture capture;
    Request request(server.httpUrl("/test/echo").c_str(), query.c_str(), false);
    std::string log = capture.stop();
    EXPECT_TRUE(LogContains(log, " set CURLOPT_URLto curl handle failed")) << log;
    // The failed payload step does not stop the set-up, but libcurl dropped
    // the URL it held when it refused the new one: the transfer cannot start.
    ASSERT_TRUE(request.IsValid());
    EXPECT_FALSE(request.Send());
    EXPECT_EQ(CURLE_URL_MALFORMAT, request.GetCurlResult());
    EXPECT_EQ(2, static_cast<int>(request.GetError()));
    EXPECT_EQ(0u, server.requests().size());
}

TEST_F(RequestTransport, OverlongCookieFailsTheCookieOption) {
    Request::SetCookie("a=" + std::string(9 * 1024 * 1024, 'c'));
    StderrCapture capture;
    Request request(server.httpUrl("/test/echo").c_str(), "", true);
    std::string log = capture.stop();
    EXPECT_TRUE(LogContains(log, " set CURLOPT_COOKIEto curl handle failed")) << log;
    EXPECT_FALSE(request.IsValid());
}

TEST_F(RequestTransport, KeepAliveOnAnInvalidRequestStillAnswersTrue) {
    Request request(nullptr, nullptr, false);
    StderrCapture capture;
    EXPECT_TRUE(request.SetTcpKeepAlive(30));
    std::vector<std::string> messages = LogMessages(capture.stop());
    ASSERT_EQ(1u, messages.size());
    EXPECT_NE(std::string::npos, messages[0].find(" set CURLOPT_TCP_KEEPALIVEto curl handle failed"));
}

TEST_F(RequestTransport, KeepAliveRequestIsStillSent) {
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    StderrCapture capture;
    EXPECT_TRUE(request.SetTcpKeepAlive(15));
    EXPECT_EQ("", capture.stop());
    EXPECT_TRUE(request.Send());
}

TEST_F(RequestTransport, EveryTransferUsesAFreshConnection) {
    Request request(server.httpUrl("/test/json").c_str(), "", false);
    ASSERT_TRUE(request.Send());
    ASSERT_TRUE(request.Send());
    Request other(server.httpUrl("/test/json").c_str(), "", false);
    ASSERT_TRUE(other.Send());
    Json::Value records = server.requests("/test/json");
    ASSERT_EQ(3u, records.size());
    // The server keeps HTTP/1.1 connections open; the client closes each one.
    EXPECT_NE(records[0]["client_port"].asInt(), records[1]["client_port"].asInt());
    EXPECT_NE(records[1]["client_port"].asInt(), records[2]["client_port"].asInt());
}
