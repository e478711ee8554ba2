#include <gtest/gtest.h>
#include <zepasdk/net.h>

#include <cstring>
#include <sstream>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>

#include "support/fake_sdk/fake_sdk.h"
#include "support/round_trip.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepafake::AddMachineInterface;
using zepafake::Fake;
using zepatest::LogContains;
using zepatest::ParseJson;
using zepatest::ToJson;

namespace {

class NetworkConfTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        zepafake::Reset();
        Fake().network = true;
        AddMachineInterface("eth0");
        AddMachineInterface("eth1");
    }
    void EnableDdns(const std::string& update = "yes") {
        root.write("/etc.defaults/zepainfo.conf", "supportddns=\"yes\"\n");
        root.write("/etc/zepainfo.conf", "ddns_update=\"" + update + "\"\nddns_select=\"dyn1\"\n");
        root.write("/etc/zepa/ddns.conf", "[dyn1]\nhostname=\"box.dyn.example\"\nusername=\"u\"\n");
    }
};

class InterfaceConfTest : public NetworkConfTest {};

Json::Value ScopeEntry(const std::string& address) {
    Fake().machine.clear();
    AddMachineInterface("eth0", {{address, 64, 0x20}});
    InterfaceConf itf("eth0", "192.0.2.10", "255.255.255.0");
    Json::Value out;
    itf.Write(out, true);
    return out["ipv6"][0];
}

std::string ScopeWord(const std::string& address) { return ScopeEntry(address)["scope"].asString(); }

TEST_F(NetworkConfTest, WrittenFormReadsBackEqual) {
    NetworkConf original(false);
    ASSERT_TRUE(original.Overwrite(
        ParseJson("{\"ddns\":\"d.example\",\"gateway\":\"192.0.2.1\",\"mode\":\"relay\","
                  "\"interface\":[{\"name\":\"eth0\",\"ip\":\"192.0.2.10\",\"mask\":\"255.255.255.0\"},"
                  "{\"name\":\"eth1\",\"ip\":\"192.0.2.11\",\"mask\":\"255.255.255.0\"}]}")));
    NetworkConf fresh(false);
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

TEST_F(InterfaceConfTest, WrittenFormReadsBackEqual) {
    InterfaceConf original("eth0", "192.0.2.10", "255.255.255.0");
    InterfaceConf fresh;
    EXPECT_TRUE(zepatest::RoundTrips(original, fresh));
}

}  // namespace

// ---- reading from the machine ------------------------------------------------

TEST_F(NetworkConfTest, AsksForWiredInterfacesUpTo32) {
    NetworkConf conf(true);
    EXPECT_EQ(18, Fake().interfaceSelection);
    EXPECT_EQ(32, Fake().interfaceMax);
}

TEST_F(NetworkConfTest, NoInterfacesStillReadsGatewayAndDdns) {
    Daemon::_logLevel = 7;
    Fake().gateway = "192.0.2.1";
    EnableDdns();
    zepatest::StderrCapture cap;
    NetworkConf conf(true);
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "config:")) << log;
    EXPECT_TRUE(LogContains(log, "VLIBNetGetInterfaceInfo failed: [0x0900]")) << log;
    EXPECT_TRUE(conf.interfaces.empty());
    EXPECT_EQ("192.0.2.1", conf.gateway);
    EXPECT_EQ("box.dyn.example", conf.ddns);
    Json::Value out;
    conf.Write(out, true);
    EXPECT_TRUE(out["interface"].isArray());
    EXPECT_EQ(0u, out["interface"].size());
}

TEST_F(NetworkConfTest, FailedInterfaceListGoesOnToo) {
    Fake().interfaceResult = -1;
    Fake().gateway = "192.0.2.1";
    NetworkConf conf(true);
    EXPECT_TRUE(conf.interfaces.empty());
    EXPECT_EQ("192.0.2.1", conf.gateway);
}

