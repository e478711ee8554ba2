#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/ethtool.h>
#include <linux/sockios.h>
#include <net/if.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>
#include <zepasdk/net.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "netns_fixture.h"
#include "support/test_support.h"

namespace {

std::string Output(const std::string& cmd) {
    std::string out;
    FILE* p = popen((cmd + " 2>/dev/null").c_str(), "r");
    if (p == nullptr) return out;
    char buf[512];
    while (fgets(buf, sizeof(buf), p) != nullptr) out += buf;
    pclose(p);
    return out;
}

std::vector<VLIBNetIfInfo> Interfaces(int selection) {
    std::vector<VLIBNetIfInfo> list(32);
    int n = VLIBNetGetInterfaceInfo(list.data(), 32, selection);
    list.resize(n > 0 ? n : 0);
    return list;
}

// A copy of the record of name, or null.
std::shared_ptr<VLIBNetIfInfo> Find(const std::vector<VLIBNetIfInfo>& list, const char* name) {
    for (const VLIBNetIfInfo& rec : list)
        if (strcmp(rec.szName, name) == 0) return std::make_shared<VLIBNetIfInfo>(rec);
    return nullptr;
}

std::vector<ZEPAV6IPInfo> V6(const char* name, int* rc = nullptr) {
    std::vector<ZEPAV6IPInfo> list(32);
    int n = ZEPALnxV6IPGet(name, list.data(), 32);
    if (rc != nullptr) *rc = n;
    list.resize(n > 0 ? n : 0);
    return list;
}

class NetLiveTest : public zepatest::RootTest {};
class DdnsConfigTest : public zepatest::RootTest {};
class SupportGetTest : public zepatest::RootTest {};

}  // namespace

// ---- the live machine ------------------------------------------------------------

TEST_F(NetLiveTest, LoopbackIsListedWhenSelected) {
    std::vector<VLIBNetIfInfo> all = Interfaces(0x3f);
    std::shared_ptr<VLIBNetIfInfo> lo = Find(all, "lo");
    ASSERT_NE(nullptr, lo);
    EXPECT_EQ(VLIBNET_SEL_LOOPBACK, lo->kind);
    if (lo->status == VLIBNET_IF_UP_IPV4) {
        EXPECT_STREQ("127.0.0.1", lo->szIP);
        EXPECT_STREQ("255.0.0.0", lo->szMask);
    } else {
        EXPECT_STREQ("", lo->szIP);
    }
    EXPECT_EQ(nullptr, Find(Interfaces(VLIBNET_SEL_WIRED), "lo"));
}

TEST_F(NetLiveTest, RecordsFollowInterfaceIndex) {
    std::vector<VLIBNetIfInfo> all = Interfaces(0x3f);
    ASSERT_FALSE(all.empty());
    for (size_t i = 1; i < all.size(); ++i)
        EXPECT_LT(if_nametoindex(all[i - 1].szName), if_nametoindex(all[i].szName));
}

TEST_F(NetLiveTest, WiredSelectionIsEighteen) {
    EXPECT_EQ(18, VLIBNET_SEL_WIRED);
    for (const VLIBNetIfInfo& rec : Interfaces(VLIBNET_SEL_WIRED))
        EXPECT_TRUE(rec.kind == VLIBNET_SEL_ETHER || rec.kind == VLIBNET_SEL_BRIDGE_BOND) << rec.szName;
}

TEST_F(NetLiveTest, BadArgumentsAndEmptySelection) {
    VLIBNetIfInfo rec;
    EXPECT_EQ(-1, VLIBNetGetInterfaceInfo(nullptr, 32, 18));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    EXPECT_EQ(-1, VLIBNetGetInterfaceInfo(&rec, 0, 18));
    EXPECT_EQ(0, VLIBNetGetInterfaceInfo(&rec, 1, 0x40));
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
}

