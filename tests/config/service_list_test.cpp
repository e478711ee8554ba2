#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

#include <zeparelayd/config.h>
#include <zeparelayd/permission.h>

#include "support/service_staging.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::AddRouterRule;
using zepatest::EnablePackage;
using zepatest::EnableSystemService;
using zepatest::LogContains;
using zepatest::ParseJson;
using zepatest::RootTest;
using zepatest::SetInfo;
using zepatest::SetKey;
using zepatest::StderrCapture;

namespace {

constexpr const char kPermissionFile[] = "/usr/zepa/etc/zeparelayd/services.conf";

std::vector<std::tuple<std::string, int, int>> Listed(const RelaydConf& c) {
    std::vector<std::tuple<std::string, int, int>> out;
    for (const ServiceConf& s : c.services) out.emplace_back(s.id, s.port, s.ext_port);
    return out;
}

class ServiceListTest : public RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        zepatest::WriteStockFwDefinitions(root);
        root.mkdir("/usr/zepa/etc/zeparelayd");
    }
    Json::Value PermissionFile() const { return ParseJson(root.read(kPermissionFile)); }
};

// A whole appliance: settings, firewall definitions, router rules, UPnP,
// system services, packages and the administrator's permissions.
TEST_F(ServiceListTest, GenerationOnAStagedAppliance) {
    SetInfo(root, "runrelayd", "yes");
    SetInfo(root, "runHTTPS", "yes");
    SetInfo(root, "runWebHTTPS", "yes");
    SetInfo(root, "redirectHTTPS", "yes");
    SetInfo(root, "supportssh", "yes");
    SetInfo(root, "runtelnet", "no");
    SetInfo(root, "external_port_nos_https", "8443");
    SetInfo(root, "support_spdy", "yes");
    SetInfo(root, "runsysspdy", "no");
    SetInfo(root, "runuserspdy", "yes");
    EnableSystemService(root, "ssh-shell");
    EnableSystemService(root, "webdav-httpd-ssl");
    EnablePackage(root, "PictureDock");
    SetKey(root, "/var/packages/PictureDock/etc/settings.conf", "external_port_photo_https", "9443");
    SetKey(root, "/var/packages/SyncDock/etc/setting.conf", "sydk_enable", "1");
    AddRouterRule(root, "web", "5000,80", "80,8080", "tcp", "1");
    AddRouterRule(root, "bad", "abc", "80", "tcp", "1");
    AddRouterRule(root, "ssh", "22", "2222", "all", "1");
    AddRouterRule(root, "webdav", "5006", "5006", "tcp", "1");
    root.write("/tmp/.zeparelayd_upnp_rules", R"({"22": {"TCP": false}, "80": {"TCP": true}})");
    root.write(kPermissionFile,
               R"([{"id": "mobile_apps", "enabled": true}, {"id": "picturedock", "enabled": false},
                                   {"id": "file_sharing", "enabled": true}, {"id": "nos_portal", "enabled": true},
                                   {"id": "photo_portal", "enabled": true}])");
    RelaydConf c(nullptr);
    c.supportChannel.SetEnabled(true);

    StderrCapture cap;
    c.GenServiceConf();
    std::string log = cap.stop();

    std::vector<std::tuple<std::string, int, int>> expected;
    auto both = [&expected](const std::string& id, int port, int ext) {
        expected.emplace_back(id, port, ext);
        expected.emplace_back("support_" + id, port, ext);
    };
    both("nos", 5000, 5000);                 // router rule
    both("nos_https", 5001, 8443);           // settings key
    both("webdavs_https", 5006, 5006);       // router rule
    both("http", 80, 80);                    // router rule, UPnP maps TCP
    both("https", 443, -1);                  // no rule forwards 443
    both("ssh", 22, 0);                      // UPnP: not mapped for TCP
    both("photo_https_spdy_30", 443, 9443);  // photo settings key
    both("nso_https", 5001, 8443);
    both("file_sharing", 5000, 5000);
    both("file_sharing_https", 5001, 8443);
    both("nos_portal_https", 5001, 8443);
    both("photo_portal_http", 80, 80);
    both("photo_portal_https", 443, 9443);
    both("photo_portal_https_spdy_30", 443, 9443);
    expected.emplace_back("support_photo_http", 80, 80);  // "picturedock" not granted
    expected.emplace_back("support_photo_https", 443, 9443);
    EXPECT_EQ(expected, Listed(c));

    EXPECT_EQ("Management:HTTP", c.GetServiceById("support_nos")->name);
    EXPECT_EQ("Web Server", c.GetServiceById("http")->name);
    EXPECT_TRUE(LogContains(log, "Router[80] or source[abc] ports parse failed.")) << log;
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": true}, {"id": "picturedock", "enabled": false},
                            {"id": "file_sharing", "enabled": true}, {"id": "nos_portal", "enabled": true},
                            {"id": "photo_portal", "enabled": true}])"),
              PermissionFile());

    Json::Value full;
    c.Write(full, true);
    Json::Value nos = full["service"][0];
    EXPECT_EQ(ParseJson(R"({"id": "nos", "name": "Management:HTTP", "port": 5000, "ext_port": 5000})"), nos);
    Json::Value https = full["service"][8];
    EXPECT_EQ(ParseJson(R"j({"id": "https", "name": "Web Server (HTTPS)", "port": 443})j"), https);
}

