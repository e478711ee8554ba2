#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>
#include <zeparelayd/request_alias.h>
#include <boost/make_shared.hpp>
#include <string>

#include "request_alias/identity_fixture.h"
#include "support/local_server.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogContains;
using zepatest::ParseJson;
using zepatest::RecordedBody;
using zepatest::RecordedHeader;
using zepatest::StderrCapture;

namespace {

constexpr const char kUpdate[] = "/alias_update.php";
constexpr const char kQuery[] = "/alias_query.php";

// A port on loopback that nothing listens on.
int ClosedPort() {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
    socklen_t len = sizeof(addr);
    getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
    close(fd);
    return ntohs(addr.sin_port);
}

struct Result {
    bool sent = false;
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    ALIAS_RESPONSE_TYPE type = static_cast<ALIAS_RESPONSE_TYPE>(0);
    std::string log;
};

class AliasExchangeTest : public aliastest::IdentityTest {
protected:
    void SetUp() override {
        aliastest::IdentityTest::SetUp();
        ASSERT_TRUE(server.ok()) << server.error();
        Request::SetExtraCaFile(server.caFile());
    }
    void TearDown() override {
        Request::SetExtraCaFile("");
        aliastest::IdentityTest::TearDown();
    }

    Json::Value Data(bool https = false) const {
        Json::Value data(Json::objectValue);
        data["alias"] = "myhome";
        data["serial"] = aliastest::kSerial;
        data["token"] = aliastest::kToken;
        data["url"] = https ? server.httpsUrl() : server.httpUrl();
        data["id"] = "cloud-7";
        return data;
    }

    // SetRequest(cmd, data) and Send on a fresh request.
    Result Run(AliasRequest& request, ALIAS_REQUEST_CMD cmd, const Json::Value& data) {
        Result r;
        EXPECT_TRUE(request.SetRequest(cmd, data));
        StderrCapture capture;
        r.sent = request.Send(r.ret, r.type);
        r.log = capture.stop();
        return r;
    }
    Result Run(ALIAS_REQUEST_CMD cmd, const Json::Value& data) {
        AliasRequest request;
        return Run(request, cmd, data);
    }

    // A request the caller runs itself, as the daemon does.
    static boost::shared_ptr<Request> DaemonRequest(const std::string& url, const std::string& body) {
        auto req = boost::make_shared<Request>(url.c_str(), body.c_str(), true);
        req->Send();
        return req;
    }

    zepatest::LocalServer server;
};

}  // namespace

TEST_F(AliasExchangeTest, MapOverHttpIsGoodText) {
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_MAP, Data());
    EXPECT_TRUE(r.sent) << r.log;
    EXPECT_EQ(ALIAS_RET_SUCCESS, r.ret);
    EXPECT_EQ(ALIAS_RESP_TEXT, r.type);
    int code = 0;
    std::string text;
    request.GetResponse(code);
    request.GetResponse(text);
    EXPECT_EQ(200, code);
    EXPECT_EQ("good", text);
}

TEST_F(AliasExchangeTest, MapOverHttpsIsGoodText) {
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_MAP, Data(true));
    EXPECT_TRUE(r.sent) << r.log;
    EXPECT_EQ(ALIAS_RET_SUCCESS, r.ret) << r.log;
    EXPECT_EQ(ALIAS_RESP_TEXT, r.type);
    Json::Value records = server.requests(kUpdate);
    ASSERT_EQ(1u, records.size());
    EXPECT_EQ("https", records[0]["scheme"].asString());
}

TEST_F(AliasExchangeTest, WireFormIsTheFormBodyOfTheRequest) {
    Json::Value data = Data();
    data["alias"] = "my home&x=1";
    data["myhub_password"] = "p w+d";
    data["force"] = "true";
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_MAP, data);
    EXPECT_TRUE(r.sent);
    Json::Value records = server.requests(kUpdate);
    ASSERT_EQ(1u, records.size());
    EXPECT_EQ("POST", records[0]["method"].asString());
    EXPECT_EQ(kUpdate, records[0]["target"].asString());
    EXPECT_EQ("application/x-www-form-urlencoded", RecordedHeader(records[0], "Content-Type"));
    const std::string expected =
        std::string("action=map_alias&alias=my%20home%26x%3D1&force=true&id=cloud-7&key=") +
        aliastest::kApiKeyEncoded + "&mac=" + aliastest::kMacEncoded +
        "&model=ZS220&myhub_password=p%20w%2Bd&serial=SN0001&token=" + aliastest::kToken;
    EXPECT_EQ(expected, RecordedBody(records[0]));
    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    EXPECT_EQ(expected, body);
    EXPECT_EQ(server.httpUrl(kUpdate), url);
}

