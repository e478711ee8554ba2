// Network facts read live from the kernel of the caller's network namespace.
#include "zepasdk/net.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <linux/ethtool.h>
#include <linux/sockios.h>
#include <net/if.h>
#include <net/if_arp.h>
#include <net/route.h>
#include <netinet/in.h>
#include <netpacket/packet.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "sdk_util.h"

using zepasdk::CopyIfFits;
using zepasdk::FailWith;
using zepasdk::RootPath;

namespace {

const char DDNS_CONF[] = "/etc/zepa/ddns.conf";
const char SUPPORT_CONF[] = "/etc.defaults/zepainfo.conf";
const char ROUTE_TABLE[] = "/proc/net/route";
const char INET6_TABLE[] = "/proc/net/if_inet6";
const char PPPOE_NAME[] = "pppoe";
// The wireless extensions' name query (linux/wireless.h clashes with net/if.h).
const unsigned long WIRELESS_GET_NAME = 0x8B01;

struct Interface {
    std::string name;
    unsigned int index = 0;
    unsigned int flags = 0;
    int hwType = -1;
    std::string ip;
    std::string mask;
};

// A datagram socket for interface queries, closed on every path.
class QuerySocket {
public:
    QuerySocket() : _fd(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0)) {}
    ~QuerySocket() {
        if (_fd >= 0) close(_fd);
    }
    QuerySocket(const QuerySocket&) = delete;
    QuerySocket& operator=(const QuerySocket&) = delete;
    int fd() const { return _fd; }

private:
    int _fd;
};

std::string Ipv4Text(const struct sockaddr* sa) {
    if (sa == nullptr || sa->sa_family != AF_INET) return std::string();
    char text[INET_ADDRSTRLEN];
    const struct sockaddr_in* in = reinterpret_cast<const struct sockaddr_in*>(sa);
    if (inet_ntop(AF_INET, &in->sin_addr, text, sizeof(text)) == nullptr) return std::string();
    return text;
}

// Every interface with its first IPv4 address, in interface index order.
bool ListInterfaces(std::vector<Interface>& out) {
    struct ifaddrs* list = nullptr;
    if (getifaddrs(&list) != 0) return false;
    std::map<std::string, Interface> byName;
    for (const struct ifaddrs* ifa = list; ifa != nullptr; ifa = ifa->ifa_next) {
        // An address label ("eth0:1") belongs to its interface.
        std::string name = ifa->ifa_name;
        name = name.substr(0, name.find(':'));
        Interface& itf = byName[name];
        itf.name = name;
        itf.flags = ifa->ifa_flags;
        if (ifa->ifa_addr == nullptr) continue;
        if (ifa->ifa_addr->sa_family == AF_PACKET) {
            itf.hwType = reinterpret_cast<const struct sockaddr_ll*>(ifa->ifa_addr)->sll_hatype;
        } else if (ifa->ifa_addr->sa_family == AF_INET && itf.ip.empty()) {
            itf.ip = Ipv4Text(ifa->ifa_addr);
            itf.mask = Ipv4Text(ifa->ifa_netmask);
        }
    }
    freeifaddrs(list);
    for (auto& entry : byName) {
        entry.second.index = if_nametoindex(entry.first.c_str());
        out.push_back(entry.second);
    }
    std::sort(out.begin(), out.end(),
              [](const Interface& a, const Interface& b) { return a.index < b.index; });
    return true;
}

std::string DriverOf(int sock, const std::string& name) {
    struct ethtool_drvinfo info;
    memset(&info, 0, sizeof(info));
    info.cmd = ETHTOOL_GDRVINFO;
    struct ifreq req;
    memset(&req, 0, sizeof(req));
    strncpy(req.ifr_name, name.c_str(), IFNAMSIZ - 1);
    req.ifr_data = reinterpret_cast<char*>(&info);
    if (ioctl(sock, SIOCETHTOOL, &req) != 0) return std::string();
    return std::string(info.driver, strnlen(info.driver, sizeof(info.driver)));
}

bool IsWireless(int sock, const std::string& name) {
    struct ifreq req;
    memset(&req, 0, sizeof(req));
    strncpy(req.ifr_name, name.c_str(), IFNAMSIZ - 1);
    return ioctl(sock, WIRELESS_GET_NAME, &req) == 0;
}

