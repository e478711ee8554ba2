// Machine facts dictated by a test: the definitions in fake_platform.cpp take
// the place of the SDK's network functions for calls from libzeparelayd.
#ifndef ZEPARELAYD_TESTS_CONFIG_MACHINE_FAKE_PLATFORM_H
#define ZEPARELAYD_TESTS_CONFIG_MACHINE_FAKE_PLATFORM_H

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
    // ZEPACloudServiceGetMacAddress
    std::string mac = "02:00:00:00:00:01";
    bool macFails = false;
    int macCalls = 0;
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
};

Platform& Fake();

// The machine knows name (ZEPALnxV6IPGet answers 0 or more for it).
void AddMachineInterface(const std::string& name, std::vector<V6Address> addresses = {});

}  // namespace zepafake

#endif