TEST_F(ServiceListTest, RelayOffSupportOnListsOnlySupportEntries) {
    SetInfo(root, "runrelayd", "no");
    RelaydConf c(nullptr);
    c.supportChannel.SetEnabled(true);
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "stale", "port": 1})"), false));
    c.GenServiceConf();
    ASSERT_FALSE(c.services.empty());
    for (const ServiceConf& s : c.services) EXPECT_EQ(0u, s.id.rfind("support_", 0)) << s.id;
    EXPECT_NE(c.services.end(), c.GetServiceById("support_nos"));
    EXPECT_NE(c.services.end(), c.GetServiceById("support_http"));
}

TEST_F(ServiceListTest, RelayOnSupportOffListsOnlyPlainEntries) {
    SetInfo(root, "runrelayd", "yes");
    RelaydConf c(nullptr);
    c.GenServiceConf();
    // With no settings the HTTP portal is on too (no redirect to HTTPS).
    std::vector<std::tuple<std::string, int, int>> expected = {
        {"nos", 5000, -1}, {"http", 80, -1}, {"nos_portal", 5000, -1}};
    EXPECT_EQ(expected, Listed(c));
}

TEST_F(ServiceListTest, BothOffEmptiesTheList) {
    RelaydConf c(nullptr);
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "stale", "port": 1})"), false));
    c.GenServiceConf();
    EXPECT_TRUE(c.services.empty());
    EXPECT_TRUE(root.exists(kPermissionFile));
}

TEST_F(ServiceListTest, LookupIsExactAndFirstWins) {
    RelaydConf c(nullptr);
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "nos", "port": 1})"), false));
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "nos", "port": 2})"), false));
    ASSERT_NE(c.services.cend(), c.GetServiceById("nos"));
    EXPECT_EQ(1, c.GetServiceById("nos")->port);
    EXPECT_EQ(c.services.cend(), c.GetServiceById("NOS"));
    EXPECT_EQ(c.services.cend(), c.GetServiceById("no"));
    EXPECT_EQ(c.services.cend(), c.GetServiceById(""));
}

TEST_F(ServiceListTest, AddServiceById) {
    RelaydConf c(nullptr);
    EXPECT_TRUE(c.AddServiceById("nos"));
    EXPECT_TRUE(root.exists(kPermissionFile));
    ASSERT_EQ(1u, c.services.size());
    EXPECT_EQ(5000, c.services.front().port);
    c.services.front().ext_port = 77;
    EXPECT_TRUE(c.AddServiceById("nos"));
    ASSERT_EQ(1u, c.services.size());
    EXPECT_EQ(77, c.services.front().ext_port);
}

