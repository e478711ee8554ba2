// A test root holding a complete appliance identity: serial and token, API
// key and model in their key/value files. The MAC address comes from the
// interface list, which a test cannot set: the fake SDK dictates it.
#ifndef ZEPARELAYD_TESTS_REQUEST_ALIAS_IDENTITY_FIXTURE_H
#define ZEPARELAYD_TESTS_REQUEST_ALIAS_IDENTITY_FIXTURE_H

#include "support/test_support.h"

namespace aliastest {

constexpr const char kSerial[] = "SN0001";
constexpr const char kToken[] = "0123456789abcdef0123456789abcdef";
constexpr const char kMac[] = "00:11:32:aa:bb:cc";
constexpr const char kMacEncoded[] = "00%3A11%3A32%3Aaa%3Abb%3Acc";
constexpr const char kApiKey[] = "key+/=secret";
constexpr const char kApiKeyEncoded[] = "key%2B%2F%3Dsecret";
constexpr const char kModel[] = "ZS220";

// Writes the identity files below root.
void StageIdentity(const zepatest::TempRoot& root, const std::string& serial = kSerial,
                   const std::string& token = kToken);

class IdentityTest : public zepatest::RootTest {
protected:
    void SetUp() override;
};

}  // namespace aliastest

#endif