TEST_F(NetLiveTest, MaxLimitsTheRecords) {
    if (Interfaces(0x3f).size() < 2) GTEST_SKIP() << "a single interface here";
    VLIBNetIfInfo rec[1];
    EXPECT_EQ(1, VLIBNetGetInterfaceInfo(rec, 1, 0x3f));
}

TEST_F(NetLiveTest, DefaultGatewayAgreesWithIpTool) {
    if (!Shell("ip -V")) GTEST_SKIP() << "the ip tool is missing";
    std::string route = Output("ip -4 route show default");
    char gw[20] = "x";
    int rc = ZEPANetDefaultGatewayGet(gw, sizeof(gw));
    std::string::size_type via = route.find(" via ");
    if (via == std::string::npos) {
        EXPECT_EQ(-1, rc);
        EXPECT_STREQ("", gw);
        return;
    }
    std::string expected = route.substr(via + 5, route.find(' ', via + 5) - via - 5);
    EXPECT_EQ(0, rc);
    EXPECT_EQ(expected, gw);
}

TEST_F(NetLiveTest, GatewayBufferTooSmall) {
    if (Output("ip -4 route show default").find(" via ") == std::string::npos)
        GTEST_SKIP() << "no default route";
    char gw[4];
    EXPECT_EQ(-1, ZEPANetDefaultGatewayGet(gw, sizeof(gw)));
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_EQ(-1, ZEPANetDefaultGatewayGet(nullptr, 20));
}

TEST_F(NetLiveTest, LoopbackIpv6AndMissingInterface) {
    int rc = -2;
    std::vector<ZEPAV6IPInfo> lo = V6("lo", &rc);
    EXPECT_GE(rc, 0);
    if (rc > 0) {
        EXPECT_STREQ("::1", lo[0].szAddr);
        EXPECT_EQ(128u, lo[0].prefixLen);
        EXPECT_EQ(0x10u, lo[0].addrType);
    }
    V6("nosuch9", &rc);
    EXPECT_EQ(-1, rc);
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
    ZEPAV6IPInfo one;
    EXPECT_EQ(-1, ZEPALnxV6IPGet(nullptr, &one, 1));
    EXPECT_EQ(-1, ZEPALnxV6IPGet("lo", &one, 0));
}

TEST_F(NetLiveTest, NoPppoeLinkHere) {
    if (!Shell("ip -V")) GTEST_SKIP() << "the ip tool is missing";
    if (Output("ip -o link show type ppp").find("ppp") != std::string::npos)
        GTEST_SKIP() << "a PPP link exists";
    EXPECT_EQ(0, ZEPAPPPoECheckStatus(0));
    char ip[46] = "x", mask[46] = "y";
    EXPECT_EQ(-1, ZEPAPPPoeNetInfoGet(ip, sizeof(ip), mask, sizeof(mask)));
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
    EXPECT_STREQ("", ip);
    EXPECT_STREQ("", mask);
    EXPECT_EQ(-1, ZEPAPPPoeNetInfoGet(nullptr, 46, mask, 46));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    int rc = 0;
    V6("pppoe", &rc);
    EXPECT_EQ(-1, rc);
}

// ---- a private namespace dictates the facts ---------------------------------------------

TEST_F(PrivateNetTest, OnlyLoopbackMeansNoWiredInterface) {
    VLIBNetIfInfo rec[4];
    EXPECT_EQ(0, VLIBNetGetInterfaceInfo(rec, 4, VLIBNET_SEL_WIRED));
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
    char gw[20];
    EXPECT_EQ(-1, ZEPANetDefaultGatewayGet(gw, sizeof(gw)));
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
}