TEST_F(AliasExchangeTest, QueryOfAMappedAliasIsAJsonObject) {
    Json::Value data = Data();
    data["alias"] = "my home";
    ASSERT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_MAP, data).ret);
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_QUERY, data);
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_SUCCESS, r.ret);
    EXPECT_EQ(ALIAS_RESP_JSON, r.type);
    Json::Value answer;
    request.GetResponse(answer);
    EXPECT_EQ("my home", answer["alias"].asString());
    EXPECT_EQ("cloud-7", answer["id"].asString());
    EXPECT_EQ(aliastest::kMac, answer["mac"].asString());
    EXPECT_EQ(aliastest::kModel, answer["model"].asString());
    std::string text;
    request.GetResponse(text);
    EXPECT_EQ(answer, ParseJson(text));
    Json::Value records = server.requests(kQuery);
    ASSERT_EQ(1u, records.size());
    EXPECT_EQ(std::string("action=query_alias&alias=my%20home&key=") + aliastest::kApiKeyEncoded +
                  "&mac=" + aliastest::kMacEncoded + "&model=ZS220",
              RecordedBody(records[0]));
}

TEST_F(AliasExchangeTest, QueryOfAnUnknownAliasIsNotFound) {
    Result r = Run(ALIAS_REQ_QUERY, Data());
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_NOT_FOUND, r.ret);
    EXPECT_EQ(ALIAS_RESP_TEXT, r.type);
}

TEST_F(AliasExchangeTest, KeepAliveAndDeleteOfAMappedAlias) {
    ASSERT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_MAP, Data()).ret);
    EXPECT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_KEEP_ALIVE, Data()).ret);
    EXPECT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_KEEP_ALIVE, Data()).ret);
    AliasRequest query;
    ASSERT_EQ(ALIAS_RESP_JSON, Run(query, ALIAS_REQ_QUERY, Data()).type);
    Json::Value answer;
    query.GetResponse(answer);
    EXPECT_EQ(2, answer["keep_alive"].asInt());
    EXPECT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_DELETE, Data()).ret);
    EXPECT_EQ(ALIAS_RET_NOT_FOUND, Run(ALIAS_REQ_QUERY, Data()).ret);
    EXPECT_EQ(ALIAS_RET_NOT_FOUND, Run(ALIAS_REQ_KEEP_ALIVE, Data()).ret);
    EXPECT_EQ(ALIAS_RET_NOT_FOUND, Run(ALIAS_REQ_DELETE, Data()).ret);
}

TEST_F(AliasExchangeTest, AliasOfAnotherApplianceIsInUseAndStopsRetrying) {
    ASSERT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_MAP, Data()).ret);
    Json::Value other = Data();
    other["serial"] = "SN0002";
    other["token"] = "fedcba9876543210fedcba9876543210";
    Result r = Run(ALIAS_REQ_MAP, other);
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_INUSED, r.ret);
    ALIAS_RETRY_TYPE type = ALIAS_RETRY_NONE;
    EXPECT_TRUE(AliasRequest::GetRetryType(r.ret, type));
    EXPECT_EQ(ALIAS_RETRY_STOP, type);
    EXPECT_EQ(ALIAS_RET_INUSED, Run(ALIAS_REQ_DELETE, other).ret);
}

TEST_F(AliasExchangeTest, SecondAliasOfTheSameApplianceNeedsForce) {
    ASSERT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_MAP, Data()).ret);
    Json::Value second = Data();
    second["alias"] = "cottage";
    EXPECT_EQ(ALIAS_RET_SELF_INUSED, Run(ALIAS_REQ_MAP, second).ret);
    second["force"] = "true";
    EXPECT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_MAP, second).ret);
    EXPECT_EQ(ALIAS_RET_NOT_FOUND, Run(ALIAS_REQ_QUERY, Data()).ret);
}

