#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/permission.h>

#include "support/service_staging.h"
#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::EnablePackage;
using zepatest::EnableSystemService;
using zepatest::ParseJson;
using zepatest::RootTest;
using zepatest::SetInfo;
using zepatest::SetKey;

namespace {

constexpr const char kPermissionFile[] = "/usr/zepa/etc/zeparelayd/services.conf";

const SupportService* Row(const char* name) {
    for (const SupportService* row = grgszSupportService; row->szName != nullptr; ++row)
        if (strcmp(row->szName, name) == 0) return row;
    ADD_FAILURE() << "no row " << name;
    return nullptr;
}

TEST(PermissionValues, MaskValuesOfTheSixKeys) {
    EXPECT_EQ(0x1u, ServicePermission::GetMaskVal("mobile_apps"));
    EXPECT_EQ(0x2u, ServicePermission::GetMaskVal("picturedock"));
    EXPECT_EQ(0x4u, ServicePermission::GetMaskVal("syncdock"));
    EXPECT_EQ(0x8u, ServicePermission::GetMaskVal("file_sharing"));
    EXPECT_EQ(0x10u, ServicePermission::GetMaskVal("nos_portal"));
    EXPECT_EQ(0x20u, ServicePermission::GetMaskVal("photo_portal"));
    EXPECT_EQ(0u, ServicePermission::GetMaskVal("Mobile_apps"));
    EXPECT_EQ(0u, ServicePermission::GetMaskVal(""));
    EXPECT_EQ(0u, ServicePermission::GetMaskVal("mobile_apps "));
}

TEST(PermissionValues, JsonValueOfOnePermission) {
    EXPECT_EQ(ParseJson(R"({"id": "syncdock", "enabled": true})"),
              ServicePermission::GetJsonVal(0x6, 0x4, "syncdock"));
    EXPECT_EQ(ParseJson(R"({"id": "syncdock", "enabled": false})"),
              ServicePermission::GetJsonVal(0x3, 0x4, "syncdock"));
}

TEST(PermissionValues, MaskToJsonListsAllSixInOrder) {
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": true}, {"id": "picturedock", "enabled": false},
                            {"id": "syncdock", "enabled": false}, {"id": "file_sharing", "enabled": false},
                            {"id": "nos_portal", "enabled": false}, {"id": "photo_portal", "enabled": true}])"),
              ServicePermission::MaskToJson(0x21));
    Json::Value none = ServicePermission::MaskToJson(0);
    ASSERT_EQ(6u, none.size());
    for (const Json::Value& e : none) EXPECT_FALSE(e["enabled"].asBool());
}

TEST(PermissionValues, JsonToMask) {
    EXPECT_EQ(0x4u, ServicePermission::JsonToMask(ParseJson(
                        R"([{"id": "syncdock", "enabled": true}, {"id": "file_sharing", "enabled": 1}])")));
    EXPECT_EQ(0u, ServicePermission::JsonToMask(ParseJson(R"({"id": "syncdock", "enabled": true})")));
    EXPECT_EQ(0u, ServicePermission::JsonToMask(ParseJson("[]")));
    EXPECT_EQ(0u, ServicePermission::JsonToMask(Json::Value()));
    EXPECT_EQ(0x21u, ServicePermission::JsonToMask(ParseJson(
                         R"([{"id": "mobile_apps", "enabled": true}, {"id": "photo_portal", "enabled": true},
                             {"id": "nos_portal", "enabled": false}, {"id": "other", "enabled": true},
                             {"id": 16, "enabled": true}, "nos_portal", 3, {"enabled": true}])")));
    EXPECT_EQ(ServicePermission::JsonToMask(ServicePermission::MaskToJson(0x3F)), 0x3Fu);
}

class PermissionTest : public RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        root.mkdir("/usr/zepa/etc/zeparelayd");
    }
    Json::Value FileContent() { return ParseJson(root.read(kPermissionFile)); }
    void WritePermissions(const std::string& json) { root.write(kPermissionFile, json); }
};

TEST_F(PermissionTest, NoFileGivesMaskZero) {
    ServicePermission p(false);
    EXPECT_EQ(0u, p.GetMask());
    EXPECT_FALSE(root.exists(kPermissionFile));
}

TEST_F(PermissionTest, ConstructorReadsMaskFromFile) {
    WritePermissions(R"([{"id": "mobile_apps", "enabled": true}, {"id": "syncdock", "enabled": true},
                         {"id": "picturedock", "enabled": false}])");
    EXPECT_EQ(0x5u, ServicePermission(false).GetMask());
}