TEST_F(PrivateNetTest, StatusWordsOfEthernetInterfaces) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    std::vector<VLIBNetIfInfo> wired = Interfaces(VLIBNET_SEL_WIRED);
    ASSERT_EQ(2u, wired.size());
    std::shared_ptr<VLIBNetIfInfo> up = Find(wired, "zn0");
    std::shared_ptr<VLIBNetIfInfo> down = Find(wired, "zn1");
    ASSERT_NE(nullptr, up);
    ASSERT_NE(nullptr, down);
    EXPECT_EQ(VLIBNET_IF_UP_IPV4, up->status);
    EXPECT_STREQ("10.9.8.7", up->szIP);
    EXPECT_STREQ("255.255.255.0", up->szMask);
    EXPECT_EQ(VLIBNET_SEL_ETHER, up->kind);
    EXPECT_EQ(VLIBNET_IF_DOWN, down->status);
    EXPECT_STREQ("", down->szIP);
    ASSERT_TRUE(Shell("ip link set zn1 up"));
    EXPECT_EQ(VLIBNET_IF_UP, Find(Interfaces(VLIBNET_SEL_WIRED), "zn1")->status);
}

TEST_F(PrivateNetTest, FirstIpv4AddressIsReported) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    ASSERT_TRUE(Shell("ip addr add 172.16.0.9/12 dev zn0"));
    std::shared_ptr<VLIBNetIfInfo> rec = Find(Interfaces(VLIBNET_SEL_WIRED), "zn0");
    ASSERT_NE(nullptr, rec);
    EXPECT_STREQ("10.9.8.7", rec->szIP);
}

TEST_F(PrivateNetTest, LabelledAddressesBelongToTheirInterface) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    ASSERT_TRUE(Shell("ip addr add 10.1.1.1/24 dev zn0 label zn0:1"));
    std::vector<VLIBNetIfInfo> all = Interfaces(0x3f);
    EXPECT_EQ(nullptr, Find(all, "zn0:1"));
    ASSERT_NE(nullptr, Find(all, "zn0"));
    EXPECT_STREQ("10.9.8.7", Find(all, "zn0")->szIP);
    EXPECT_EQ(3u, all.size());
}

// Whether this machine carries the ethtool request that tells bridges from
// ports: qemu-user answers it with ENOSYS.
bool EthtoolCarried() {
    int sock = socket(AF_INET, SOCK_DGRAM, 0);
    struct ethtool_drvinfo info;
    memset(&info, 0, sizeof(info));
    info.cmd = ETHTOOL_GDRVINFO;
    struct ifreq req;
    memset(&req, 0, sizeof(req));
    strncpy(req.ifr_name, "lo", IFNAMSIZ - 1);
    req.ifr_data = reinterpret_cast<char*>(&info);
    const bool refused = ioctl(sock, SIOCETHTOOL, &req) != 0 && errno == ENOSYS;
    close(sock);
    return !refused;
}

TEST_F(PrivateNetTest, BridgesAreWiredButNotPorts) {
    if (!EthtoolCarried())
        GTEST_SKIP() << "the ethtool request is not carried here (ENOSYS, as under qemu-user)";
    if (!Shell("ip link add zbr0 type bridge")) GTEST_SKIP() << "cannot create a bridge";
    std::vector<VLIBNetIfInfo> bridges = Interfaces(VLIBNET_SEL_BRIDGE_BOND);
    ASSERT_NE(nullptr, Find(bridges, "zbr0"));
    EXPECT_EQ(nullptr, Find(Interfaces(VLIBNET_SEL_ETHER), "zbr0"));
    EXPECT_NE(nullptr, Find(Interfaces(VLIBNET_SEL_WIRED), "zbr0"));
}

TEST_F(PrivateNetTest, TunnelsAreOther) {
    if (!Shell("ip tuntap add tun mode tun")) GTEST_SKIP() << "cannot create a tun device";
    EXPECT_EQ(nullptr, Find(Interfaces(VLIBNET_SEL_WIRED), "tun"));
    std::shared_ptr<VLIBNetIfInfo> tun = Find(Interfaces(VLIBNET_SEL_OTHER), "tun");
    ASSERT_NE(nullptr, tun);
    EXPECT_EQ(VLIBNET_SEL_OTHER, tun->kind);
}