TEST_F(AliasExchangeTest, ForceAsABooleanIsNotSent) {
    ASSERT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_MAP, Data()).ret);
    Json::Value second = Data();
    second["alias"] = "cottage";
    second["force"] = true;
    EXPECT_EQ(ALIAS_RET_SELF_INUSED, Run(ALIAS_REQ_MAP, second).ret);
    Json::Value records = server.requests(kUpdate);
    ASSERT_EQ(2u, records.size());
    EXPECT_EQ(std::string::npos, RecordedBody(records[1]).find("force")) << RecordedBody(records[1]);
}

TEST_F(AliasExchangeTest, WrongTokenIsBadAuthWithItsDetailForTheDaemon) {
    ASSERT_EQ(ALIAS_RET_SUCCESS, Run(ALIAS_REQ_MAP, Data()).ret);
    Json::Value data = Data();
    data["token"] = "ffffffffffffffffffffffffffffffff";
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_KEEP_ALIVE, data);
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_AUTH, r.ret);
    std::string text;
    request.GetResponse(text);
    EXPECT_EQ("badauth:token does not match serial", text);

    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    auto req = DaemonRequest(url, body);
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string detail = "untouched";
    EXPECT_TRUE(AliasRequest::GetResponseForDaemon(req, ret, detail));
    EXPECT_EQ(ALIAS_RET_AUTH, ret);
    EXPECT_EQ("token does not match serial", detail);
    ALIAS_RETRY_TYPE type = ALIAS_RETRY_NONE;
    EXPECT_TRUE(AliasRequest::GetRetryType(ret, type));
    EXPECT_EQ(ALIAS_RETRY_STOP, type);
}

TEST_F(AliasExchangeTest, MissingFieldIsBadParam) {
    // The client always sends every field; a hand-made body shows the server's answer.
    auto req = DaemonRequest(server.httpUrl(kUpdate), "action=map_alias&alias=a&serial=s&token=t&id=i");
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string detail;
    EXPECT_TRUE(AliasRequest::GetResponseForDaemon(req, ret, detail));
    EXPECT_EQ(ALIAS_RET_BAD_PARAM, ret);
    EXPECT_EQ("mac", detail);
}

TEST_F(AliasExchangeTest, DaemonAnswerWithoutColonKeepsTheDetail) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_MAP, Data()));
    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    auto req = DaemonRequest(url, body);
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string detail = "untouched";
    EXPECT_TRUE(AliasRequest::GetResponseForDaemon(req, ret, detail));
    EXPECT_EQ(ALIAS_RET_SUCCESS, ret);
    EXPECT_EQ("untouched", detail);
}

TEST_F(AliasExchangeTest, DaemonUnknownAnswerIsLoggedAndLeavesTheResult) {
    ASSERT_TRUE(server.script(kUpdate, 200, "\r\nwhatever happened\r\n"));
    auto req = DaemonRequest(server.httpUrl(kUpdate), "action=map_alias");
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string detail = "untouched";
    StderrCapture capture;
    EXPECT_FALSE(AliasRequest::GetResponseForDaemon(req, ret, detail));
    const std::string log = capture.stop();
    EXPECT_EQ(ALIAS_RET_NOT_SET, ret);
    EXPECT_EQ("untouched", detail);
    EXPECT_TRUE(LogContains(log, "request_alias:")) << log;
    EXPECT_TRUE(LogContains(log, " Unknown response: whatever happened")) << log;
}

TEST_F(AliasExchangeTest, DaemonHttpFailureGivesUnknown) {
    ASSERT_TRUE(server.script(kUpdate, 404, "badauth:not this"));
    auto req = DaemonRequest(server.httpUrl(kUpdate), "action=map_alias");
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string detail = "untouched";
    EXPECT_FALSE(AliasRequest::GetResponseForDaemon(req, ret, detail));
    EXPECT_EQ(ALIAS_RET_UNKNOWN, ret);
    EXPECT_EQ("untouched", detail);
}

TEST_F(AliasExchangeTest, DaemonConnectFailureIsNetwork) {
    auto req =
        DaemonRequest("http://127.0.0.1:" + std::to_string(ClosedPort()) + kUpdate, "action=map_alias");
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string detail;
    EXPECT_FALSE(AliasRequest::GetResponseForDaemon(req, ret, detail));
    EXPECT_EQ(ALIAS_RET_NETWORK, ret);
}