TEST_F(NetworkConfTest, PlatformLookupsLogAtDebugLevelOnly) {
    Daemon::_logLevel = 6;
    Fake().pppoeStatus = 1;
    Fake().pppoeInfoFails = true;
    zepatest::StderrCapture cap;
    NetworkConf conf(true);
    EXPECT_EQ("", cap.stop());
}

TEST_F(NetworkConfTest, ReportsOnlyInterfacesWithStatusTwo) {
    Fake().interfaces = {{"eth0", "192.0.2.10", "255.255.255.0", 2},
                         {"eth1", "198.51.100.7", "255.255.255.0", 1},
                         {"eth1", "198.51.100.8", "255.255.255.0", 0}};
    NetworkConf conf(true);
    ASSERT_EQ(1u, conf.interfaces.size());
    EXPECT_EQ(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"), conf.interfaces.front());
}

TEST_F(NetworkConfTest, DropsInvalidAddressMaskPairsAndUnknownInterfaces) {
    Fake().interfaces = {{"eth0", "192.0.2.10", "255.0.255.0", 2},
                         {"eth1", "192.0.2.0", "255.255.255.0", 2},
                         {"eth9", "192.0.2.11", "255.255.255.0", 2},
                         {"eth1", "10.1.2.3", "255.0.0.0", 2}};
    NetworkConf conf(true);
    ASSERT_EQ(1u, conf.interfaces.size());
    EXPECT_EQ("eth1", conf.interfaces.front().name);
    EXPECT_EQ("10.1.2.3", conf.interfaces.front().address);
}

TEST_F(NetworkConfTest, ReadConfAppendsToTheList) {
    Fake().interfaces = {{"eth0", "192.0.2.10", "255.255.255.0", 2}};
    NetworkConf conf(true);
    EXPECT_TRUE(conf.ReadConf());
    EXPECT_EQ(2u, conf.interfaces.size());
}

TEST_F(NetworkConfTest, PppoeLinkIsAddedWhenUp) {
    AddMachineInterface("pppoe");
    Fake().interfaces = {{"eth0", "192.0.2.10", "255.255.255.0", 2}};
    Fake().pppoeStatus = 1;
    Fake().pppoeIp = "203.0.113.5";
    Fake().pppoeMask = "255.255.255.255";
    NetworkConf conf(true);
    ASSERT_EQ(2u, conf.interfaces.size());
    EXPECT_EQ(InterfaceConf("pppoe", "203.0.113.5", "255.255.255.255"), conf.interfaces.back());
}

TEST_F(NetworkConfTest, PppoeIsNotAskedWhenDown) {
    Fake().pppoeStatus = 0;
    Fake().pppoeIp = "203.0.113.5";
    Fake().pppoeMask = "255.255.255.255";
    AddMachineInterface("pppoe");
    NetworkConf conf(true);
    EXPECT_TRUE(conf.interfaces.empty());
    EXPECT_EQ(0, Fake().pppoeInfoCalls);
}

TEST_F(NetworkConfTest, PppoeInfoFailureIsLogged) {
    Daemon::_logLevel = 7;
    Fake().pppoeStatus = 1;
    Fake().pppoeInfoFails = true;
    Fake().errorCode = 0x0500;
    zepatest::StderrCapture cap;
    NetworkConf conf(true);
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "ZEPAPPPoeNetInfoGet failed: [0x0500]")) << log;
    EXPECT_TRUE(conf.interfaces.empty());
}

TEST_F(NetworkConfTest, GatewayFailureKeepsGateway) {
    Daemon::_logLevel = 7;
    NetworkConf conf(false);
    conf.gateway = "192.0.2.254";
    zepatest::StderrCapture cap;
    EXPECT_TRUE(conf.ReadConf());
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "ZEPANetDefaultGatewayGet failed: [0x0900]")) << log;
    EXPECT_EQ("192.0.2.254", conf.gateway);
}

TEST_F(NetworkConfTest, DdnsUpdateIsComparedWithoutCase) {
    EnableDdns("YeS");
    NetworkConf conf(true);
    EXPECT_EQ("box.dyn.example", conf.ddns);
}

