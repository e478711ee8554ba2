#include <gtest/gtest.h>
#include <zepasdk/kv.h>
#include <zepasdk/service.h>

#include <string>
#include <vector>

#include "support/service_staging.h"
#include "support/test_support.h"

using zepatest::RootTest;

namespace {

std::vector<int> Parse(const std::string& text, int* result = nullptr) {
    int count = VLibParsePorts(text.c_str(), nullptr, 0);
    if (result != nullptr) *result = count;
    if (count < 0) return {};
    std::vector<int> ports(static_cast<size_t>(count) + 1, -7);
    int again = VLibParsePorts(text.c_str(), ports.data(), count);
    EXPECT_EQ(count, again);
    ports.resize(static_cast<size_t>(count));
    return ports;
}

TEST(ParsePorts, SinglesListsAndRanges) {
    EXPECT_EQ(std::vector<int>({80}), Parse("80"));
    EXPECT_EQ(std::vector<int>({80, 443, 5000, 5001, 5002}), Parse("80,443,5000-5002"));
    EXPECT_EQ(std::vector<int>({0, 65535, 7, 7}), Parse(" 0 , 65535,7-7, 7"));
}

TEST(ParsePorts, MalformedTextIsNegative) {
    for (const char* bad : {"", " ", "80,", ",80", "80,,81", "http", "80a", "-80", "80-", "5002-5000",
                            "65536", "1-2-3", "8 0", "+80"}) {
        int result = 0;
        Parse(bad, &result);
        EXPECT_EQ(-1, result) << bad;
        EXPECT_EQ(ZEPA_ERR_PARSE, VLIBCErrGet()) << bad;
    }
    EXPECT_EQ(-1, VLibParsePorts(nullptr, nullptr, 0));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
}

TEST(ParsePorts, TooSmallBufferIsNegative) {
    int ports[2] = {0, 0};
    EXPECT_EQ(-1, VLibParsePorts("1-3", ports, 2));
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_EQ(3, VLibParsePorts("1-3", nullptr, 0));
}

class ServiceTest : public RootTest {};

TEST_F(ServiceTest, MarkerFileEnablesService) {
    EXPECT_EQ(0, VLIBServiceIsEnabled("ssh-shell"));
    zepatest::EnableSystemService(root, "ssh-shell");
    EXPECT_EQ(1, VLIBServiceIsEnabled("ssh-shell"));
    EXPECT_EQ(0, VLIBServiceIsEnabled("ssh"));
}

TEST_F(ServiceTest, FolderIsNoMarker) {
    root.mkdir(std::string(ZEPA_SERVICE_MARKER_DIR) + "/webdav.enabled");
    EXPECT_EQ(0, VLIBServiceIsEnabled("webdav"));
}

TEST_F(ServiceTest, BadServiceNamesAreRejected) {
    for (const char* bad : {"", ".", "..", "../x", "a/b"}) {
        EXPECT_EQ(-1, VLIBServiceIsEnabled(bad)) << bad;
        EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    }
    EXPECT_EQ(-1, VLIBServiceIsEnabled(nullptr));
}

TEST_F(ServiceTest, RouterBasePathIsBelowTheRoot) {
    char buf[4096];
    int len = VLIBServiceRouterBasepathGet(buf, sizeof(buf));
    std::string expected = root.path(ZEPA_ROUTER_BASE_DIR);
    EXPECT_EQ(static_cast<int>(expected.size()), len);
    EXPECT_EQ(expected, buf);
    char small[4];
    EXPECT_EQ(-1, VLIBServiceRouterBasepathGet(small, sizeof(small)));
    EXPECT_STREQ("", small);
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
}

TEST_F(ServiceTest, RouterRuleFileIsSectioned) {
    zepatest::AddRouterRule(root, "web", "5000,5001", "80,443", "tcp", "1");
    char base[4096];
    ASSERT_GT(VLIBServiceRouterBasepathGet(base, sizeof(base)), 0);
    std::string file = std::string(base) + "/" + ZEPA_ROUTER_PF_RULES_FILE;
    char value[64];
    ASSERT_GT(VLIBCFileGetSectionValue(file.c_str(), "web", "protocol name", value, sizeof(value)), 0);
    EXPECT_STREQ("tcp", value);
    ASSERT_GT(VLIBCFileGetSectionValue(file.c_str(), "web", "s_port", value, sizeof(value)), 0);
    EXPECT_STREQ("5000,5001", value);
}

}  // namespace