TEST_F(AliasExchangeTest, ServerWordsFromScriptedAnswers) {
    const std::pair<const char*, ALIAS_RET> cases[] = {
        {"911", ALIAS_RET_911},
        {"badsys:disk full", ALIAS_RET_SYSTEM},
        {"badip", ALIAS_RET_BAD_IP},
        {"api_key_expired", ALIAS_RET_API_KEY_EXPIRED},
        {"alias_self_inused:cottage", ALIAS_RET_SELF_INUSED},
    };
    for (const auto& c : cases) {
        ASSERT_TRUE(server.script(kUpdate, 200, c.first));
        Result r = Run(ALIAS_REQ_KEEP_ALIVE, Data());
        EXPECT_TRUE(r.sent) << c.first;
        EXPECT_EQ(c.second, r.ret) << c.first;
        EXPECT_EQ(ALIAS_RESP_TEXT, r.type) << c.first;
    }
}

TEST_F(AliasExchangeTest, BlanksAndLineEndsAroundTheWordAreTrimmed) {
    ASSERT_TRUE(server.script(kUpdate, 200, " \r\n\t good \r\n\r\n"));
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_MAP, Data());
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_SUCCESS, r.ret);
    std::string text;
    request.GetResponse(text);
    EXPECT_EQ("good", text);
}

TEST_F(AliasExchangeTest, WordWithLettersBehindIsUnknown) {
    ASSERT_TRUE(server.script(kUpdate, 200, "alias_inusedx"));
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_MAP, Data());
    EXPECT_FALSE(r.sent);
    EXPECT_EQ(ALIAS_RET_UNKNOWN, r.ret);
    EXPECT_EQ(ALIAS_RESP_TEXT, r.type);
    std::string text;
    request.GetResponse(text);
    EXPECT_EQ("alias_inusedx", text);
}

TEST_F(AliasExchangeTest, AnswerMatchingNoWordIsUnknown) {
    for (const char* body : {"ok", "GOOD", "error", "<html>busy</html>"}) {
        ASSERT_TRUE(server.script(kUpdate, 200, body));
        Result r = Run(ALIAS_REQ_MAP, Data());
        EXPECT_FALSE(r.sent) << body;
        EXPECT_EQ(ALIAS_RET_UNKNOWN, r.ret) << body;
        EXPECT_EQ(ALIAS_RESP_TEXT, r.type) << body;
    }
}

TEST_F(AliasExchangeTest, EmptyAnswerIsUnknownText) {
    ASSERT_TRUE(server.script(kUpdate, 200, ""));
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_MAP, Data());
    EXPECT_FALSE(r.sent);
    EXPECT_EQ(ALIAS_RET_UNKNOWN, r.ret);
    EXPECT_EQ(ALIAS_RESP_TEXT, r.type);
    int code = 0;
    request.GetResponse(code);
    EXPECT_EQ(200, code);
}

TEST_F(AliasExchangeTest, JsonThatIsNotAnObjectIsMatchedAsText) {
    const std::pair<const char*, ALIAS_RET> words[] = {{"[1,2]", ALIAS_RET_UNKNOWN},
                                                       {"\"good\"", ALIAS_RET_UNKNOWN},
                                                       {"true", ALIAS_RET_UNKNOWN},
                                                       {"911", ALIAS_RET_911}};
    for (const auto& w : words) {
        ASSERT_TRUE(server.script(kQuery, 200, w.first));
        AliasRequest request;
        Result r = Run(request, ALIAS_REQ_QUERY, Data());
        EXPECT_EQ(w.second == ALIAS_RET_911, r.sent) << w.first;
        EXPECT_EQ(w.second, r.ret) << w.first;
        EXPECT_EQ(ALIAS_RESP_TEXT, r.type) << w.first;
        Json::Value answer;
        request.GetResponse(answer);
        EXPECT_TRUE(answer.isNull()) << w.first;
    }
}

TEST_F(AliasExchangeTest, ScriptedJsonObjectIsSuccess) {
    ASSERT_TRUE(server.script(kQuery, 200, "\n{\"alias\":\"x\",\"state\":\"badauth\"}\n"));
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_QUERY, Data());
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_SUCCESS, r.ret);
    EXPECT_EQ(ALIAS_RESP_JSON, r.type);
    Json::Value answer;
    request.GetResponse(answer);
    EXPECT_EQ("badauth", answer["state"].asString());
}

