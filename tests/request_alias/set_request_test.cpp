#include <gtest/gtest.h>
#include <syslog.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/request_alias.h>
#include <string>
#include <utility>
#include <vector>

#include "request_alias/identity_fixture.h"
#include "support/seams.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogContains;
using zepatest::ParseJson;
using zepatest::StderrCapture;

namespace {

std::vector<std::pair<int, std::string>> g_systemLog;

void RecordSystemLog(int priority, const char* message) { g_systemLog.emplace_back(priority, message); }

class SetRequestTest : public aliastest::IdentityTest {
protected:
    void SetUp() override {
        aliastest::IdentityTest::SetUp();
        g_systemLog.clear();
        SetSystemLogHook(RecordSystemLog);
    }
    void TearDown() override {
        SetSystemLogHook(nullptr);
        aliastest::IdentityTest::TearDown();
    }

    static Json::Value Data() {
        return ParseJson(
            R"({"alias":"myhome","serial":"SN0001","token":"0123456789abcdef0123456789abcdef","url":"http://alias.invalid",
                             "id":"cloud-7","myhub_account":"owner@example.test","myhub_password":"p w&d",
                             "myhub_id":"42","auth_key":"ak","force":"true","poll_seconds":60})");
    }

    // The request's fields and URL after SetRequest(cmd, data).
    static std::pair<Json::Value, std::string> Built(ALIAS_REQUEST_CMD cmd, const Json::Value& data) {
        AliasRequest request;
        EXPECT_TRUE(request.SetRequest(cmd, data));
        std::pair<Json::Value, std::string> out;
        EXPECT_TRUE(request.GetRequest(out.first, out.second));
        return out;
    }

    Json::Value Common() const {
        Json::Value fields(Json::objectValue);
        fields["mac"] = aliastest::kMac;
        fields["key"] = aliastest::kApiKey;
        fields["model"] = aliastest::kModel;
        return fields;
    }
};

}  // namespace

TEST_F(SetRequestTest, MapSendsEveryStringField) {
    auto built = Built(ALIAS_REQ_MAP, Data());
    Json::Value expected = Common();
    expected["action"] = "map_alias";
    for (const char* key : {"alias", "serial", "token", "id", "myhub_account", "myhub_password", "myhub_id",
                            "auth_key", "force"})
        expected[key] = Data()[key];
    EXPECT_EQ(expected, built.first) << built.first.toStyledString();
    EXPECT_EQ("http://alias.invalid/alias_update.php", built.second);
}

TEST_F(SetRequestTest, MapWithoutOptionalFields) {
    Json::Value data = Data();
    for (const char* key : {"myhub_account", "myhub_password", "myhub_id", "auth_key", "force"})
        data.removeMember(key);
    auto built = Built(ALIAS_REQ_MAP, data);
    EXPECT_EQ((std::vector<std::string>{"action", "alias", "id", "key", "mac", "model", "serial", "token"}),
              built.first.getMemberNames());
}

TEST_F(SetRequestTest, MapSkipsNonStringOptionalFields) {
    Json::Value data = Data();
    data["force"] = true;
    data["myhub_id"] = 42;
    data["auth_key"] = Json::Value();
    auto built = Built(ALIAS_REQ_MAP, data);
    EXPECT_FALSE(built.first.isMember("force"));
    EXPECT_FALSE(built.first.isMember("myhub_id"));
    EXPECT_FALSE(built.first.isMember("auth_key"));
    EXPECT_EQ("owner@example.test", built.first["myhub_account"].asString());
}

TEST_F(SetRequestTest, DeleteAndKeepAliveSendIdentityFieldsOnly) {
    const std::pair<ALIAS_REQUEST_CMD, const char*> cases[] = {{ALIAS_REQ_DELETE, "delete_alias"},
                                                               {ALIAS_REQ_KEEP_ALIVE, "keep_alive_alias"}};
    for (const auto& c : cases) {
        auto built = Built(c.first, Data());
        Json::Value expected = Common();
        expected["action"] = c.second;
        for (const char* key : {"alias", "serial", "token", "id"}) expected[key] = Data()[key];
        EXPECT_EQ(expected, built.first) << c.second;
        EXPECT_EQ("http://alias.invalid/alias_update.php", built.second);
    }
}

TEST_F(SetRequestTest, QuerySendsOnlyTheAlias) {
    auto built = Built(ALIAS_REQ_QUERY, Data());
    Json::Value expected = Common();
    expected["action"] = "query_alias";
    expected["alias"] = "myhome";
    EXPECT_EQ(expected, built.first);
    EXPECT_EQ("http://alias.invalid/alias_query.php", built.second);
}

TEST_F(SetRequestTest, QueryStillNeedsTheSerial) {
    Json::Value data = Data();
    data.removeMember("serial");
    AliasRequest request;
    StderrCapture capture;
    EXPECT_FALSE(request.SetRequest(ALIAS_REQ_QUERY, data));
    const std::string log = capture.stop();
    EXPECT_TRUE(LogContains(log, " serial is not found")) << log;
    Json::Value fields;
    std::string url;
    EXPECT_FALSE(request.GetRequest(fields, url));
}

