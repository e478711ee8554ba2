#include <gtest/gtest.h>

#include <zeparelayd/errors.h>

#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;

TEST(ErrorWords, ResultWordsOfListedValues) {
    EXPECT_EQ("success", GetErrorStr(RELAYD_SUCCESS));
    EXPECT_EQ("err_config", GetErrorStr(RELAYD_ERR_CONFIG));
    EXPECT_EQ("err_register", GetErrorStr(RELAYD_ERR_REGISTER));
    EXPECT_EQ("err_network", GetErrorStr(RELAYD_ERR_NETWORK));
    EXPECT_EQ("err_resolv", GetErrorStr(RELAYD_ERR_RESOLV));
    EXPECT_EQ("err_auth", GetErrorStr(RELAYD_ERR_AUTH));
    EXPECT_EQ("err_not_support", GetErrorStr(RELAYD_ERR_NOT_SUPPORT));
    EXPECT_EQ("err_server_busy", GetErrorStr(RELAYD_ERR_SERVER_BUSY));
    EXPECT_EQ("err_lock", GetErrorStr(RELAYD_ERR_LOCK));
    EXPECT_EQ("err_server_limit", GetErrorStr(RELAYD_ERR_SERVER_LIMIT));
    EXPECT_EQ("err_server_changed", GetErrorStr(RELAYD_ERR_SERVER_CHANGED));
    EXPECT_EQ("err_server_ip_changed", GetErrorStr(RELAYD_ERR_SERVER_IP_CHANGED));
    EXPECT_EQ("err_api_key_expired", GetErrorStr(RELAYD_ERR_API_KEY_EXPIRED));
    EXPECT_EQ("err_unknown", GetErrorStr(RELAYD_ERR_UNKNOWN));
}

TEST(ErrorWords, UnassignedResultValuesAreUnknown) {
    for (int v : {1, 2, 4, -1, 16, 254, 256})
        EXPECT_EQ("err_unknown", GetErrorStr(static_cast<RELAYD_RET>(v))) << v;
}

TEST(ErrorWords, StateWords) {
    EXPECT_EQ("error", GetStateStr(static_cast<RELAYD_STATE>(0)));
    EXPECT_EQ("not_running", GetStateStr(RELAYD_STATE_NOT_RUNNING));
    EXPECT_EQ("starting", GetStateStr(RELAYD_STATE_STARTING));
    EXPECT_EQ("login", GetStateStr(RELAYD_STATE_LOGIN));
    EXPECT_EQ("direct_connect", GetStateStr(RELAYD_STATE_DIRECT_CONNECT));
    EXPECT_EQ("connected", GetStateStr(RELAYD_STATE_CONNECTED));
    EXPECT_EQ("connected", GetStateStr(RELAYD_STATE_CONNECTED_ALT));
    EXPECT_EQ("logout", GetStateStr(RELAYD_STATE_LOGOUT));
    EXPECT_EQ("stoped", GetStateStr(RELAYD_STATE_STOPED));
    EXPECT_EQ("error", GetStateStr(static_cast<RELAYD_STATE>(9)));
    EXPECT_EQ("error", GetStateStr(static_cast<RELAYD_STATE>(0xFFFFFFFFu)));
}

TEST(ErrorWords, ServerErrorWords) {
    EXPECT_EQ("SUCCESS", GetServerErrorStr(RELAYSERVER_ERR_SUCCESS));
    EXPECT_EQ("NO_SUCH_API", GetServerErrorStr(static_cast<RELAYSERVER_ERR>(3)));
    EXPECT_EQ("DDNS_OCCUPIED", GetServerErrorStr(RELAYSERVER_ERR_DDNS_OCCUPIED));
    EXPECT_EQ("SERVER_CHANGED", GetServerErrorStr(static_cast<RELAYSERVER_ERR>(13)));
    EXPECT_EQ("API_KEY_EXPIRED", GetServerErrorStr(RELAYSERVER_ERR_API_KEY_EXPIRED));
    EXPECT_EQ("(unknown errno: 12)", GetServerErrorStr(static_cast<RELAYSERVER_ERR>(12)));
    EXPECT_EQ("(unknown errno: 16)", GetServerErrorStr(static_cast<RELAYSERVER_ERR>(16)));
    EXPECT_EQ("(unknown errno: -1)", GetServerErrorStr(static_cast<RELAYSERVER_ERR>(-1)));
}

TEST(ErrorWords, RespErrMapGroups) {
    auto map = [](int v) { return static_cast<int>(RespErrMap(static_cast<RELAYSERVER_ERR>(v))); };
    EXPECT_EQ(0, map(0));
    EXPECT_EQ(255, map(1));
    EXPECT_EQ(255, map(7));
    EXPECT_EQ(255, map(8));
    EXPECT_EQ(8, map(2));
    EXPECT_EQ(8, map(6));
    EXPECT_EQ(8, map(10));
    EXPECT_EQ(12, map(11));
    EXPECT_EQ(13, map(13));
    EXPECT_EQ(14, map(14));
    EXPECT_EQ(15, map(15));
    for (int v : {3, 4, 5, 9, 12, 16, 1000, -1}) EXPECT_EQ(9, map(v)) << v;
}

TEST(ErrorWords, ParseServerErrorForms) {
    EXPECT_EQ(2, ParseServerError(ParseJson(R"({"errno": 2})")));
    EXPECT_EQ(13, ParseServerError(ParseJson(R"([{"errno": 13}, {"errno": 0}])")));
    EXPECT_EQ(1, ParseServerError(ParseJson("[]")));
    EXPECT_EQ(1, ParseServerError(ParseJson(R"({"errno": "2"})")));
    EXPECT_EQ(1, ParseServerError(ParseJson(R"([{"result": 0}])")));
    EXPECT_EQ(99, ParseServerError(ParseJson(R"({"errno": 99})")));
    EXPECT_EQ(0, ParseServerError(ParseJson(R"({"errno": 0})")));
    // No "errno" is not success.
    EXPECT_EQ(1, ParseServerError(ParseJson(R"({"result": "ok"})")));
    EXPECT_EQ(1, ParseServerError(Json::Value()));
    EXPECT_EQ(1, ParseServerError(Json::Value("text")));
    EXPECT_EQ(1, ParseServerError(Json::Value(3)));
    EXPECT_EQ(1, ParseServerError(ParseJson(R"([5, {"errno": 2}])")));
    // An object is never searched further, an array only in its first element.
    EXPECT_EQ(1, ParseServerError(ParseJson(R"({"data": {"errno": 2}})")));
    EXPECT_EQ(1, ParseServerError(ParseJson(R"([{"x": 1}, {"errno": 2}])")));
}