TEST_F(AliasExchangeTest, ServerErrorIsUnknownWithoutAnswer) {
    AliasRequest request;
    ASSERT_EQ(ALIAS_RET_SUCCESS, Run(request, ALIAS_REQ_MAP, Data()).ret);
    ASSERT_TRUE(server.script(kUpdate, 503, "good"));
    Result r = Run(request, ALIAS_REQ_KEEP_ALIVE, Data());
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_UNKNOWN, r.ret);
    EXPECT_EQ(ALIAS_RESP_NONE, r.type);
    EXPECT_TRUE(LogContains(r.log, " http status: 503")) << r.log;
    int code = 0;
    std::string text;
    request.GetResponse(code);
    request.GetResponse(text);
    EXPECT_EQ(503, code);
    EXPECT_EQ("good", text);  // from the earlier answer
}

TEST_F(AliasExchangeTest, EveryHttpErrorIsUnknown) {
    for (int status : {404, 500, 502, 504, 301, 403}) {
        ASSERT_TRUE(server.script(kUpdate, status, "good"));
        Result r = Run(ALIAS_REQ_MAP, Data());
        EXPECT_TRUE(r.sent) << status;
        EXPECT_EQ(ALIAS_RET_UNKNOWN, r.ret) << status;
        EXPECT_EQ(ALIAS_RESP_NONE, r.type) << status;
    }
}

TEST_F(AliasExchangeTest, UnresolvableHostIsDns) {
    Json::Value data = Data();
    data["url"] = "http://alias.invalid";
    AliasRequest request;
    Result r = Run(request, ALIAS_REQ_MAP, data);
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_DNS, r.ret);
    EXPECT_EQ(ALIAS_RESP_NONE, r.type);
    EXPECT_TRUE(LogContains(r.log, "request_alias:")) << r.log;
    EXPECT_TRUE(LogContains(r.log, " curl error: 6, ")) << r.log;
    int code = 0;
    request.GetResponse(code);
    EXPECT_EQ(-1, code);
    ALIAS_RETRY_TYPE type = ALIAS_RETRY_NONE;
    EXPECT_TRUE(AliasRequest::GetRetryType(r.ret, type));
    EXPECT_EQ(ALIAS_RETRY_RESOLVE, type);
    std::string word;
    EXPECT_TRUE(AliasRequest::ResponseToString(r.ret, word));
    EXPECT_EQ("error_dns", word);
}

TEST_F(AliasExchangeTest, RefusedConnectionIsNetwork) {
    Json::Value data = Data();
    data["url"] = "http://127.0.0.1:" + std::to_string(ClosedPort());
    Result r = Run(ALIAS_REQ_MAP, data);
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_NETWORK, r.ret);
    EXPECT_EQ(ALIAS_RESP_NONE, r.type);
    EXPECT_TRUE(LogContains(r.log, " curl error: 7, ")) << r.log;
}

TEST_F(AliasExchangeTest, ResetConnectionIsNetwork) {
    ASSERT_TRUE(server.scriptAction(kUpdate, "reset"));
    Result r = Run(ALIAS_REQ_MAP, Data());
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_NETWORK, r.ret) << r.log;
    EXPECT_EQ(ALIAS_RESP_NONE, r.type);
}

TEST_F(AliasExchangeTest, ConnectionClosedWithoutAnswerIsUnknown) {
    ASSERT_TRUE(server.scriptAction(kUpdate, "close"));
    Result r = Run(ALIAS_REQ_MAP, Data());
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_UNKNOWN, r.ret) << r.log;
    EXPECT_EQ(ALIAS_RESP_NONE, r.type);
    EXPECT_TRUE(LogContains(r.log, " curl error: 52, ")) << r.log;
}

TEST_F(AliasExchangeTest, UntrustedCertificateIsRefused) {
    Request::SetExtraCaFile("");
    Result r = Run(ALIAS_REQ_MAP, Data(true));
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RESP_NONE, r.type);
    EXPECT_NE(ALIAS_RET_SUCCESS, r.ret);
    EXPECT_TRUE(server.requests(kUpdate).empty());
}