TEST_F(SetRequestTest, NoneSendsCommonFieldsToTheBaseUrl) {
    auto built = Built(ALIAS_REQ_NONE, Data());
    EXPECT_EQ(Common(), built.first);
    EXPECT_EQ("http://alias.invalid/", built.second);
}

TEST_F(SetRequestTest, CommandsAboveFiveBehaveLikeNone) {
    for (int cmd : {6, 7, 100}) {
        auto built = Built(static_cast<ALIAS_REQUEST_CMD>(cmd), Data());
        EXPECT_EQ(Common(), built.first) << cmd;
        EXPECT_EQ("http://alias.invalid/", built.second) << cmd;
    }
    EXPECT_TRUE(g_systemLog.empty());
}

TEST_F(SetRequestTest, UnspecifiedIsRefusedThroughTheSystemLog) {
    AliasRequest request;
    StderrCapture capture;
    EXPECT_FALSE(request.SetRequest(ALIAS_REQ_UNSPECIFIED, Data()));
    const std::string log = capture.stop();
    ASSERT_EQ(1u, g_systemLog.size());
    EXPECT_EQ(LOG_ERR, g_systemLog[0].first);
    EXPECT_EQ("not specify request", g_systemLog[0].second);
    EXPECT_FALSE(LogContains(log, "not specify request")) << log;
    Json::Value fields;
    std::string url;
    EXPECT_FALSE(request.GetRequest(fields, url));
}

TEST_F(SetRequestTest, UnspecifiedLeavesAnEarlierRequestInPlace) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_QUERY, Data()));
    Json::Value data = Data();
    data["alias"] = "other";
    EXPECT_FALSE(request.SetRequest(ALIAS_REQ_UNSPECIFIED, data));
    Json::Value fields;
    std::string url;
    ASSERT_TRUE(request.GetRequest(fields, url));
    EXPECT_EQ("myhome", fields["alias"].asString());
    EXPECT_EQ("query_alias", fields["action"].asString());
    EXPECT_EQ("http://alias.invalid/alias_query.php", url);
}

TEST_F(SetRequestTest, InvalidDataLeavesAnEarlierRequestInPlace) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_DELETE, Data()));
    Json::Value data = Data();
    data["token"] = "";
    EXPECT_FALSE(request.SetRequest(ALIAS_REQ_MAP, data));
    Json::Value fields;
    std::string url;
    ASSERT_TRUE(request.GetRequest(fields, url));
    EXPECT_EQ("delete_alias", fields["action"].asString());
    EXPECT_TRUE(g_systemLog.empty());
}

TEST_F(SetRequestTest, ANewCommandReplacesTheOldOne) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_MAP, Data()));
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_QUERY, Data()));
    Json::Value fields;
    std::string url;
    ASSERT_TRUE(request.GetRequest(fields, url));
    EXPECT_FALSE(fields.isMember("serial"));
    EXPECT_FALSE(fields.isMember("token"));
    EXPECT_EQ("http://alias.invalid/alias_query.php", url);
}

TEST_F(SetRequestTest, BodyIsTheFormEncodingInKeyOrder) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_KEEP_ALIVE, Data()));
    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    EXPECT_EQ("action=keep_alive_alias&alias=myhome&id=cloud-7&key=" +
                  std::string(aliastest::kApiKeyEncoded) + "&mac=" + aliastest::kMacEncoded +
                  "&model=" + aliastest::kModel + "&serial=SN0001&token=0123456789abcdef0123456789abcdef",
              body);
    EXPECT_EQ("http://alias.invalid/alias_update.php", url);
}

TEST_F(SetRequestTest, BodyGrowsWithEachCall) {
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_QUERY, Data()));
    std::string once;
    std::string url;
    ASSERT_TRUE(request.GetRequest(once, url));
    std::string body;
    ASSERT_TRUE(request.GetRequest(body, url));
    ASSERT_TRUE(request.GetRequest(body, url));
    EXPECT_EQ(once + once, body);
}

TEST_F(SetRequestTest, SpecialCharactersAreEncodedInValuesOnly) {
    Json::Value data = Data();
    data["alias"] = "my home&x=1\xc3\xa9";
    AliasRequest request;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_QUERY, data));
    std::string body;
    std::string url;
    ASSERT_TRUE(request.GetRequest(body, url));
    EXPECT_NE(std::string::npos, body.find("&alias=my%20home%26x%3D1%C3%A9&")) << body;
    EXPECT_EQ(0u, body.find("action=query_alias&")) << body;
}

TEST_F(SetRequestTest, CredentialsNeverReachTheLog) {
    Daemon::_logLevel = 7;
    AliasRequest request;
    StderrCapture capture;
    ASSERT_TRUE(request.SetRequest(ALIAS_REQ_MAP, Data()));
    const std::string log = capture.stop();
    EXPECT_EQ(std::string::npos, log.find(aliastest::kToken)) << log;
    EXPECT_EQ(std::string::npos, log.find(aliastest::kApiKey)) << log;
}
