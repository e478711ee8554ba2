#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include <zeparelayd/config.h>

#include "support/round_trip.h"
#include "support/service_staging.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::AddRouterRule;
using zepatest::FwDefinition;
using zepatest::LogContains;
using zepatest::LogMessages;
using zepatest::ParseJson;
using zepatest::RootTest;
using zepatest::SetInfo;
using zepatest::SetKey;
using zepatest::StderrCapture;
using zepatest::WriteFwDefinition;

namespace {

constexpr const char kPhotoSettings[] = "/var/packages/PictureDock/etc/settings.conf";
constexpr const char kUpnp[] = "/tmp/.zeparelayd_upnp_rules";

struct Row {
    const char* name;
    const char* file;
    const char* key;
    const char* value;
    int opt;
    const char* package;
    const char* service;
    uint32_t mask;
};

bool SameText(const char* a, const char* b) {
    if (a == nullptr || b == nullptr) return a == b;
    return strcmp(a, b) == 0;
}

TEST(ServiceCatalogue, RowsAreExactlyTheTable) {
    const char* info = "/etc/zepainfo.conf";
    const Row expected[] = {
        {"nos", nullptr, nullptr, nullptr, 1, nullptr, nullptr, 0x1},
        {"nos_https", info, "runHTTPS", "yes", 0, nullptr, nullptr, 0x1},
        {"webdav_http", nullptr, nullptr, nullptr, 0, nullptr, "webdav-httpd-pure", 0x1},
        {"webdavs_https", nullptr, nullptr, nullptr, 0, nullptr, "webdav-httpd-ssl", 0x1},
        {"http", nullptr, nullptr, nullptr, 0, nullptr, nullptr, 0xFFFFFFFF},
        {"https", info, "runWebHTTPS", "yes", 0, nullptr, nullptr, 0xFFFFFFFF},
        {"telnet", info, "runtelnet", "yes", 0, nullptr, nullptr, 0xFFFFFFFF},
        {"ssh", info, "supportssh", "yes", 0, nullptr, "ssh-shell", 0xFFFFFFFF},
        {"nos_https_spdy_30", info, "runHTTPS", "yes", 0, nullptr, nullptr, 0x10},
        {"photo_https_spdy_30", info, "runWebHTTPS", "yes", 0, "PictureDock", nullptr, 0x20},
        {"nso_https", info, "runHTTPS", "yes", 0, nullptr, nullptr, 0x8},
        {"file_sharing", info, "runHTTPS", "yes", 0, nullptr, nullptr, 0x8},
        {"file_sharing_https", info, "runHTTPS", "yes", 0, nullptr, nullptr, 0x8},
        {"nos_portal", info, "redirectHTTPS", "no", 1, nullptr, nullptr, 0x10},
        {"nos_portal_https", info, "runHTTPS", "yes", 0, nullptr, nullptr, 0x10},
        {"nos_portal_https_spdy_30", info, "runHTTPS", "yes", 0, nullptr, nullptr, 0x10},
        {"photo_portal_http", nullptr, nullptr, nullptr, 0, "PictureDock", nullptr, 0x20},
        {"photo_portal_https", info, "runWebHTTPS", "yes", 0, "PictureDock", nullptr, 0x20},
        {"photo_portal_https_spdy_30", info, "runWebHTTPS", "yes", 0, "PictureDock", nullptr, 0x20},
        {"audio_http", nullptr, nullptr, nullptr, 1, "SoundDock", nullptr, 0x1},
        {"audio_https", info, "runHTTPS", "yes", 0, "SoundDock", nullptr, 0x1},
        {"photo_http", nullptr, nullptr, nullptr, 0, "PictureDock", nullptr, 0x2},
        {"photo_https", info, "runWebHTTPS", "yes", 0, "PictureDock", nullptr, 0x2},
        {"syncdock", "/var/packages/SyncDock/etc/setting.conf", "sydk_enable", "1", 0, "SyncDock", nullptr,
         0x4},
    };
    size_t i = 0;
    for (; grgszSupportService[i].szName != nullptr; ++i) {
        ASSERT_LT(i, sizeof(expected) / sizeof(expected[0]));
        const SupportService& row = grgszSupportService[i];
        const Row& want = expected[i];
        EXPECT_STREQ(want.name, row.szName) << i;
        EXPECT_TRUE(SameText(want.file, row.szConfFile)) << i;
        EXPECT_TRUE(SameText(want.key, row.szKey)) << i;
        EXPECT_TRUE(SameText(want.value, row.szValue)) << i;
        EXPECT_EQ(want.opt, row.iCheckOpt) << i;
        EXPECT_TRUE(SameText(want.package, row.szPackage)) << i;
        EXPECT_TRUE(SameText(want.service, row.szServiceName)) << i;
        EXPECT_EQ(want.mask, row.uMask) << i;
    }
    EXPECT_EQ(24u, i);
    const SupportService& end = grgszSupportService[24];
    EXPECT_EQ(nullptr, end.szConfFile);
    EXPECT_EQ(nullptr, end.szKey);
    EXPECT_EQ(nullptr, end.szValue);
    EXPECT_EQ(0, end.iCheckOpt);
    EXPECT_EQ(nullptr, end.szPackage);
    EXPECT_EQ(nullptr, end.szServiceName);
    EXPECT_EQ(0u, end.uMask);
}

class ServiceConfNoFirewall : public RootTest {};

class ServiceConfTest : public RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        zepatest::WriteStockFwDefinitions(root);
    }
};