TEST_F(NetworkConfTest, DdnsNeedsSupport) {
    EnableDdns();
    root.write("/etc.defaults/zepainfo.conf", "supportddns=\"no\"\n");
    Daemon::_logLevel = 7;
    zepatest::StderrCapture cap;
    NetworkConf conf(true);
    EXPECT_FALSE(LogContains(cap.stop(), "ddns"));
    EXPECT_EQ("", conf.ddns);
}

TEST_F(NetworkConfTest, DdnsNeedsUpdateSwitch) {
    EnableDdns("no");
    EXPECT_EQ("", NetworkConf(true).ddns);
    root.write("/etc/zepainfo.conf", "ddns_select=\"dyn1\"\n");
    zepatest::StderrCapture cap;
    EXPECT_EQ("", NetworkConf(true).ddns);
    EXPECT_FALSE(LogContains(cap.stop(), "ddns"));
}

TEST_F(NetworkConfTest, MissingDdnsProviderIsAnError) {
    EnableDdns();
    for (const char* text : {"ddns_update=\"yes\"\n", "ddns_update=\"yes\"\nddns_select=\"\"\n"}) {
        root.write("/etc/zepainfo.conf", text);
        zepatest::StderrCapture cap;
        NetworkConf conf(true);
        std::string log = cap.stop();
        EXPECT_TRUE(LogContains(log, "get ddns provider failed")) << log;
        EXPECT_EQ("", conf.ddns);
    }
}

TEST_F(NetworkConfTest, UnknownDdnsProviderIsAnError) {
    EnableDdns();
    root.write("/etc/zepainfo.conf", "ddns_update=\"yes\"\nddns_select=\"other\"\n");
    zepatest::StderrCapture cap;
    NetworkConf conf(true);
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "ZEPADDNSConfigGet failed: [0x0302]")) << log;
    EXPECT_EQ("", conf.ddns);
}

// ---- JSON ---------------------------------------------------------------------

TEST_F(NetworkConfTest, OverwriteTakesStringsAndValidInterfaces) {
    NetworkConf conf(false);
    EXPECT_TRUE(conf.Overwrite(
        ParseJson("{\"ddns\":\"d.example\",\"gateway\":\"192.0.2.1\",\"mode\":\"relay\","
                  "\"interface\":[{\"name\":\"eth0\",\"ip\":\"192.0.2.10\",\"mask\":\"255.255.255.0\"},"
                  "{\"name\":\"eth1\",\"ip\":\"192.0.2.11\",\"mask\":\"255.255.255.0\"}]}")));
    EXPECT_EQ("d.example", conf.ddns);
    EXPECT_EQ("192.0.2.1", conf.gateway);
    EXPECT_EQ("relay", conf.mode);
    ASSERT_EQ(2u, conf.interfaces.size());
    EXPECT_EQ("eth1", conf.interfaces.back().name);
}

TEST_F(NetworkConfTest, InterfaceUnknownToMachineEmptiesList) {
    NetworkConf conf(false);
    conf.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    zepatest::StderrCapture cap;
    conf.Overwrite(ParseJson(
        "{\"interface\":[{\"name\":\"nosuch0\",\"ip\":\"192.0.2.9\",\"mask\":\"255.255.255.0\"}]}"));
    EXPECT_EQ("", cap.stop());
    EXPECT_TRUE(conf.interfaces.empty());
}

TEST_F(NetworkConfTest, InvalidElementsAreDropped) {
    NetworkConf conf(false);
    conf.Overwrite(
        ParseJson("{\"interface\":[\"eth0\",null,[1],{\"name\":\"eth0\",\"ip\":5,\"mask\":\"255.0.0.0\"},"
                  "{\"name\":\"eth0\",\"ip\":\"10.0.0.1\",\"mask\":\"255.0.0.0\"}]}"));
    ASSERT_EQ(1u, conf.interfaces.size());
    EXPECT_EQ("10.0.0.1", conf.interfaces.front().address);
}