TEST_F(PermissionTest, MaskZeroRefusesEveryRowWithoutExtraBits) {
    SetInfo(root, "runHTTPS", "yes");
    SetInfo(root, "runWebHTTPS", "yes");
    SetInfo(root, "runtelnet", "yes");
    SetInfo(root, "supportssh", "yes");
    EnableSystemService(root, "ssh-shell");
    ServicePermission p(false);
    ASSERT_EQ(0u, p.GetMask());
    for (const SupportService* row = grgszSupportService; row->szName != nullptr; ++row)
        EXPECT_FALSE(p.IsServiceEnabled(row, 0)) << row->szName;
    EXPECT_TRUE(p.IsServiceEnabled(Row("http"), 0xFFFFFFFF));
    EXPECT_TRUE(p.IsServiceEnabled(Row("ssh"), 0xFFFFFFFF));
    EXPECT_TRUE(p.IsServiceEnabled(Row("nos"), 0xFFFFFFFF));
}

TEST_F(PermissionTest, AnyPermissionLetsTheSharedRowsPass) {
    WritePermissions(R"([{"id": "photo_portal", "enabled": true}])");
    ServicePermission p(false);
    EXPECT_TRUE(p.IsServiceEnabled(Row("http"), 0));
    EXPECT_FALSE(p.IsServiceEnabled(Row("nos"), 0));
    EXPECT_TRUE(p.IsServiceEnabled(Row("nos"), 0x1));
}

TEST_F(PermissionTest, SettingsSwitchOfARow) {
    ServicePermission p(false);
    EXPECT_FALSE(p.IsServiceEnabled(Row("nos_https"), 0xFFFFFFFF));
    SetInfo(root, "runHTTPS", "no");
    EXPECT_FALSE(p.IsServiceEnabled(Row("nos_https"), 0xFFFFFFFF));
    SetInfo(root, "runHTTPS", "Yes");
    EXPECT_TRUE(p.IsServiceEnabled(Row("nos_https"), 0xFFFFFFFF));
    EXPECT_TRUE(p.IsServiceEnabled(Row("file_sharing"), 0xFFFFFFFF));
}

TEST_F(PermissionTest, PortalRowFollowsRedirectAndHttps) {
    ServicePermission p(false);
    const SupportService* portal = Row("nos_portal");
    EXPECT_TRUE(p.IsServiceEnabled(portal, 0xFFFFFFFF)) << "no redirect key: the default is no redirect";
    SetInfo(root, "redirectHTTPS", "no");
    EXPECT_TRUE(p.IsServiceEnabled(portal, 0xFFFFFFFF));
    SetInfo(root, "redirectHTTPS", "yes");
    SetInfo(root, "runHTTPS", "no");
    EXPECT_TRUE(p.IsServiceEnabled(portal, 0xFFFFFFFF));
    SetInfo(root, "runHTTPS", "yes");
    EXPECT_FALSE(p.IsServiceEnabled(portal, 0xFFFFFFFF));
}

TEST_F(PermissionTest, SystemServiceMustBeEnabled) {
    ServicePermission p(false);
    SetInfo(root, "supportssh", "yes");
    EXPECT_FALSE(p.IsServiceEnabled(Row("ssh"), 0xFFFFFFFF));
    EXPECT_FALSE(p.IsServiceEnabled(Row("webdav_http"), 0xFFFFFFFF));
    EnableSystemService(root, "ssh-shell");
    EnableSystemService(root, "webdav-httpd-pure");
    EXPECT_TRUE(p.IsServiceEnabled(Row("ssh"), 0xFFFFFFFF));
    EXPECT_TRUE(p.IsServiceEnabled(Row("webdav_http"), 0xFFFFFFFF));
    EXPECT_FALSE(p.IsServiceEnabled(Row("webdavs_https"), 0xFFFFFFFF));
    SetInfo(root, "supportssh", "no");
    EXPECT_FALSE(p.IsServiceEnabled(Row("ssh"), 0xFFFFFFFF));
}

