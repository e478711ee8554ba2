#include "support/fake_sdk/fake_sdk.h"

#include <dlfcn.h>
#include <zepasdk/identity.h>
#include <zepasdk/net.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace zepafake {

Platform& Fake() {
    static Platform platform;
    return platform;
}

void Reset() { Fake() = Platform(); }

void AddMachineInterface(const std::string& name, std::vector<V6Address> addresses) {
    Fake().machine.push_back(V6Interface{name, std::move(addresses)});
}

}  // namespace zepafake

using zepafake::Fake;

namespace {

// The SDK stand-in's own definition of name: the next one after this
// executable's in the lookup order.
template <typename Function>
Function Real(Function, const char* name) {
    void* symbol = dlsym(RTLD_NEXT, name);
    if (symbol == nullptr) {
        fprintf(stderr, "fake SDK: the SDK stand-in has no %s\n", name);
        abort();
    }
    return reinterpret_cast<Function>(symbol);
}

#define ZEPA_REAL(name) Real(&name, #name)

}  // namespace

extern "C" {

int ZEPACloudServiceGetMacAddress(char* buf, int size) {
    ++Fake().macCalls;
    if (!Fake().mac && !Fake().macFails) return ZEPA_REAL(ZEPACloudServiceGetMacAddress)(buf, size);
    if (Fake().macFails) {
        VLIBCErrSet(Fake().errorCode);
        return -1;
    }
    snprintf(buf, size, "%s", Fake().mac->c_str());
    return 0;
}

int VLIBNetGetInterfaceInfo(struct VLIBNetIfInfo* list, int max, int selection) {
    if (!Fake().network) return ZEPA_REAL(VLIBNetGetInterfaceInfo)(list, max, selection);
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

int ZEPAPPPoECheckStatus(int opt) {
    if (!Fake().network) return ZEPA_REAL(ZEPAPPPoECheckStatus)(opt);
    return Fake().pppoeStatus;
}

int ZEPAPPPoeNetInfoGet(char* ip, int ipSize, char* mask, int maskSize) {
    if (!Fake().network) return ZEPA_REAL(ZEPAPPPoeNetInfoGet)(ip, ipSize, mask, maskSize);
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
    if (!Fake().network) return ZEPA_REAL(ZEPANetDefaultGatewayGet)(buf, size);
    if (Fake().gateway.empty()) {
        VLIBCErrSet(Fake().errorCode);
        return -1;
    }
    snprintf(buf, size, "%s", Fake().gateway.c_str());
    return 0;
}

int ZEPALnxV6IPGet(const char* ifname, struct ZEPAV6IPInfo* list, int max) {
    if (!Fake().network) return ZEPA_REAL(ZEPALnxV6IPGet)(ifname, list, max);
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

PZEPAFwService ZEPAFWServiceFind(PZEPAFwService pList, const char* szName) {
    if (Fake().fwServiceFind == nullptr) return ZEPA_REAL(ZEPAFWServiceFind)(pList, szName);
    return Fake().fwServiceFind(pList, szName);
}

}  // extern "C"