int KindOf(int sock, const Interface& itf) {
    if (itf.flags & IFF_LOOPBACK) return VLIBNET_SEL_LOOPBACK;
    if (itf.hwType == ARPHRD_PPP) return VLIBNET_SEL_PPP;
    if (itf.hwType != ARPHRD_ETHER) return VLIBNET_SEL_OTHER;
    if (IsWireless(sock, itf.name)) return VLIBNET_SEL_WIRELESS;
    std::string driver = DriverOf(sock, itf.name);
    if (driver == "bridge" || driver == "bonding") return VLIBNET_SEL_BRIDGE_BOND;
    return VLIBNET_SEL_ETHER;
}

int StatusOf(const Interface& itf) {
    if (!(itf.flags & IFF_UP)) return VLIBNET_IF_DOWN;
    return itf.ip.empty() ? VLIBNET_IF_UP : VLIBNET_IF_UP_IPV4;
}

void FillRecord(const Interface& itf, int kind, struct VLIBNetIfInfo& rec) {
    memset(&rec, 0, sizeof(rec));
    snprintf(rec.szName, sizeof(rec.szName), "%s", itf.name.c_str());
    snprintf(rec.szIP, sizeof(rec.szIP), "%s", itf.ip.c_str());
    snprintf(rec.szMask, sizeof(rec.szMask), "%s", itf.mask.c_str());
    rec.status = StatusOf(itf);
    rec.kind = kind;
}

// The PPP link that is up with an IPv4 address: 1 found, 0 none, -1 error.
int FindPppLink(Interface& link) {
    std::vector<Interface> all;
    if (!ListInterfaces(all)) return -1;
    for (const Interface& itf : all) {
        if (itf.hwType == ARPHRD_PPP && StatusOf(itf) == VLIBNET_IF_UP_IPV4) {
            link = itf;
            return 1;
        }
    }
    return 0;
}

struct DefaultRoute {
    bool found = false;
    int metric = INT_MAX;
    uint32_t gateway = 0;
};

void ConsiderRoute(const std::string& line, DefaultRoute& best) {
    char iface[64];
    unsigned long dest = 0, gateway = 0, mask = 0;
    unsigned int flags = 0;
    int metric = 0;
    if (sscanf(line.c_str(), "%63s %lx %lx %x %*d %*d %d %lx", iface, &dest, &gateway, &flags, &metric,
               &mask) != 6)
        return;
    if (dest != 0 || mask != 0 || (flags & (RTF_UP | RTF_GATEWAY)) != (RTF_UP | RTF_GATEWAY)) return;
    if (best.found && metric >= best.metric) return;
    best.found = true;
    best.metric = metric;
    best.gateway = static_cast<uint32_t>(gateway);
}

bool ParseV6Line(const std::string& line, std::string& name, struct ZEPAV6IPInfo& rec) {
    char hex[33], ifname[64];
    unsigned int index = 0, prefix = 0, scope = 0, flags = 0;
    if (sscanf(line.c_str(), "%32s %x %x %x %x %63s", hex, &index, &prefix, &scope, &flags, ifname) != 6)
        return false;
    if (strlen(hex) != 32) return false;
    unsigned char raw[16];
    for (int i = 0; i < 16; ++i) {
        unsigned int byte = 0;
        if (sscanf(hex + 2 * i, "%2x", &byte) != 1) return false;
        raw[i] = static_cast<unsigned char>(byte);
    }
    memset(&rec, 0, sizeof(rec));
    if (inet_ntop(AF_INET6, raw, rec.szAddr, sizeof(rec.szAddr)) == nullptr) return false;
    rec.prefixLen = prefix;
    rec.addrType = scope;
    name = ifname;
    return true;
}

}  // namespace

