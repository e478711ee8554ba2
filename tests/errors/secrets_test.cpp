#include <gtest/gtest.h>

#include <zeparelayd/errors.h>

#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::ParseJson;

TEST(SecretKeys, CredentialKeysOfEveryFormAreSecret) {
    for (const char* key :
         {"token", "key", "auth_key", "myhub_password", "relay_pass", "password", "api_key"}) {
        EXPECT_TRUE(IsSecretKey(key)) << key;
    }
}

TEST(SecretKeys, OtherKeysAndNearMissesAreNot) {
    for (const char* key : {"", "alias", "serial", "mac", "model", "relay_user", "myhub_account", "Token",
                            "key ", "tokens", "keyword", "id"}) {
        EXPECT_FALSE(IsSecretKey(key)) << key;
    }
}

TEST(MaskSecrets, SecretValuesAtEveryDepthBecomeStars) {
    const Json::Value in = ParseJson(R"({
        "token": "t0",
        "serial": "SN1",
        "identity": {"key": "k0", "mac": "m0", "auth_key": {"nested": "a0"}},
        "list": [{"relay_pass": 7}, {"name": "x"}, ["plain", {"myhub_password": "p0"}]],
        "count": 3
    })");
    const Json::Value out = MaskSecrets(in);
    EXPECT_EQ("***", out["token"].asString());
    EXPECT_EQ("SN1", out["serial"].asString());
    EXPECT_EQ("***", out["identity"]["key"].asString());
    EXPECT_EQ("m0", out["identity"]["mac"].asString());
    // Whatever the type of a secret value, it is replaced whole.
    EXPECT_EQ("***", out["identity"]["auth_key"].asString());
    EXPECT_EQ("***", out["list"][0]["relay_pass"].asString());
    EXPECT_EQ("x", out["list"][1]["name"].asString());
    EXPECT_EQ("plain", out["list"][2][0].asString());
    EXPECT_EQ("***", out["list"][2][1]["myhub_password"].asString());
    EXPECT_EQ(3, out["count"].asInt());
    EXPECT_EQ(in.getMemberNames(), out.getMemberNames());
}

TEST(MaskSecrets, InputIsLeftAlone) {
    const Json::Value in = ParseJson(R"({"a": {"token": "t0"}})");
    const Json::Value copy = in;
    const Json::Value out = MaskSecrets(in);
    EXPECT_EQ(copy, in);
    EXPECT_NE(in, out);
}

TEST(MaskSecrets, ValuesWithoutSecretsComeBackEqual) {
    for (const char* text : {"null", "5", "\"token\"", "[]", "{}", R"([1, "key", {"a": [true, null]}])"}) {
        const Json::Value v = ParseJson(text);
        EXPECT_EQ(v, MaskSecrets(v)) << text;
    }
}

TEST(MaskFormSecrets, SecretValuesAreMaskedInPlace) {
    EXPECT_EQ("action=map&token=***&alias=home&key=***&auth_key=***",
              MaskFormSecrets("action=map&token=abc&alias=home&key=k%2B1&auth_key=zz"));
}

TEST(MaskFormSecrets, EmptyValuesAreMaskedToo) { EXPECT_EQ("token=***&a=", MaskFormSecrets("token=&a=")); }

TEST(MaskFormSecrets, PiecesWithoutValueAndOtherNamesStay) {
    EXPECT_EQ("", MaskFormSecrets(""));
    EXPECT_EQ("token&&a=1&", MaskFormSecrets("token&&a=1&"));
    EXPECT_EQ("tokens=1&x=token=2", MaskFormSecrets("tokens=1&x=token=2"));
    // Only the first "=" separates the name.
    EXPECT_EQ("key=***", MaskFormSecrets("key=a=b"));
}
