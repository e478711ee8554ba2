#include "request_alias/identity_fixture.h"

#include "support/fake_sdk/fake_sdk.h"

namespace aliastest {

void StageIdentity(const zepatest::TempRoot& root, const std::string& serial, const std::string& token) {
    root.write("/etc/zepa/hubtoken.conf", "serial=\"" + serial + "\"\ntoken=\"" + token + "\"\n");
    root.write("/etc/zepa/cloudservice.conf", std::string("api_key=\"") + kApiKey + "\"\n");
    root.write("/etc.defaults/zepainfo.conf", std::string("upnpmodelname=\"") + kModel + "\"\n");
}

void IdentityTest::SetUp() {
    zepatest::RootTest::SetUp();
    zepafake::Reset();
    zepafake::Fake().mac = kMac;
    StageIdentity(root);
}

}  // namespace aliastest