TEST_F(ServiceListTest, AddInvalidServiceIsReported) {
    RelaydConf c(nullptr);
    StderrCapture cap;
    EXPECT_FALSE(c.AddServiceById("nosuch"));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "invalid service config: 0")) << log;
    EXPECT_TRUE(c.services.empty());
}

TEST_F(ServiceListTest, AddNeedsThePermission) {
    SetInfo(root, "runHTTPS", "yes");
    root.write(kPermissionFile, R"([{"id": "file_sharing", "enabled": false}])");
    RelaydConf c(nullptr);
    EXPECT_FALSE(c.AddServiceById("file_sharing"));
    EXPECT_TRUE(c.services.empty());
    EXPECT_TRUE(c.AddServiceById("support_file_sharing"));
    EXPECT_TRUE(c.AddServiceById("http"));
    EXPECT_EQ(2u, c.services.size());
    root.write(kPermissionFile, R"([{"id": "file_sharing", "enabled": true}])");
    EXPECT_TRUE(c.AddServiceById("file_sharing"));
    EXPECT_EQ(3u, c.services.size());
}

TEST_F(ServiceListTest, AddSwitchedOffRowFails) {
    SetInfo(root, "runHTTPS", "no");
    root.write(kPermissionFile, R"([{"id": "mobile_apps", "enabled": true}])");
    RelaydConf c(nullptr);
    EXPECT_FALSE(c.AddServiceById("nos_https"));
    EXPECT_TRUE(c.AddServiceById("nos"));
}

TEST_F(ServiceListTest, RemoveServiceById) {
    RelaydConf c(nullptr);
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "a", "port": 1})"), false));
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "b", "port": 2})"), false));
    c.services.push_back(ServiceConf(ParseJson(R"({"id": "a", "port": 3})"), false));
    EXPECT_FALSE(c.RemoveServiceById("A"));
    EXPECT_TRUE(root.exists(kPermissionFile));
    EXPECT_TRUE(c.RemoveServiceById("a"));
    ASSERT_EQ(2u, c.services.size());
    EXPECT_EQ("b", c.services.front().id);
    EXPECT_EQ(3, c.services.back().port);
}

TEST_F(ServiceListTest, EveryEditRefreshesThePermissionFile) {
    RelaydConf c(nullptr);
    c.RemoveServiceById("x");
    EXPECT_EQ(6u, PermissionFile().size());
    // The first generation listed the photo permissions as not granted: that
    // choice is kept when the package comes.
    EnablePackage(root, "PictureDock");
    c.RemoveServiceById("x");
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": true}, {"id": "picturedock", "enabled": false},
                            {"id": "nos_portal", "enabled": true}, {"id": "photo_portal", "enabled": false}])"),
              PermissionFile());
    EnablePackage(root, "SyncDock");
    SetKey(root, "/var/packages/SyncDock/etc/setting.conf", "sydk_enable", "1");
    c.AddServiceById("x");
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": true}, {"id": "picturedock", "enabled": false},
                            {"id": "syncdock", "enabled": true}, {"id": "nos_portal", "enabled": true},
                            {"id": "photo_portal", "enabled": false}])"),
              PermissionFile());
}

TEST_F(ServiceListTest, RunKeyCheckIsAlwaysFalse) {
    SetInfo(root, "runHTTPS", "yes");
    RelaydConf c(nullptr);
    for (const SupportService* row = grgszSupportService; row->szName != nullptr; ++row)
        EXPECT_FALSE(c.CheckServiceRunKey(row)) << row->szName;
    EXPECT_FALSE(c.CheckServiceRunKey(nullptr));
}

}  // namespace