TEST_F(NetworkConfTest, OverwriteWithoutInterfaceArrayKeepsList) {
    NetworkConf conf(false);
    conf.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    for (const char* text : {"{}", "{\"interface\":\"x\"}", "{\"interface\":{\"name\":\"eth1\"}}",
                             "{\"interface\":null}", "{\"interface\":3}"}) {
        EXPECT_TRUE(conf.Overwrite(ParseJson(text))) << text;
        ASSERT_EQ(1u, conf.interfaces.size()) << text;
    }
}

TEST_F(NetworkConfTest, EmptyInterfaceArrayEmptiesList) {
    NetworkConf conf(false);
    conf.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    conf.Overwrite(ParseJson("{\"interface\":[]}"));
    EXPECT_TRUE(conf.interfaces.empty());
}

TEST_F(NetworkConfTest, WrongTypesAndNonObjectsLeaveMembers) {
    NetworkConf conf(false);
    conf.ddns = "d";
    conf.gateway = "g";
    conf.mode = "m";
    conf.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    for (const char* text :
         {"{\"ddns\":1,\"gateway\":null,\"mode\":[\"x\"]}", "{\"ddns\":{},\"gateway\":true}",
          "[{\"ddns\":\"x\"}]", "\"ddns\"", "null", "7"}) {
        EXPECT_TRUE(conf.Overwrite(ParseJson(text))) << text;
        EXPECT_EQ("d", conf.ddns) << text;
        EXPECT_EQ("g", conf.gateway) << text;
        EXPECT_EQ("m", conf.mode) << text;
        EXPECT_EQ(1u, conf.interfaces.size()) << text;
    }
}

TEST_F(NetworkConfTest, ValidityOfTheList) {
    NetworkConf conf(false);
    EXPECT_TRUE(conf.IsValid());
    conf.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    EXPECT_TRUE(conf.IsValid());
    conf.interfaces.push_back(InterfaceConf("gone0", "192.0.2.11", "255.255.255.0"));
    EXPECT_FALSE(conf.IsValid());
}

TEST_F(NetworkConfTest, WriteHasEveryKey) {
    root.write("/etc/zepainfo.conf", "external_host_ip=\"nas.example.org\"\n");
    AddMachineInterface("tun", {{"fe80::5", 64, 0x20}});
    NetworkConf conf(false);
    conf.ddns = "d.example";
    conf.gateway = "192.0.2.1";
    conf.mode = "relay";
    conf.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    Json::Value out;
    EXPECT_TRUE(conf.Write(out, false));
    // Unsigned and signed numbers differ as values; their text is what the servers see.
    EXPECT_EQ(ToJson(ParseJson(
                  "{\"interface\":[{\"name\":\"eth0\",\"ip\":\"192.0.2.10\",\"mask\":\"255.255.255.0\"}],"
                  "\"gateway\":\"192.0.2.1\",\"ddns\":\"d.example\",\"mode\":\"relay\","
                  "\"fqdn\":\"nas.example.org\",\"ipv6_tunnel\":[{\"address\":\"fe80::5\","
                  "\"prefix_length\":64,\"scope\":\"link\",\"addr_type\":32}]}")),
              ToJson(out));
    Json::Value full;
    conf.Write(full, true);
    EXPECT_EQ(out, full);
}

TEST_F(NetworkConfTest, FqdnIsEmptyWhenKeyOrFileIsMissing) {
    NetworkConf conf(false);
    Json::Value out;
    conf.Write(out, true);
    ASSERT_TRUE(out.isMember("fqdn"));
    EXPECT_EQ("", out["fqdn"].asString());
    root.write("/etc/zepainfo.conf", "timezone=\"x\"\n");
    Json::Value again;
    conf.Write(again, true);
    ASSERT_TRUE(again["fqdn"].isString());
    EXPECT_EQ("", again["fqdn"].asString());
}