TEST_F(ServiceConfTest, DefaultsWithoutId) {
    ServiceConf s(nullptr);
    EXPECT_EQ("", s.id);
    EXPECT_EQ("", s.name);
    EXPECT_EQ(-1, s.port);
    EXPECT_EQ(-1, s.ext_port);
    EXPECT_FALSE(s.IsValid());
}

TEST_F(ServiceConfTest, ReadsNameAndPortThroughFirewallName) {
    ServiceConf s("nos");
    EXPECT_EQ("nos", s.id);
    EXPECT_EQ("Management:HTTP", s.name);
    EXPECT_EQ(5000, s.port);
    EXPECT_EQ(-1, s.ext_port);
    EXPECT_TRUE(s.IsValid());
}

TEST_F(ServiceConfTest, FirewallNameMapping) {
    struct {
        const char* id;
        int port;
    } cases[] = {
        {"photo_http", 80},
        {"photo_portal_http", 80},
        {"photo_https", 443},
        {"photo_portal_https", 443},
        {"nos_portal", 5000},
        {"file_sharing", 5000},
        {"audio_http", 5000},
        {"nos_https", 5001},
        {"nos_portal_https", 5001},
        {"file_sharing_https", 5001},
        {"audio_https", 5001},
        {"nso_https", 5001},
        {"http", 80},
        {"https", 443},
        {"telnet", 23},
        {"ssh", 22},
        {"webdav_http", 5005},
        {"webdavs_https", 5006},
        {"syncdock", 6690},
        {"support_nos", 5000},
        {"support_photo_http", 80},
        {"support_syncdock", 6690},
    };
    for (const auto& c : cases) {
        ServiceConf s(c.id);
        EXPECT_EQ(c.id, s.id);
        EXPECT_EQ(c.port, s.port) << c.id;
    }
}

TEST_F(ServiceConfTest, NamesFromTitlesOrAlternativeTitle) {
    EXPECT_EQ("Web Server", ServiceConf("http").name);
    WriteFwDefinition(root, {"onlytitle", "1", "tcp", "Title", "", "Alt"});
    EXPECT_EQ("Alt", ServiceConf("onlytitle").name);
    WriteFwDefinition(root, {"untitled", "1", "tcp", "", "Sub", ""});
    ServiceConf s(Json::Value(Json::objectValue), false);
    s.name = "kept";
    EXPECT_TRUE(s.ReadConf("untitled"));
    EXPECT_EQ("kept", s.name);
    EXPECT_EQ(1, s.port);
}

TEST_F(ServiceConfTest, UnknownFirewallNameFails) {
    ServiceConf s(Json::Value(), false);
    EXPECT_FALSE(s.ReadConf("nosuch"));
    EXPECT_EQ("nosuch", s.id);
    EXPECT_FALSE(s.IsValid());
}

TEST_F(ServiceConfTest, UnusableDefinitionFails) {
    WriteFwDefinition(root, {"ping", "7", "icmp"});
    ServiceConf s(Json::Value(), false);
    EXPECT_FALSE(s.ReadConf("ping"));
    EXPECT_EQ(-1, s.port);
    WriteFwDefinition(root, {"dns", "53", "udp"});
    EXPECT_TRUE(s.ReadConf("dns"));
    EXPECT_EQ(53, s.port);
}

TEST_F(ServiceConfNoFirewall, EnumerationFailureIsLogged) {
    StderrCapture cap;
    ServiceConf s(Json::Value(), false);
    EXPECT_FALSE(s.ReadConf("nos"));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "config:")) << log;
    EXPECT_TRUE(LogContains(log, "enum fw service failed [0x0300]")) << log;
    EXPECT_EQ("nos", s.id);
    EXPECT_FALSE(s.IsValid());
}

