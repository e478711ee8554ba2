#include "fake_platform.h"

#include <zepasdk/identity.h>
#include <zepasdk/net.h>

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

int VLIBNetGetInterfaceInfo(struct VLIBNetIfInfo* list, int max, int selection) {
    Fake().interfaceSelection = selection;
    Fake().interfaceMax = max;
    if (Fake().interfaces.empty()) {
        VLIBCErrSet(Fake().errorCode);
        return Fake().interfaceResult;
    }
    int count = 0;
    for (const zepafake::Interface& itf : Fake().interfaces) {
        if (count == max) break;
        struct VLIBNetIfInfo& rec = list[count++];
        memset(&rec, 0, sizeof(rec));
        snprintf(rec.szName, sizeof(rec.szName), "%s", itf.name.c_str());
        snprintf(rec.szIP, sizeof(rec.szIP), "%s", itf.ip.c_str());
        snprintf(rec.szMask, sizeof(rec.szMask), "%s", itf.mask.c_str());
        rec.status = itf.status;
        rec.kind = VLIBNET_SEL_ETHER;
    }
    return count;
}

int ZEPAPPPoECheckStatus(int /*opt*/) { return Fake().pppoeStatus; }

int ZEPAPPPoeNetInfoGet(char* ip, int ipSize, char* mask, int maskSize) {
    ++Fake().pppoeInfoCalls;
    if (Fake().pppoeInfoFails) {
        VLIBCErrSet(Fake().errorCode);
        return -1;
    }
    snprintf(ip, ipSize, "%s", Fake().pppoeIp.c_str());
    snprintf(mask, maskSize, "%s", Fake().pppoeMask.c_str());
    return 0;
}

int ZEPANetDefaultGatewayGet(char* buf, int size) {
    if (Fake().gateway.empty()) {
        VLIBCErrSet(Fake().errorCode);
        return -1;
    }
    snprintf(buf, size, "%s", Fake().gateway.c_str());
    return 0;
}

int ZEPALnxV6IPGet(const char* ifname, struct ZEPAV6IPInfo* list, int max) {
    for (const zepafake::V6Interface& itf : Fake().machine) {
        if (itf.name != ifname) continue;
        int count = 0;
        for (const zepafake::V6Address& a : itf.addresses) {
            if (count == max) break;
            struct ZEPAV6IPInfo& rec = list[count++];
            memset(&rec, 0, sizeof(rec));
            snprintf(rec.szAddr, sizeof(rec.szAddr), "%s", a.address.c_str());
            rec.prefixLen = a.prefixLength;
            rec.addrType = a.addrType;
        }
        return count;
    }
    VLIBCErrSet(ZEPA_ERR_NOT_FOUND);
    return -1;
}

}  // extern "C"