TEST_F(NetworkConfTest, TunnelArrayIsWrittenEvenEmpty) {
    NetworkConf conf(false);
    Json::Value out;
    conf.Write(out, true);
    ASSERT_TRUE(out["ipv6_tunnel"].isArray());
    EXPECT_EQ(0u, out["ipv6_tunnel"].size());
    AddMachineInterface("tun");
    Json::Value again;
    conf.Write(again, true);
    ASSERT_TRUE(again["ipv6_tunnel"].isArray());
}

TEST_F(NetworkConfTest, WrittenFormReadsBack) {
    NetworkConf conf(false);
    conf.ddns = "d.example";
    conf.gateway = "192.0.2.1";
    conf.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    conf.interfaces.push_back(InterfaceConf("eth1", "10.0.0.2", "255.0.0.0"));
    Json::Value out;
    conf.Write(out, true);
    NetworkConf back(false);
    back.Overwrite(out);
    EXPECT_TRUE(conf == back);
}

TEST_F(NetworkConfTest, EqualityIgnoresModeOnly) {
    NetworkConf a(false), b(false);
    a.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    b.interfaces.push_back(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    a.mode = "relay";
    b.mode = "direct";
    EXPECT_TRUE(a == b);
    EXPECT_FALSE(a != b);
    b.ddns = "x";
    EXPECT_TRUE(a != b);
    b.ddns = "";
    b.gateway = "192.0.2.1";
    EXPECT_TRUE(a != b);
    b.gateway = "";
    b.interfaces.push_back(InterfaceConf("eth1", "10.0.0.2", "255.0.0.0"));
    EXPECT_TRUE(a != b);
    a.interfaces.push_front(InterfaceConf("eth1", "10.0.0.2", "255.0.0.0"));
    EXPECT_TRUE(a != b);  // same elements, other order
}

// ---- InterfaceConf --------------------------------------------------------------

TEST_F(InterfaceConfTest, ConstructorsAndOverwrite) {
    struct VLIBNetIfInfo rec;
    memset(&rec, 0, sizeof(rec));
    strcpy(rec.szName, "eth1");
    strcpy(rec.szIP, "10.0.0.2");
    strcpy(rec.szMask, "255.0.0.0");
    rec.status = 2;
    InterfaceConf fromRecord(rec);
    EXPECT_EQ(InterfaceConf("eth1", "10.0.0.2", "255.0.0.0"), fromRecord);
    InterfaceConf itf;
    EXPECT_EQ("", itf.name);
    EXPECT_TRUE(itf.Overwrite(ParseJson("{\"ip\":\"10.0.0.2\",\"mask\":\"255.0.0.0\",\"name\":\"eth1\"}")));
    EXPECT_EQ(fromRecord, itf);
    EXPECT_TRUE(itf.Overwrite(ParseJson("{\"ip\":1,\"mask\":null,\"name\":[\"eth0\"]}")));
    EXPECT_TRUE(itf.Overwrite(ParseJson("[\"eth0\"]")));
    EXPECT_EQ(fromRecord, itf);
}

TEST_F(InterfaceConfTest, Validity) {
    EXPECT_TRUE(InterfaceConf("eth0", "192.0.2.10", "255.255.255.0").IsValid());
    EXPECT_FALSE(InterfaceConf("", "192.0.2.10", "255.255.255.0").IsValid());
    EXPECT_FALSE(InterfaceConf("eth0", "", "255.255.255.0").IsValid());
    EXPECT_FALSE(InterfaceConf("eth0", "192.0.2.10", "").IsValid());
    EXPECT_FALSE(InterfaceConf("eth0", "192.0.2.10", "255.0.255.0").IsValid());
    EXPECT_FALSE(InterfaceConf("eth0", "192.0.2.300", "255.255.255.0").IsValid());
    EXPECT_FALSE(InterfaceConf("eth7", "192.0.2.10", "255.255.255.0").IsValid());
}

TEST_F(InterfaceConfTest, EqualityComparesAllThree) {
    InterfaceConf a("eth0", "192.0.2.10", "255.255.255.0");
    EXPECT_TRUE(a == InterfaceConf("eth0", "192.0.2.10", "255.255.255.0"));
    EXPECT_TRUE(a != InterfaceConf("eth1", "192.0.2.10", "255.255.255.0"));
    EXPECT_TRUE(a != InterfaceConf("eth0", "192.0.2.11", "255.255.255.0"));
    EXPECT_TRUE(a != InterfaceConf("eth0", "192.0.2.10", "255.255.0.0"));
}

TEST_F(InterfaceConfTest, WriteWithoutIpv6HasNoIpv6Key) {
    InterfaceConf itf("eth0", "192.0.2.10", "255.255.255.0");
    for (bool full : {false, true}) {
        Json::Value out;
        EXPECT_TRUE(itf.Write(out, full));
        EXPECT_EQ(ParseJson("{\"name\":\"eth0\",\"ip\":\"192.0.2.10\",\"mask\":\"255.255.255.0\"}"), out);
    }
    Json::Value unknown;
    InterfaceConf("gone0", "1.2.3.4", "255.0.0.0").Write(unknown, true);
    EXPECT_FALSE(unknown.isMember("ipv6"));
    EXPECT_EQ("gone0", unknown["name"].asString());
}

TEST_F(InterfaceConfTest, WriteListsIpv6InPlatformOrder) {
    Fake().machine.clear();
    AddMachineInterface("eth0", {{"2001:db8::10", 64, 0}, {"fe80::1", 64, 0x20}});
    Json::Value out;
    InterfaceConf("eth0", "192.0.2.10", "255.255.255.0").Write(out, true);
    EXPECT_EQ(ToJson(ParseJson(
                  "[{\"address\":\"2001:db8::10\",\"prefix_length\":64,\"scope\":\"global\",\"addr_type\":0},"
                  "{\"address\":\"fe80::1\",\"prefix_length\":64,\"scope\":\"link\",\"addr_type\":32}]")),
              ToJson(out["ipv6"]));
    EXPECT_TRUE(out["ipv6"][0]["prefix_length"].isUInt());
}

TEST_F(InterfaceConfTest, AtMost32Ipv6Addresses) {
    std::vector<zepafake::V6Address> many;
    for (int i = 0; i < 40; ++i) many.push_back({"2001:db8::" + std::to_string(i + 1), 64, 0});
    Fake().machine.clear();
    AddMachineInterface("eth0", many);
    Json::Value out;
    InterfaceConf("eth0", "192.0.2.10", "255.255.255.0").Write(out, true);
    EXPECT_EQ(32u, out["ipv6"].size());
}

TEST_F(InterfaceConfTest, ScopeWords) {
    EXPECT_EQ("link", ScopeWord("fe80::1"));
    EXPECT_EQ("link", ScopeWord("febf::1"));
    EXPECT_EQ("site", ScopeWord("fec0::1"));
    EXPECT_EQ("loopback", ScopeWord("::1"));
    EXPECT_EQ("compat", ScopeWord("::c000:201"));
    EXPECT_EQ("compat", ScopeWord("::2"));
    EXPECT_EQ("mapped", ScopeWord("::ffff:192.0.2.1"));
    EXPECT_EQ("global", ScopeWord("::"));
    EXPECT_EQ("global", ScopeWord("2001:db8::1"));
    EXPECT_EQ("global", ScopeWord("ff02::1"));
    EXPECT_EQ("global", ScopeWord("0:0:1::1"));
    EXPECT_EQ("global", ScopeWord("::1:0:0:1"));
}

TEST_F(InterfaceConfTest, AddressTypeIsPassedThrough) {
    Json::Value entry = ScopeEntry("fe80::1");
    EXPECT_EQ(32u, entry["addr_type"].asUInt());
    EXPECT_EQ(64u, entry["prefix_length"].asUInt());
    EXPECT_EQ("fe80::1", entry["address"].asString());
}
