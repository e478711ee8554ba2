// The network state reported to the relay: interfaces that are up, the
// default gateway, the DDNS name and the IPv6 addresses.
#define ZEPA_LOG_SOURCE "config"

#include <arpa/inet.h>
#include <strings.h>
#include <zepasdk/kv.h>
#include <zepasdk/net.h>

#include <cstdint>
#include <cstring>

#include <zeparelayd/config.h>

#include "common/log.h"
#include "common/paths.h"
#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

namespace {

const int MAX_INTERFACES = 32;
const int MAX_V6_ADDRESSES = 32;
// The platform's selection of wired LAN interfaces.
const int INTERFACE_SELECTION = 18;
const int STATUS_REPORTED = 2;
const int PPPOE_ADDR_SIZE = 46;
const int GATEWAY_SIZE = 20;
const int DDNS_SELECT_SIZE = 128;
const int FQDN_SIZE = 1024;

uint32_t Word(const unsigned char* bytes, int i) {
    return (uint32_t(bytes[4 * i]) << 24) | (uint32_t(bytes[4 * i + 1]) << 16) |
           (uint32_t(bytes[4 * i + 2]) << 8) | uint32_t(bytes[4 * i + 3]);
}

const char* ScopeOf(const char* address) {
    unsigned char bytes[16];
    memset(bytes, 0, sizeof(bytes));
    inet_pton(AF_INET6, address, bytes);  // a bad text reads as ::, deliberately unchecked
    uint32_t w0 = Word(bytes, 0), w1 = Word(bytes, 1), w2 = Word(bytes, 2), w3 = Word(bytes, 3);
    if ((w0 & 0xFFC00000u) == 0xFE800000u) return "link";
    if ((w0 & 0xFFC00000u) == 0xFEC00000u) return "site";
    if (w0 != 0 || w1 != 0) return "global";
    if (w2 == 0 && w3 > 1) return "compat";
    if (w2 == 0 && w3 == 1) return "loopback";
    if (w2 == 0x0000FFFFu) return "mapped";
    return "global";
}

// The IPv6 addresses of ifname as entries; the platform's result in count.
Json::Value V6Entries(const std::string& ifname, int& count) {
    struct ZEPAV6IPInfo list[MAX_V6_ADDRESSES];
    memset(list, 0, sizeof(list));
    count = ZEPALnxV6IPGet(ifname.c_str(), list, MAX_V6_ADDRESSES);
    Json::Value entries(Json::arrayValue);
    for (int i = 0; i < count; ++i) {
        Json::Value entry(Json::objectValue);
        entry["address"] = list[i].szAddr;
        entry["prefix_length"] = Json::UInt(list[i].prefixLen);
        entry["scope"] = ScopeOf(list[i].szAddr);
        entry["addr_type"] = Json::UInt(list[i].addrType);
        entries.append(entry);
    }
    return entries;
}

void AppendIfValid(std::list<InterfaceConf>& interfaces, const InterfaceConf& itf) {
    if (itf.IsValid()) interfaces.push_back(itf);
}

}  // namespace

// ---- InterfaceConf ----------------------------------------------------------

InterfaceConf::InterfaceConf() = default;

InterfaceConf::InterfaceConf(const std::string& name, const std::string& address, const std::string& mask)
    : name(name), address(address), mask(mask) {}

InterfaceConf::InterfaceConf(const ::VLIBNetIfInfo& info)
    : name(info.szName), address(info.szIP), mask(info.szMask) {}

InterfaceConf::~InterfaceConf() = default;

bool InterfaceConf::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return true;
    JsonTake::TakeAll(value, {{"ip", address}, {"mask", mask}, {"name", name}});
    return true;
}

bool InterfaceConf::IsValid() const {
    if (name.empty() || address.empty() || mask.empty()) return false;
    if (!BlVLIBIsValidIpMask(address.c_str(), mask.c_str())) return false;
    // An interface the machine does not have fails the IPv6 query.
    int count = 0;
    V6Entries(name, count);
    return count >= 0;
}

bool InterfaceConf::Write(Json::Value& out, bool /*full*/) const {
    out["name"] = name;
    out["ip"] = address;
    out["mask"] = mask;
    int count = 0;
    Json::Value entries = V6Entries(name, count);
    if (count > 0) out["ipv6"] = entries;
    return true;
}

bool InterfaceConf::operator==(const InterfaceConf& other) const {
    return name == other.name && address == other.address && mask == other.mask;
}

bool InterfaceConf::operator!=(const InterfaceConf& other) const { return !(*this == other); }

// ---- NetworkConf ------------------------------------------------------------

NetworkConf::NetworkConf(bool read) {
    if (read) ReadConf();
}

NetworkConf::~NetworkConf() = default;

bool NetworkConf::ReadConf() {
    ReadInterfaces();
    ReadPppoe();
    ReadGateway();
    ReadDdns();
    return true;
}

