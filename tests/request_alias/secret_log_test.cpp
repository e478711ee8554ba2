// At the debug level every step of an alias exchange is logged; the device
// token and the API key must not show in any of those lines.
#include <gtest/gtest.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request.h>
#include <zeparelayd/request_alias.h>
#include <boost/make_shared.hpp>
#include <string>

#include "request_alias/identity_fixture.h"
#include "support/local_server.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::StderrCapture;

namespace {

constexpr const char kUpdate[] = "/alias_update.php";
constexpr const char kPassword[] = "account-pw-9";
constexpr const char kAuthKey[] = "auth-key-77";

class AliasSecretLogTest : public aliastest::IdentityTest {
protected:
    void SetUp() override {
        aliastest::IdentityTest::SetUp();
        ASSERT_TRUE(server.ok()) << server.error();
        Request::SetExtraCaFile(server.caFile());
        _savedLevel = Daemon::_logLevel;
        Daemon::_logLevel = 7;
    }
    void TearDown() override {
        Daemon::_logLevel = _savedLevel;
        Request::SetExtraCaFile("");
        aliastest::IdentityTest::TearDown();
    }

    Json::Value Data() const {
        Json::Value data(Json::objectValue);
        data["alias"] = "myhome";
        data["serial"] = aliastest::kSerial;
        data["token"] = aliastest::kToken;
        data["url"] = server.httpUrl();
        data["id"] = "cloud-7";
        data["myhub_account"] = "owner";
        data["myhub_password"] = kPassword;
        data["auth_key"] = kAuthKey;
        return data;
    }

    // No credential, in clear or url-encoded, anywhere in the log.
    static void ExpectNoSecret(const std::string& log) {
        for (const char* secret :
             {aliastest::kToken, aliastest::kApiKey, aliastest::kApiKeyEncoded, kPassword, kAuthKey}) {
            EXPECT_EQ(std::string::npos, log.find(secret)) << secret << " in:\n" << log;
        }
    }

    zepatest::LocalServer server;

private:
    int _savedLevel = 4;
};

}  // namespace

// A server that echoes what it was sent: the answer carries the form body.
TEST_F(AliasSecretLogTest, EchoedBodyInTheAnswerIsMaskedInTheDebugLog) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_MAP, Data()));
    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    ASSERT_NE(std::string::npos, body.find(aliastest::kToken));
    ASSERT_TRUE(server.script(kUpdate, 200, "{\"received\":\"" + body + "\"}"));

    StderrCapture capture;
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    ALIAS_RESPONSE_TYPE type = ALIAS_RESP_NONE;
    EXPECT_TRUE(request.Send(ret, type));
    const std::string log = capture.stop();

    EXPECT_EQ(ALIAS_RET_SUCCESS, ret);
    EXPECT_EQ(ALIAS_RESP_JSON, type);
    // The exchange was logged, the answer included, with the secrets masked.
    EXPECT_NE(std::string::npos, log.find(" HTTP: 200, Response: ")) << log;
    EXPECT_NE(std::string::npos, log.find("token=***")) << log;
    ExpectNoSecret(log);
    // The server itself received the credentials.
    EXPECT_NE(std::string::npos, zepatest::RecordedBody(server.requests(kUpdate)[0]).find(aliastest::kToken));
}

// The daemon runs the transfer itself and hands the finished request over.
TEST_F(AliasSecretLogTest, DaemonPathLogsNoSecret) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_KEEP_ALIVE, Data()));
    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    ASSERT_TRUE(server.script(kUpdate, 200, "whatever " + body));

    StderrCapture capture;
    auto req = boost::make_shared<Request>(url.c_str(), body.c_str(), true);
    req->Send();
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string detail;
    EXPECT_FALSE(AliasRequest::GetResponseForDaemon(req, ret, detail));
    const std::string log = capture.stop();

    EXPECT_NE(std::string::npos, log.find(" Unknown response: ")) << log;
    ExpectNoSecret(log);
}

// A body without an alias name is logged whole, credentials masked.
TEST_F(AliasSecretLogTest, MissingAliasNameLineMasksTheBody) {
    const std::string body = std::string("token=") + aliastest::kToken + "&key=" + aliastest::kApiKeyEncoded +
                             "&myhub_password=" + kPassword + "&serial=SN0001";
    auto req = boost::make_shared<Request>(server.httpUrl(kUpdate).c_str(), body.c_str(), true);
    StderrCapture capture;
    std::string alias;
    EXPECT_FALSE(AliasRequest::GetAliasName(req, alias));
    const std::string log = capture.stop();
    EXPECT_NE(std::string::npos, log.find("token=***&key=***&myhub_password=***&serial=SN0001")) << log;
    ExpectNoSecret(log);
}