TEST_F(PermissionTest, PackageMustBeEnabled) {
    ServicePermission p(false);
    EXPECT_FALSE(p.IsServiceEnabled(Row("photo_http"), 0xFFFFFFFF));
    EXPECT_FALSE(p.IsServiceEnabled(Row("audio_http"), 0xFFFFFFFF));
    EnablePackage(root, "PictureDock");
    EXPECT_TRUE(p.IsServiceEnabled(Row("photo_http"), 0xFFFFFFFF));
    EXPECT_TRUE(p.IsServiceEnabled(Row("photo_portal_http"), 0xFFFFFFFF));
    EXPECT_FALSE(p.IsServiceEnabled(Row("photo_https"), 0xFFFFFFFF));
    SetKey(root, "/var/packages/SyncDock/etc/setting.conf", "sydk_enable", "1");
    EXPECT_FALSE(p.IsServiceEnabled(Row("syncdock"), 0xFFFFFFFF));
    EnablePackage(root, "SyncDock");
    EXPECT_TRUE(p.IsServiceEnabled(Row("syncdock"), 0xFFFFFFFF));
}

// With no settings at all the management row and the HTTP portal row (no
// redirect by default) are the only ones on.
TEST_F(PermissionTest, FirstGenerationListsAllSixThenOnlyOffered) {
    ServicePermission p(true);
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": true}, {"id": "picturedock", "enabled": false},
                            {"id": "syncdock", "enabled": false}, {"id": "file_sharing", "enabled": false},
                            {"id": "nos_portal", "enabled": true}, {"id": "photo_portal", "enabled": false}])"),
              FileContent());
    EXPECT_EQ(0x11u, p.GetMask());
    ServicePermission again(true);
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": true}, {"id": "nos_portal", "enabled": true}])"),
              FileContent());
    EXPECT_EQ(0x11u, again.GetMask());
}

TEST_F(PermissionTest, HttpsSwitchOffersFileSharingAndPortal) {
    // The portal row is off only with the redirect on and HTTPS running; the
    // HTTPS switch then also brings file sharing and the HTTPS portal.
    SetInfo(root, "redirectHTTPS", "yes");
    SetInfo(root, "runHTTPS", "yes");
    ServicePermission p(true);
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": true}, {"id": "picturedock", "enabled": false},
                            {"id": "syncdock", "enabled": false}, {"id": "file_sharing", "enabled": true},
                            {"id": "nos_portal", "enabled": true}, {"id": "photo_portal", "enabled": false}])"),
              FileContent());
}

TEST_F(PermissionTest, RegenerationKeepsChoicesAndGrantsNewOffers) {
    WritePermissions(R"([{"id": "nos_portal", "enabled": true}, {"id": "mobile_apps", "enabled": false},
                         {"id": "mobile_apps", "enabled": true}, {"id": "photo_portal", "enabled": true}])");
    EnablePackage(root, "PictureDock");
    ServicePermission p(true);
    EXPECT_EQ(ParseJson(R"([{"id": "mobile_apps", "enabled": false}, {"id": "picturedock", "enabled": true},
                            {"id": "nos_portal", "enabled": true}, {"id": "photo_portal", "enabled": true}])"),
              FileContent());
    EXPECT_EQ(0x32u, p.GetMask());
}

TEST_F(PermissionTest, OldEntryWithoutBooleanIsNotGranted) {
    WritePermissions(R"([{"id": "mobile_apps"}, {"id": "nos_portal", "enabled": "yes"}])");
    ServicePermission p(true);
    EXPECT_EQ(
        ParseJson(R"([{"id": "mobile_apps", "enabled": false}, {"id": "nos_portal", "enabled": false}])"),
        FileContent());
    EXPECT_EQ(0u, p.GetMask());
}

TEST_F(PermissionTest, CorruptFileIsReplacedByFirstGeneration) {
    WritePermissions("mobile_apps=true");
    ServicePermission p(true);
    EXPECT_TRUE(root.exists(std::string(kPermissionFile) + ".bad"));
    EXPECT_EQ(6u, FileContent().size());
    EXPECT_EQ(0x11u, p.GetMask());
}

TEST_F(PermissionTest, FailedWriteLeavesMaskUnchanged) {
    WritePermissions(R"([{"id": "syncdock", "enabled": true}])");
    ServicePermission p(false);
    ASSERT_EQ(0x4u, p.GetMask());
    // A file where the folder should be makes the temporary file impossible.
    ASSERT_EQ(0, system(("rm -rf '" + root.path("/usr/zepa/etc/zeparelayd") + "'").c_str()));
    root.write("/usr/zepa/etc/zeparelayd", "");
    zepatest::StderrCapture cap;
    p.GenPermissionConf();
    std::string log = cap.stop();
    EXPECT_TRUE(zepatest::LogContains(log, "open failed [")) << log;
    EXPECT_EQ(0x4u, p.GetMask());
    EXPECT_EQ(0u, ServicePermission(true).GetMask());
}

}  // namespace
