// The alias exchange as the daemon runs it: configuration file -> alias
// request data -> command -> transfer -> classification -> alias status file,
// read back by a fresh reader.
#include <gtest/gtest.h>

#include <zeparelayd/config.h>
#include <zeparelayd/request.h>
#include <zeparelayd/request_alias.h>
#include <string>

#include "common/paths.h"
#include "request_alias/identity_fixture.h"
#include "support/local_server.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;
using zepatest::RecordedBody;
using zepatest::ToJson;

namespace {

struct Outcome {
    bool sent = false;
    ALIAS_RET ret = ALIAS_RET_NOT_SET;
    std::string word;
    std::string detail;
    ALIAS_RETRY_TYPE retry = ALIAS_RETRY_NONE;
};

class DaemonAliasExchangeTest : public aliastest::IdentityTest {
protected:
    void SetUp() override {
        aliastest::IdentityTest::SetUp();
        ASSERT_TRUE(server.ok()) << server.error();
        Request::SetExtraCaFile(server.caFile());
        root.mkdir("/tmp");
    }
    void TearDown() override {
        Request::SetExtraCaFile("");
        aliastest::IdentityTest::TearDown();
    }

    void WriteConfig(const std::string& alias, const std::string& serverId) {
        Json::Value conf(Json::objectValue);
        conf["server_alias"]["alias"] = alias;
        conf["server_alias"]["url"] = server.httpsUrl();
        conf["server_alias"]["poll_seconds"] = 600;
        conf["serverID"] = serverId;
        root.write(Paths::RELAYD_CONF, ToJson(conf));
    }

    // One alias cycle of the daemon: the outcome goes into the status file.
    Outcome Cycle(ALIAS_REQUEST_CMD cmd) {
        Outcome o;
        RelaydConf conf(root.path(Paths::RELAYD_CONF).c_str());
        Json::Value data;
        conf.DumpDataForAliasReq(data);
        AliasRequest request;
        EXPECT_TRUE(request.SetRequest(cmd, data));
        ALIAS_RESPONSE_TYPE type = ALIAS_RESP_NONE;
        o.sent = request.Send(o.ret, type);
        if (type == ALIAS_RESP_TEXT) {
            std::string text;
            request.GetResponse(text);
            const std::string::size_type colon = text.find(':');
            if (colon != std::string::npos) o.detail = text.substr(colon + 1);
        }
        EXPECT_TRUE(AliasRequest::ResponseToString(o.ret, o.word));
        EXPECT_TRUE(AliasRequest::GetRetryType(o.ret, o.retry));
        AliasStatus status;
        EXPECT_TRUE(status.SetStatus(conf.alias.GetAliasName(), o.word, o.detail, true));
        return o;
    }

    static std::pair<std::string, std::string> StoredStatus(const std::string& alias) {
        AliasStatus reader;
        std::pair<std::string, std::string> out("none", "none");
        EXPECT_TRUE(reader.GetStatus(alias, out.first, out.second));
        return out;
    }

    zepatest::LocalServer server;
};

}  // namespace

TEST_F(DaemonAliasExchangeTest, MappedAliasIsRecordedAsSuccess) {
    WriteConfig("myhome", "cloud-7");
    Outcome o = Cycle(ALIAS_REQ_MAP);
    EXPECT_TRUE(o.sent);
    EXPECT_EQ(ALIAS_RET_SUCCESS, o.ret);
    EXPECT_EQ(ALIAS_RETRY_NORMAL, o.retry);
    EXPECT_EQ(std::make_pair(std::string("success"), std::string("")), StoredStatus("myhome"));
    EXPECT_EQ(ParseJson(R"({"alias_name":"myhome","status":"success","extra":""})"),
              ParseJson(root.read(Paths::ALIAS_STATUS_FILE)));

    Json::Value records = server.requests("/alias_update.php");
    ASSERT_EQ(1u, records.size());
    EXPECT_EQ("https", records[0]["scheme"].asString());
    EXPECT_EQ(std::string("action=map_alias&alias=myhome&id=cloud-7&key=") + aliastest::kApiKeyEncoded +
                  "&mac=" + aliastest::kMacEncoded + "&model=" + aliastest::kModel +
                  "&serial=" + aliastest::kSerial + "&token=" + aliastest::kToken,
              RecordedBody(records[0]));
}

