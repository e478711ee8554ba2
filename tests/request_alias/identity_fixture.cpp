#include "request_alias/identity_fixture.h"

#include <cstring>

extern "C" int ZEPACloudServiceGetMacAddress(char* buf, int size) {
    if (buf == nullptr || size < static_cast<int>(sizeof(aliastest::kMac))) return -1;
    memcpy(buf, aliastest::kMac, sizeof(aliastest::kMac));
    return 0;
}

namespace aliastest {

void StageIdentity(const zepatest::TempRoot& root, const std::string& serial, const std::string& token) {
    root.write("/etc/zepa/hubtoken.conf", "serial=\"" + serial + "\"\ntoken=\"" + token + "\"\n");
    root.write("/etc/zepa/cloudservice.conf", std::string("api_key=\"") + kApiKey + "\"\n");
    root.write("/etc.defaults/zepainfo.conf", std::string("upnpmodelname=\"") + kModel + "\"\n");
}

void IdentityTest::SetUp() {
    zepatest::RootTest::SetUp();
    StageIdentity(root);
}

}  // namespace aliastest