void NetworkConf::ReadInterfaces() {
    struct VLIBNetIfInfo records[MAX_INTERFACES];
    memset(records, 0, sizeof(records));
    int count = VLIBNetGetInterfaceInfo(records, MAX_INTERFACES, INTERFACE_SELECTION);
    if (count <= 0) {
        ZLOG(ZEPA_LOG_DEBUG, "VLIBNetGetInterfaceInfo failed: [0x%04X]", VLIBCErrGet());
        return;
    }
    for (int i = 0; i < count && i < MAX_INTERFACES; ++i) {
        if (records[i].status == STATUS_REPORTED) AppendIfValid(interfaces, InterfaceConf(records[i]));
    }
}

void NetworkConf::ReadPppoe() {
    if (ZEPAPPPoECheckStatus(0) != 1) return;
    char ip[PPPOE_ADDR_SIZE];
    char netmask[PPPOE_ADDR_SIZE];
    memset(ip, 0, sizeof(ip));
    memset(netmask, 0, sizeof(netmask));
    if (ZEPAPPPoeNetInfoGet(ip, sizeof(ip), netmask, sizeof(netmask)) < 0) {
        ZLOG(ZEPA_LOG_DEBUG, "ZEPAPPPoeNetInfoGet failed: [0x%04X]", VLIBCErrGet());
        return;
    }
    AppendIfValid(interfaces, InterfaceConf("pppoe", ip, netmask));
}

void NetworkConf::ReadGateway() {
    char buf[GATEWAY_SIZE];
    memset(buf, 0, sizeof(buf));
    if (ZEPANetDefaultGatewayGet(buf, sizeof(buf)) < 0) {
        ZLOG(ZEPA_LOG_DEBUG, "ZEPANetDefaultGatewayGet failed: [0x%04X]", VLIBCErrGet());
        return;
    }
    gateway = buf;
}

void NetworkConf::ReadDdns() {
    if (!VLIBCSupportGet("supportddns")) return;
    const std::string info = Paths::Resolve(Paths::ZEPAINFO_CONF);
    char update[16];
    memset(update, 0, sizeof(update));
    // A missing key counts as "no".
    if (VLIBCFileGetKeyValue(info.c_str(), "ddns_update", update, sizeof(update)) < 1 ||
        strcasecmp(update, "yes") != 0)
        return;
    char provider[DDNS_SELECT_SIZE];
    memset(provider, 0, sizeof(provider));
    if (VLIBCFileGetKeyValue(info.c_str(), "ddns_select", provider, sizeof(provider)) < 1) {
        ZLOG(ZEPA_LOG_ERR, "get ddns provider failed");
        return;
    }
    struct ZEPADDNSConfig conf;
    memset(&conf, 0, sizeof(conf));
    if (ZEPADDNSConfigGet(provider, &conf) < 0) {
        ZLOG(ZEPA_LOG_ERR, "ZEPADDNSConfigGet failed: [0x%04X]", VLIBCErrGet());
        return;
    }
    ddns = conf.szHostname;
}

bool NetworkConf::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return true;
    JsonTake::TakeAll(value, {{"ddns", ddns}, {"gateway", gateway}, {"mode", mode}});
    if (!value.isMember("interface") || !value["interface"].isArray()) return true;
    interfaces.clear();
    for (const Json::Value& element : value["interface"]) {
        InterfaceConf itf;
        itf.Overwrite(element);
        AppendIfValid(interfaces, itf);
    }
    return true;
}

bool NetworkConf::IsValid() const {
    for (const InterfaceConf& itf : interfaces)
        if (!itf.IsValid()) return false;
    return true;
}

bool NetworkConf::Write(Json::Value& out, bool full) const {
    Json::Value list(Json::arrayValue);
    for (const InterfaceConf& itf : interfaces) {
        Json::Value entry;
        itf.Write(entry, full);
        list.append(entry);
    }
    out["interface"] = list;
    out["gateway"] = gateway;
    out["ddns"] = ddns;
    out["mode"] = mode;

    // The system key is "external_host_ip"; the relay knows it as "fqdn".
    char fqdn[FQDN_SIZE];
    memset(fqdn, 0, sizeof(fqdn));
    const std::string info = Paths::Resolve(Paths::ZEPAINFO_CONF);
    if (VLIBCFileGetKeyValue(info.c_str(), "external_host_ip", fqdn, sizeof(fqdn)) < 0) fqdn[0] = '\0';
    out["fqdn"] = fqdn;

    int count = 0;
    out["ipv6_tunnel"] = V6Entries("tun", count);
    return true;
}

bool NetworkConf::operator==(const NetworkConf& other) const {
    // mode is set by the caller and deliberately not compared.
    return ddns == other.ddns && gateway == other.gateway && interfaces == other.interfaces;
}

bool NetworkConf::operator!=(const NetworkConf& other) const { return !(*this == other); }

}  // namespace Relay
}  // namespace ZEPA