TEST_F(AliasExchangeTest, CommandNonePostsCommonFieldsToTheBaseUrl) {
    Result r = Run(ALIAS_REQ_NONE, Data());
    EXPECT_TRUE(r.sent);
    EXPECT_EQ(ALIAS_RET_UNKNOWN, r.ret);
    EXPECT_EQ(ALIAS_RESP_NONE, r.type);
    Json::Value records = server.requests();
    ASSERT_EQ(1u, records.size());
    EXPECT_EQ("/", records[0]["target"].asString());
    EXPECT_EQ("POST", records[0]["method"].asString());
    EXPECT_EQ(
        std::string("key=") + aliastest::kApiKeyEncoded + "&mac=" + aliastest::kMacEncoded + "&model=ZS220",
        RecordedBody(records[0]));
}

TEST_F(AliasExchangeTest, SendWithoutSetRequestIsRefused) {
    AliasRequest request;
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    ALIAS_RESPONSE_TYPE type = ALIAS_RESP_JSON;
    StderrCapture capture;
    EXPECT_FALSE(request.Send(ret, type));
    const std::string log = capture.stop();
    EXPECT_EQ(ALIAS_RET_NOT_SET, ret);
    EXPECT_EQ(ALIAS_RESP_JSON, type);
    EXPECT_TRUE(LogContains(log, " No valid request found!! Please call SetRequest() first")) << log;
    int code = 0;
    request.GetResponse(code);
    EXPECT_EQ(-1, code);
    EXPECT_TRUE(server.requests().empty());
}

TEST_F(AliasExchangeTest, SendWithoutTypeGivesTheSameResult) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_MAP, Data()));
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    EXPECT_TRUE(request.Send(ret));
    EXPECT_EQ(ALIAS_RET_SUCCESS, ret);
    ASSERT_TRUE(server.script(kUpdate, 200, "nonsense"));
    EXPECT_FALSE(request.Send(ret));
    EXPECT_EQ(ALIAS_RET_UNKNOWN, ret);
}

TEST_F(AliasExchangeTest, AliasNameFromTheBodyStaysEncoded) {
    Json::Value data = Data();
    data["alias"] = "my home";
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_DELETE, data));
    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    auto req = boost::make_shared<Request>(url.c_str(), body.c_str(), true);
    std::string alias;
    EXPECT_TRUE(AliasRequest::GetAliasName(req, alias));
    EXPECT_EQ("my%20home", alias);
}

TEST_F(AliasExchangeTest, AliasNameMissingFromTheBody) {
    auto req =
        boost::make_shared<Request>(server.httpUrl(kUpdate).c_str(), "action=map_alias&xalias=a&alias", true);
    std::string alias = "untouched";
    StderrCapture capture;
    EXPECT_FALSE(AliasRequest::GetAliasName(req, alias));
    const std::string log = capture.stop();
    EXPECT_EQ("untouched", alias);
    EXPECT_TRUE(LogContains(log, " not found alias name from post data [action=map_alias&xalias=a&alias]"))
        << log;
}

TEST_F(AliasExchangeTest, AliasNameIsTheFirstAliasPiece) {
    auto req =
        boost::make_shared<Request>(server.httpUrl(kUpdate).c_str(), "a=1&alias=first=x&alias=second", true);
    std::string alias;
    EXPECT_TRUE(AliasRequest::GetAliasName(req, alias));
    EXPECT_EQ("first", alias);
}

TEST_F(AliasExchangeTest, ParseOfTheDaemonsRequestDropsTheStatus) {
    ASSERT_TRUE(server.script(kUpdate, 200, "  good:fine \n"));
    auto req = DaemonRequest(server.httpUrl(kUpdate), "action=map_alias");
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string body;
    EXPECT_TRUE(AliasRequest::ParseCURLHttp(req, ret, body));
    EXPECT_EQ(ALIAS_RET_NOT_SET, ret);
    EXPECT_EQ("good:fine", body);
}

TEST_F(AliasExchangeTest, AliasNameMissingKeepsCredentialsOutOfTheLog) {
    auto req = boost::make_shared<Request>(
        server.httpUrl(kUpdate).c_str(), "action=x&key=k1&token=t1&myhub_password=p1&auth_key=a1&keys=v&id=i",
        true);
    std::string alias;
    StderrCapture capture;
    EXPECT_FALSE(AliasRequest::GetAliasName(req, alias));
    const std::string log = capture.stop();
    EXPECT_TRUE(LogContains(log,
                            " not found alias name from post data "
                            "[action=x&key=***&token=***&myhub_password=***&auth_key=***&keys=v&id=i]"))
        << log;
}