TEST_F(PrivateNetTest, DefaultGatewayOfTheRoutingTable) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    ASSERT_TRUE(Shell("ip route add default via 10.9.8.1"));
    char gw[20];
    EXPECT_EQ(0, ZEPANetDefaultGatewayGet(gw, sizeof(gw)));
    EXPECT_STREQ("10.9.8.1", gw);
    ASSERT_TRUE(Shell("ip route replace default via 10.9.8.254"));
    EXPECT_EQ(0, ZEPANetDefaultGatewayGet(gw, sizeof(gw)));
    EXPECT_STREQ("10.9.8.254", gw);
}

TEST_F(PrivateNetTest, LowestMetricWins) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    ASSERT_TRUE(Shell("ip route add default via 10.9.8.20 metric 20"));
    ASSERT_TRUE(Shell("ip route add default via 10.9.8.10 metric 10"));
    char gw[20];
    EXPECT_EQ(0, ZEPANetDefaultGatewayGet(gw, sizeof(gw)));
    EXPECT_STREQ("10.9.8.10", gw);
}

TEST_F(PrivateNetTest, Ipv6AddressesOfAnInterface) {
    if (!Cable()) GTEST_SKIP() << "cannot create veth interfaces";
    if (!Shell("ip -6 addr add 2001:db8::7/64 dev zn0 nodad && ip -6 addr add fec0::7/48 dev zn0 nodad"))
        GTEST_SKIP() << "IPv6 is off here";
    std::vector<ZEPAV6IPInfo> list = V6("zn0");
    bool global = false, site = false;
    for (const ZEPAV6IPInfo& a : list) {
        if (strcmp(a.szAddr, "2001:db8::7") == 0) {
            global = true;
            EXPECT_EQ(64u, a.prefixLen);
            EXPECT_EQ(0x00u, a.addrType);
        }
        if (strcmp(a.szAddr, "fec0::7") == 0) {
            site = true;
            EXPECT_EQ(48u, a.prefixLen);
            EXPECT_EQ(0x40u, a.addrType);
        }
    }
    EXPECT_TRUE(global);
    EXPECT_TRUE(site);
    int rc = -2;
    V6("zn1", &rc);
    EXPECT_GE(rc, 0);
    ZEPAV6IPInfo one[1];
    EXPECT_EQ(1, ZEPALnxV6IPGet("zn0", one, 1));
}

TEST_F(PrivateNetTest, TunnelIpv6Address) {
    if (!Shell("ip tuntap add tun mode tun")) GTEST_SKIP() << "cannot create a tun device";
    if (!Shell("ip -6 addr add fe80::5/64 dev tun")) GTEST_SKIP() << "IPv6 is off here";
    std::vector<ZEPAV6IPInfo> list = V6("tun");
    ASSERT_EQ(1u, list.size());
    EXPECT_STREQ("fe80::5", list[0].szAddr);
    EXPECT_EQ(64u, list[0].prefixLen);
    EXPECT_EQ(0x20u, list[0].addrType);
}

// ---- address checks ----------------------------------------------------------------------

TEST(IpMask, ValidPairs) {
    EXPECT_EQ(1, BlVLIBIsValidIpMask("192.0.2.10", "255.255.255.0"));
    EXPECT_EQ(1, BlVLIBIsValidIpMask("10.1.2.3", "255.0.0.0"));
    EXPECT_EQ(1, BlVLIBIsValidIpMask("203.0.113.5", "255.255.255.255"));
    EXPECT_EQ(1, BlVLIBIsValidIpMask("192.0.2.0", "255.255.255.254"));
    EXPECT_EQ(1, BlVLIBIsValidIpMask("192.0.2.1", "255.255.255.252"));
    EXPECT_EQ(1, BlVLIBIsValidIpMask("127.0.0.1", "255.0.0.0"));
}