TEST_F(ServiceConfNoFirewall, EmptyFolderIsLoggedLikeNoFolder) {
    root.mkdir("/usr/zepa/etc/fw_services");
    StderrCapture cap;
    ServiceConf s("nos");
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "enum fw service failed [0x0900]")) << log;
    EXPECT_FALSE(s.IsValid());
}

TEST_F(ServiceConfTest, TwoPortsLeavePortAbsent) {
    WriteFwDefinition(root, {"nso", "5000,5002", "tcp", "Management", "HTTP"});
    ServiceConf s("nos");
    EXPECT_EQ(-1, s.port);
    EXPECT_FALSE(s.IsValid());
    WriteFwDefinition(root, {"nso", "", "tcp", "Management", "HTTP"});
    EXPECT_EQ(-1, ServiceConf("nos").port);
}

TEST_F(ServiceConfTest, SpdyGateForManagementVariants) {
    SetInfo(root, "support_spdy", "yes");
    SetInfo(root, "runsysspdy", "no");
    for (const char* id : {"nos_https_spdy_30", "support_nos_https_spdy_30", "nos_portal_https_spdy_30",
                           "support_nos_portal_https_spdy_30"}) {
        ServiceConf s(Json::Value(), false);
        EXPECT_FALSE(s.ReadConf(id)) << id;
        EXPECT_FALSE(s.IsValid()) << id;
    }
    SetInfo(root, "runsysspdy", "yes");
    ServiceConf on("support_nos_https_spdy_30");
    EXPECT_TRUE(on.IsValid());
    EXPECT_EQ(5001, on.port);
    SetInfo(root, "support_spdy", "no");
    EXPECT_FALSE(ServiceConf("nos_https_spdy_30").IsValid());
}

TEST_F(ServiceConfTest, SpdyGateForPhotoVariants) {
    SetInfo(root, "support_spdy", "yes");
    SetInfo(root, "runsysspdy", "yes");
    SetInfo(root, "runuserspdy", "no");
    EXPECT_FALSE(ServiceConf("photo_https_spdy_30").IsValid());
    EXPECT_FALSE(ServiceConf("support_photo_portal_https_spdy_30").IsValid());
    SetInfo(root, "runuserspdy", "YES");
    EXPECT_EQ(443, ServiceConf("photo_https_spdy_30").port);
    EXPECT_EQ(443, ServiceConf("support_photo_portal_https_spdy_30").port);
}

TEST_F(ServiceConfTest, SettingsKeyGivesExternalPortBeforeRouterRules) {
    SetInfo(root, "external_port_nos_https", "8443");
    AddRouterRule(root, "r", "5001", "443", "tcp", "1");
    for (const char* id : {"nos_https", "file_sharing_https", "audio_https", "support_nos_https"}) {
        EXPECT_EQ(8443, ServiceConf(id).ext_port) << id;
    }
}

TEST_F(ServiceConfTest, SettingsKeysPerFirewallName) {
    SetInfo(root, "external_port_nos_http", "8080");
    SetKey(root, kPhotoSettings, "external_port_photo_https", "9443");
    SetKey(root, kPhotoSettings, "external_port_photo_http", "9080");
    EXPECT_EQ(8080, ServiceConf("nos").ext_port);
    EXPECT_EQ(8080, ServiceConf("file_sharing").ext_port);
    EXPECT_EQ(9443, ServiceConf("photo_https").ext_port);
    EXPECT_EQ(9443, ServiceConf("photo_portal_https").ext_port);
    EXPECT_EQ(9080, ServiceConf("photo_http").ext_port);
    // Without "photo" in the id the web server's own definitions have no key.
    EXPECT_EQ(-1, ServiceConf("http").ext_port);
    EXPECT_EQ(-1, ServiceConf("https").ext_port);
}

TEST_F(ServiceConfTest, SettingsKeyIsTakenWithoutUpnpCheck) {
    SetInfo(root, "external_port_nos_https", "8443");
    root.write(kUpnp, R"({"8443": {"TCP": false}, "5001": {"TCP": false}})");
    EXPECT_EQ(8443, ServiceConf("nos_https").ext_port);
}

TEST_F(ServiceConfTest, EmptySettingsValueFallsBackToRouterRules) {
    SetInfo(root, "external_port_nos_http", "");
    AddRouterRule(root, "r", "5000", "80", "tcp", "1");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
}

TEST_F(ServiceConfTest, RouterRuleGivesInternalPortNotRouterPort) {
    AddRouterRule(root, "web", "5000", "80", "tcp", "1");
    ServiceConf s("nos");
    EXPECT_EQ(5000, s.port);
    EXPECT_EQ(5000, s.ext_port);
}