extern "C" {

int VLIBNetGetInterfaceInfo(struct VLIBNetIfInfo* list, int max, int selection) {
    if (list == nullptr || max < 1) return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    std::vector<Interface> all;
    if (!ListInterfaces(all)) return FailWith(ZEPA_ERR_IO);
    QuerySocket sock;
    int count = 0;
    for (const Interface& itf : all) {
        if (count == max) break;
        int kind = KindOf(sock.fd(), itf);
        if (selection & kind) FillRecord(itf, kind, list[count++]);
    }
    VLIBCErrSet(count == 0 ? ZEPA_ERR_NOT_FOUND : ZEPA_ERR_NONE);
    return count;
}

int ZEPAPPPoECheckStatus(int /*opt*/) {
    Interface link;
    int found = FindPppLink(link);
    if (found < 0) return FailWith(ZEPA_ERR_IO);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return found;
}

int ZEPAPPPoeNetInfoGet(char* ip, int ipSize, char* mask, int maskSize) {
    if (ip == nullptr || mask == nullptr || ipSize < 1 || maskSize < 1)
        return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    ip[0] = '\0';
    mask[0] = '\0';
    Interface link;
    int found = FindPppLink(link);
    if (found < 0) return FailWith(ZEPA_ERR_IO);
    if (found == 0) return FailWith(ZEPA_ERR_NOT_FOUND);
    if (!CopyIfFits(link.ip, ip, ipSize) || !CopyIfFits(link.mask, mask, maskSize)) {
        ip[0] = '\0';
        mask[0] = '\0';
        return FailWith(ZEPA_ERR_BUFFER_TOO_SMALL);
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

int ZEPANetDefaultGatewayGet(char* buf, int size) {
    if (buf == nullptr || size < 1) return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    buf[0] = '\0';
    std::ifstream table(ROUTE_TABLE);
    if (!table) return FailWith(ZEPA_ERR_FILE_NOT_FOUND);
    DefaultRoute best;
    std::string line;
    std::getline(table, line);  // the header
    while (std::getline(table, line)) ConsiderRoute(line, best);
    if (!best.found) return FailWith(ZEPA_ERR_NOT_FOUND);
    struct in_addr addr;
    addr.s_addr = best.gateway;  // the table prints the address in network order
    char text[INET_ADDRSTRLEN];
    inet_ntop(AF_INET, &addr, text, sizeof(text));
    if (!CopyIfFits(text, buf, size)) return FailWith(ZEPA_ERR_BUFFER_TOO_SMALL);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

int ZEPADDNSConfigGet(const char* provider, struct ZEPADDNSConfig* conf) {
    if (provider == nullptr || provider[0] == '\0' || conf == nullptr)
        return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    memset(conf, 0, sizeof(*conf));
    std::string file = RootPath(DDNS_CONF);
    int n = VLIBCFileGetSectionValue(file.c_str(), provider, "hostname", conf->szHostname,
                                     sizeof(conf->szHostname));
    if (n < 0) return -1;  // the key/value family has set the error
    if (n == 0) return FailWith(ZEPA_ERR_KEY_NOT_FOUND);
    VLIBCFileGetSectionValue(file.c_str(), provider, "username", conf->szUsername, sizeof(conf->szUsername));
    snprintf(conf->szProvider, sizeof(conf->szProvider), "%s", provider);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

int ZEPALnxV6IPGet(const char* ifname, struct ZEPAV6IPInfo* list, int max) {
    if (ifname == nullptr || list == nullptr || max < 1) return FailWith(ZEPA_ERR_BAD_PARAMETERS);
    std::string name = ifname;
    Interface link;
    // "pppoe" names the PPPoE link whatever the kernel calls its device.
    if (if_nametoindex(ifname) == 0 && name == PPPOE_NAME && FindPppLink(link) == 1) name = link.name;
    if (if_nametoindex(name.c_str()) == 0) return FailWith(ZEPA_ERR_NOT_FOUND);
    int count = 0;
    std::ifstream table(INET6_TABLE);  // absent when IPv6 is off: no addresses
    std::string line;
    while (count < max && std::getline(table, line)) {
        std::string lineName;
        struct ZEPAV6IPInfo rec;
        if (ParseV6Line(line, lineName, rec) && lineName == name) list[count++] = rec;
    }
    VLIBCErrSet(ZEPA_ERR_NONE);
    return count;
}

int BlVLIBIsValidIpMask(const char* ip, const char* mask) {
    struct in_addr a, m;
    if (ip == nullptr || mask == nullptr) return 0;
    if (inet_pton(AF_INET, ip, &a) != 1 || inet_pton(AF_INET, mask, &m) != 1) return 0;
    uint32_t addr = ntohl(a.s_addr);
    uint32_t bits = ntohl(m.s_addr);
    uint32_t hostBits = ~bits;
    if (bits == 0 || (hostBits & (hostBits + 1)) != 0) return 0;  // ones must be contiguous
    if (addr == 0 || addr >= 0xE0000000u) return 0;
    if (hostBits >= 3) {  // /30 and wider have network and broadcast addresses
        uint32_t host = addr & hostBits;
        if (host == 0 || host == hostBits) return 0;
    }
    return 1;
}

int VLIBCSupportGet(const char* key) {
    if (key == nullptr) return 0;
    std::string file = RootPath(SUPPORT_CONF);
    return VLIBCFileCheckKeyValue(file.c_str(), key, "yes", 0) == 1 ? 1 : 0;
}

}  // extern "C"
