#include "fake_platform.h"

#include <zepasdk/identity.h>

#include <cstdio>
#include <cstring>

namespace zepafake {

Platform& Fake() {
    static Platform platform;
    return platform;
}

void AddMachineInterface(const std::string& name, std::vector<V6Address> addresses) {
    Fake().machine.push_back(V6Interface{name, std::move(addresses)});
}

}  // namespace zepafake

using zepafake::Fake;

extern "C" {

int ZEPACloudServiceGetMacAddress(char* buf, int size) {
    ++Fake().macCalls;
    if (Fake().macFails) {
        VLIBCErrSet(Fake().errorCode);
        return -1;
    }
    snprintf(buf, size, "%s", Fake().mac.c_str());
    return 0;
}

}  // extern "C"