TEST_F(ServiceConfTest, RouterRuleMatchesWithinListsAndRanges) {
    AddRouterRule(root, "many", "22,4999-5002", "2222,80-83", "all", "1");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
    EXPECT_EQ(5001, ServiceConf("nos_https").ext_port);
    EXPECT_EQ(22, ServiceConf("ssh").ext_port);
    EXPECT_EQ(-1, ServiceConf("telnet").ext_port);
}

TEST_F(ServiceConfTest, RouterPortListContentDoesNotMatter) {
    AddRouterRule(root, "web", "5000", "9999", "tcp", "1");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
}

TEST_F(ServiceConfTest, UdpOrDisabledRulesNeverMatch) {
    AddRouterRule(root, "udp", "5000", "80", "udp", "1");
    AddRouterRule(root, "off", "5000", "80", "tcp", "0");
    AddRouterRule(root, "upper", "5000", "80", "TCP", "1");
    AddRouterRule(root, "word", "5000", "80", "tcp", "yes");
    StderrCapture cap;
    EXPECT_EQ(-1, ServiceConf("nos").ext_port);
    EXPECT_EQ("", cap.stop());
}

TEST_F(ServiceConfTest, FirstMatchingRuleWinsAndStopsTheScan) {
    AddRouterRule(root, "first", "5000", "80", "tcp", "1");
    AddRouterRule(root, "broken", "5000x", "80", "tcp", "1");
    StderrCapture cap;
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
    EXPECT_EQ("", cap.stop());
}

TEST_F(ServiceConfTest, MalformedRuleIsLoggedAndSkipped) {
    AddRouterRule(root, "bad-source", "5000-", "80", "tcp", "1");
    AddRouterRule(root, "bad-router", "5000", "8o", "tcp", "1");
    AddRouterRule(root, "good", "5000", "80", "tcp", "1");
    StderrCapture cap;
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "Router[80] or source[5000-] ports parse failed.")) << log;
    EXPECT_TRUE(LogContains(log, "Router[8o] or source[5000] ports parse failed.")) << log;
    EXPECT_EQ(2u, LogMessages(log).size()) << log;
}

TEST_F(ServiceConfTest, RuleWithMissingKeyIsSkippedSilently) {
    root.write("/usr/zepa/etc/router/portforward.conf",
               "[partial]\ns_port=\"5000\"\nr_port=\"80\"\nenabled=\"1\"\n"
               "[empty]\ns_port=\"\"\nr_port=\"80\"\nprotocol name=\"tcp\"\nenabled=\"1\"\n");
    StderrCapture cap;
    EXPECT_EQ(-1, ServiceConf("nos").ext_port);
    EXPECT_EQ("", cap.stop());
    AddRouterRule(root, "full", "5000", "80", "tcp", "1");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
}

TEST_F(ServiceConfTest, NoRuleFileMeansNoExternalPort) {
    StderrCapture cap;
    ServiceConf s("nos");
    EXPECT_EQ("", cap.stop());
    EXPECT_TRUE(s.IsValid());
    EXPECT_EQ(-1, s.ext_port);
}

TEST_F(ServiceConfTest, UpnpReportsPortNotMappedForTcp) {
    AddRouterRule(root, "web", "5000", "80", "tcp", "1");
    root.write(kUpnp, R"({"5000": {"TCP": false}})");
    EXPECT_EQ(0, ServiceConf("nos").ext_port);
    root.write(kUpnp, R"({"5000": {"TCP": true}})");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
    root.write(kUpnp, R"({"5001": {"TCP": false}, "5000": {"UDP": false}})");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
}

TEST_F(ServiceConfTest, MissingOrCorruptUpnpFileIsNoError) {
    AddRouterRule(root, "web", "5000", "80", "tcp", "1");
    StderrCapture cap;
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
    EXPECT_EQ("", cap.stop());
    root.write(kUpnp, R"({"5000": {"TCP": fal)");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
    EXPECT_TRUE(root.exists(std::string(kUpnp) + ".bad"));
    root.write(kUpnp, R"(["5000"])");
    EXPECT_EQ(5000, ServiceConf("nos").ext_port);
}

TEST_F(ServiceConfTest, JsonConstructorLetsJsonWin) {
    Json::Value v = ParseJson(R"({"id": "nos", "name": "Mine", "ext_port": 7})");
    ServiceConf s(v, true);
    EXPECT_EQ("nos", s.id);
    EXPECT_EQ("Mine", s.name);
    EXPECT_EQ(5000, s.port);
    EXPECT_EQ(7, s.ext_port);
    ServiceConf fromFile(ParseJson(R"({"id": "nos"})"), false);
    EXPECT_EQ(-1, fromFile.port);
    EXPECT_EQ("", fromFile.name);
}

