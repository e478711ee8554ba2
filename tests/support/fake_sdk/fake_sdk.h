// The fake SDK: machine facts a test dictates because it cannot set them for
// real (the MAC address, interfaces, addresses, routes, a broken firewall
// layer). A test executable that links the library zepatest_fake_sdk gets
// these definitions in place of the SDK's; each answers like the real SDK
// stand-in (it calls it) until a test dictates its answer through Fake().
#ifndef ZEPARELAYD_TESTS_SUPPORT_FAKE_SDK_FAKE_SDK_H
#define ZEPARELAYD_TESTS_SUPPORT_FAKE_SDK_FAKE_SDK_H

#include <zepasdk/fw.h>

#include <optional>
#include <string>
#include <vector>

namespace zepafake {

struct Interface {
    std::string name;
    std::string ip;
    std::string mask;
    int status;
};

struct V6Address {
    std::string address;
    unsigned int prefixLength;
    unsigned int addrType;
};

struct V6Interface {
    std::string name;  // an interface the fake machine has
    std::vector<V6Address> addresses;
};

struct Platform {
    // ZEPACloudServiceGetMacAddress: the address, or a failure, once dictated
    // (counted either way).
    std::optional<std::string> mac;
    bool macFails = false;
    int macCalls = 0;
    // The network family (VLIBNetGetInterfaceInfo, ZEPAPPPoECheckStatus,
    // ZEPAPPPoeNetInfoGet, ZEPANetDefaultGatewayGet, ZEPALnxV6IPGet) answers
    // from the fields below when true, from the machine when false.
    bool network = false;
    // VLIBNetGetInterfaceInfo: records, or a failure (result -1 / 0)
    std::vector<Interface> interfaces;
    int interfaceResult = 0;  // returned when interfaces is empty (0 or -1)
    int interfaceSelection = -1;
    int interfaceMax = -1;
    // ZEPAPPPoECheckStatus / ZEPAPPPoeNetInfoGet
    int pppoeStatus = 0;
    int pppoeInfoCalls = 0;
    bool pppoeInfoFails = false;
    std::string pppoeIp;
    std::string pppoeMask;
    // ZEPANetDefaultGatewayGet
    std::string gateway;  // empty: fails
    // ZEPALnxV6IPGet: interfaces that exist, with their addresses
    std::vector<V6Interface> machine;
    int errorCode = 0x0900;
    // ZEPAFWServiceFind: when set, answers in place of the firewall layer.
    PZEPAFwService (*fwServiceFind)(PZEPAFwService pList, const char* szName) = nullptr;
};

Platform& Fake();

// Every function back to the real stand-in's answer.
void Reset();

// The machine knows name (ZEPALnxV6IPGet answers 0 or more for it).
void AddMachineInterface(const std::string& name, std::vector<V6Address> addresses = {});

}  // namespace zepafake

#endif