TEST(IpMask, InvalidPairs) {
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.10", "255.0.255.0"));     // holes in the mask
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.10", "0.0.0.0"));         // no network
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.0", "255.255.255.0"));    // network address
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.255", "255.255.255.0"));  // broadcast
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.0", "255.255.255.252"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("0.0.0.0", "255.255.255.255"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("224.0.0.1", "255.255.255.0"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("240.0.0.1", "255.255.255.0"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.300", "255.255.255.0"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2", "255.255.255.0"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("2001:db8::1", "255.255.255.0"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.10", "24"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("", ""));
    EXPECT_EQ(0, BlVLIBIsValidIpMask(nullptr, "255.255.255.0"));
    EXPECT_EQ(0, BlVLIBIsValidIpMask("192.0.2.10", nullptr));
}

// ---- files under the root ------------------------------------------------------------------

TEST_F(DdnsConfigTest, ReadsProviderSection) {
    root.write(
        "/etc/zepa/ddns.conf",
        "[dynone]\nhostname=\"a.dyn.example\"\nusername=\"alice\"\n[dyntwo]\nhostname=\"b.dyn.example\"\n");
    ZEPADDNSConfig conf;
    EXPECT_EQ(0, ZEPADDNSConfigGet("dyntwo", &conf));
    EXPECT_STREQ("dyntwo", conf.szProvider);
    EXPECT_STREQ("b.dyn.example", conf.szHostname);
    EXPECT_STREQ("", conf.szUsername);
    EXPECT_EQ(0, ZEPADDNSConfigGet("dynone", &conf));
    EXPECT_STREQ("a.dyn.example", conf.szHostname);
    EXPECT_STREQ("alice", conf.szUsername);
}

TEST_F(DdnsConfigTest, Failures) {
    ZEPADDNSConfig conf;
    EXPECT_EQ(-1, ZEPADDNSConfigGet("dynone", &conf));
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
    root.write("/etc/zepa/ddns.conf", "[dynone]\nusername=\"alice\"\n[dynthree]\nhostname=\"\"\n");
    EXPECT_EQ(-1, ZEPADDNSConfigGet("dyntwo", &conf));
    EXPECT_EQ(ZEPA_ERR_SECTION_NOT_FOUND, VLIBCErrGet());
    EXPECT_EQ(-1, ZEPADDNSConfigGet("dynone", &conf));
    EXPECT_EQ(ZEPA_ERR_KEY_NOT_FOUND, VLIBCErrGet());
    EXPECT_STREQ("", conf.szHostname);
    EXPECT_EQ(-1, ZEPADDNSConfigGet("dynthree", &conf));
    EXPECT_EQ(ZEPA_ERR_KEY_NOT_FOUND, VLIBCErrGet());
    EXPECT_EQ(-1, ZEPADDNSConfigGet("", &conf));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    EXPECT_EQ(-1, ZEPADDNSConfigGet("dynone", nullptr));
}

TEST_F(DdnsConfigTest, LongHostnameIsCut) {
    root.write("/etc/zepa/ddns.conf", "[p]\nhostname=\"" + std::string(300, 'h') + "\"\n");
    ZEPADDNSConfig conf;
    EXPECT_EQ(0, ZEPADDNSConfigGet("p", &conf));
    EXPECT_EQ(std::string(255, 'h'), conf.szHostname);
}

TEST_F(SupportGetTest, YesInAnyCaseMeansSupported) {
    root.write("/etc.defaults/zepainfo.conf",
               "supportddns=\"yes\"\nsupportx=\"YES\"\nsupporty=\"no\"\nsupportz=\"1\"\n");
    EXPECT_EQ(1, VLIBCSupportGet("supportddns"));
    EXPECT_EQ(1, VLIBCSupportGet("supportx"));
    EXPECT_EQ(0, VLIBCSupportGet("supporty"));
    EXPECT_EQ(0, VLIBCSupportGet("supportz"));
    EXPECT_EQ(0, VLIBCSupportGet("missing"));
    EXPECT_EQ(0, VLIBCSupportGet(nullptr));
}

TEST_F(SupportGetTest, MissingFileMeansUnsupported) {
    EXPECT_EQ(0, VLIBCSupportGet("supportddns"));
    root.write("/etc/zepainfo.conf", "supportddns=\"yes\"\n");
    EXPECT_EQ(0, VLIBCSupportGet("supportddns"));
}