TEST_F(ServiceConfTest, JsonConstructorWithNonStringIdReadsEmptyId) {
    StderrCapture cap;
    ServiceConf s(ParseJson(R"({"id": 5, "port": 3})"), true);
    EXPECT_EQ("", cap.stop());
    EXPECT_EQ("", s.id);
    EXPECT_EQ(3, s.port);
    EXPECT_FALSE(s.IsValid());
}

TEST_F(ServiceConfTest, OverwriteTakesOnlyExpectedTypes) {
    ServiceConf s(Json::Value(), false);
    s.id = "a";
    s.name = "n";
    s.port = 1;
    s.ext_port = 2;
    EXPECT_TRUE(s.Overwrite(ParseJson(R"({"id": 1, "name": false, "port": "80", "ext_port": 1.5})")));
    EXPECT_EQ("a", s.id);
    EXPECT_EQ("n", s.name);
    EXPECT_EQ(1, s.port);
    EXPECT_EQ(2, s.ext_port);
    EXPECT_TRUE(s.Overwrite(ParseJson("[1]")));
    EXPECT_TRUE(s.Overwrite(ParseJson(R"({"id": "b", "name": "m", "port": 80, "ext_port": -1})")));
    EXPECT_EQ("b", s.id);
    EXPECT_EQ("m", s.name);
    EXPECT_EQ(80, s.port);
    EXPECT_EQ(-1, s.ext_port);
}

TEST_F(ServiceConfTest, ValidityNeedsIdAndPort) {
    ServiceConf s(Json::Value(), false);
    s.port = 0;
    EXPECT_FALSE(s.IsValid());
    s.id = "x";
    EXPECT_TRUE(s.IsValid());
    s.port = -1;
    EXPECT_FALSE(s.IsValid());
}

TEST_F(ServiceConfTest, PersistentFormIsIdOnly) {
    ServiceConf s(ParseJson(R"({"id": "nos", "name": "N", "port": 5000, "ext_port": 80})"), false);
    Json::Value out = ParseJson(R"({"other": 1})");
    EXPECT_TRUE(s.Write(out, false));
    EXPECT_EQ(ParseJson(R"({"other": 1, "id": "nos"})"), out);
    Json::Value full;
    EXPECT_TRUE(s.Write(full, true));
    EXPECT_EQ(ParseJson(R"({"id": "nos", "name": "N", "port": 5000, "ext_port": 80})"), full);
}

TEST_F(ServiceConfTest, FullFormLeavesOutAbsentPorts) {
    ServiceConf s(ParseJson(R"({"id": "x"})"), false);
    Json::Value full;
    s.Write(full, true);
    EXPECT_EQ(ParseJson(R"({"id": "x", "name": ""})"), full);
    s.port = 0;
    full = Json::Value();
    s.Write(full, true);
    EXPECT_EQ(ParseJson(R"({"id": "x", "name": "", "port": 0})"), full);
}

TEST_F(ServiceConfTest, EqualityIgnoresName) {
    ServiceConf a(ParseJson(R"({"id": "nos", "name": "A", "port": 5000, "ext_port": 1})"), false);
    ServiceConf b(ParseJson(R"({"id": "nos", "name": "B", "port": 5000, "ext_port": 1})"), false);
    EXPECT_TRUE(a == b);
    EXPECT_FALSE(a != b);
    b.ext_port = 2;
    EXPECT_FALSE(a == b);
    EXPECT_TRUE(a != b);
    b.ext_port = 1;
    b.port = 5001;
    EXPECT_TRUE(a != b);
    b.port = 5000;
    b.id = "NOS";
    EXPECT_TRUE(a != b);
}

TEST_F(ServiceConfTest, PrintsFullForm) {
    ServiceConf s(ParseJson(R"({"id": "nos", "name": "N", "port": 5000})"), false);
    std::ostringstream os;
    os << s;
    EXPECT_EQ(ParseJson(R"({"id": "nos", "name": "N", "port": 5000})"), ParseJson(os.str()));
}

TEST_F(ServiceConfTest, WrittenFormReadsBackEqual) {
    // The id is stored; name and ports come from the machine again when read.
    ServiceConf original("nos");
    EXPECT_TRUE(zepatest::RoundTripsVia(original, [](const Json::Value& written) {
        return std::unique_ptr<ServiceConf>(new ServiceConf(written, true));
    }));
}

}  // namespace