TEST_F(DaemonAliasExchangeTest, AliasOfAnotherApplianceIsRecordedWithItsStopClass) {
    WriteConfig("myhome", "cloud-7");
    ASSERT_EQ(ALIAS_RET_SUCCESS, Cycle(ALIAS_REQ_MAP).ret);

    // Another appliance with the same alias in its configuration.
    aliastest::StageIdentity(root, "SN0002", "fedcba9876543210fedcba9876543210");
    WriteConfig("myhome", "cloud-8");
    Outcome o = Cycle(ALIAS_REQ_MAP);
    EXPECT_TRUE(o.sent);
    EXPECT_EQ(ALIAS_RET_INUSED, o.ret);
    EXPECT_EQ(ALIAS_RETRY_STOP, o.retry);
    EXPECT_EQ(std::make_pair(std::string("error_inused"), std::string("")), StoredStatus("myhome"));

    Json::Value records = server.requests("/alias_update.php");
    ASSERT_EQ(2u, records.size());
    EXPECT_NE(std::string::npos, RecordedBody(records[1]).find("&id=cloud-8&")) << RecordedBody(records[1]);
    EXPECT_NE(std::string::npos, RecordedBody(records[1]).find("&serial=SN0002&"))
        << RecordedBody(records[1]);
}

TEST_F(DaemonAliasExchangeTest, WrongTokenIsRecordedWithTheServersDetail) {
    WriteConfig("myhome", "cloud-7");
    ASSERT_EQ(ALIAS_RET_SUCCESS, Cycle(ALIAS_REQ_MAP).ret);
    aliastest::StageIdentity(root, aliastest::kSerial, "ffffffffffffffffffffffffffffffff");
    Outcome o = Cycle(ALIAS_REQ_KEEP_ALIVE);
    EXPECT_TRUE(o.sent);
    EXPECT_EQ(ALIAS_RET_AUTH, o.ret);
    EXPECT_EQ(ALIAS_RETRY_STOP, o.retry);
    EXPECT_EQ(std::make_pair(std::string("error_auth"), std::string("token does not match serial")),
              StoredStatus("myhome"));
}

TEST_F(DaemonAliasExchangeTest, ServerTroubleIsRecordedAsUnknown) {
    WriteConfig("myhome", "cloud-7");
    ASSERT_TRUE(server.script("/alias_update.php", 503, "busy"));
    Outcome o = Cycle(ALIAS_REQ_MAP);
    EXPECT_TRUE(o.sent);
    EXPECT_EQ(ALIAS_RET_UNKNOWN, o.ret);
    EXPECT_EQ(ALIAS_RETRY_NORMAL, o.retry);
    EXPECT_EQ(std::make_pair(std::string("error_unknown"), std::string("")), StoredStatus("myhome"));
    EXPECT_EQ(ALIAS_RET_SUCCESS, Cycle(ALIAS_REQ_MAP).ret);
    EXPECT_EQ(std::make_pair(std::string("success"), std::string("")), StoredStatus("myhome"));
}

TEST_F(DaemonAliasExchangeTest, QueryAfterDeleteIsRecordedAsNotFound) {
    WriteConfig("myhome", "cloud-7");
    ASSERT_EQ(ALIAS_RET_SUCCESS, Cycle(ALIAS_REQ_MAP).ret);
    ASSERT_EQ(ALIAS_RET_SUCCESS, Cycle(ALIAS_REQ_QUERY).ret);
    ASSERT_EQ(ALIAS_RET_SUCCESS, Cycle(ALIAS_REQ_DELETE).ret);
    Outcome o = Cycle(ALIAS_REQ_QUERY);
    EXPECT_EQ(ALIAS_RET_NOT_FOUND, o.ret);
    EXPECT_EQ(std::make_pair(std::string("error_not_found"), std::string("")), StoredStatus("myhome"));
}

TEST_F(DaemonAliasExchangeTest, ConfigurationWithoutServerIdIsRefused) {
    WriteConfig("myhome", "");
    RelaydConf conf(root.path(Paths::RELAYD_CONF).c_str());
    Json::Value data;
    conf.DumpDataForAliasReq(data);
    AliasRequest request;
    EXPECT_FALSE(request.SetRequest(ALIAS_REQ_MAP, data));
    EXPECT_TRUE(server.requests().empty());
}
