#include <gtest/gtest.h>
#include <zepasdk/hubinfo.h>
#include <zepasdk/kv.h>

#include <cstring>
#include <string>

#include "support/test_support.h"

namespace {

class HubinfoTest : public zepatest::RootTest {
protected:
    void WriteDeviceFiles() {
        root.write("/etc.defaults/zepainfo.conf", "unique=\"zepa_x\"\nupnpmodelname=\"ZS220\"\n");
        root.write("/etc.defaults/VERSION",
                   "majorversion=\"7\"\nproductversion=\"7.2\"\nbuildnumber=\"64570\"\n");
    }
    int Get(const char* product, int size = 1024) {
        memset(buf, 'x', sizeof(buf));
        return VLIBHubinfoUserAgentGet(product, buf, size);
    }
    char buf[1024];
};

TEST_F(HubinfoTest, BuildsTheAgentFromModelAndVersion) {
    WriteDeviceFiles();
    EXPECT_EQ(0, Get("Farlink"));
    EXPECT_STREQ("Farlink/7.2-64570 (ZS220)", buf);
    EXPECT_EQ(ZEPA_ERR_NONE, VLIBCErrGet());
}

TEST_F(HubinfoTest, ProductWordLeadsTheAgent) {
    WriteDeviceFiles();
    EXPECT_EQ(0, Get("Other"));
    EXPECT_STREQ("Other/7.2-64570 (ZS220)", buf);
}

TEST_F(HubinfoTest, MissingFilesFailWithAnEmptyBuffer) {
    EXPECT_EQ(-2, Get("Farlink"));
    EXPECT_STREQ("", buf);
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
}

TEST_F(HubinfoTest, MissingVersionFileFails) {
    root.write("/etc.defaults/zepainfo.conf", "upnpmodelname=\"ZS220\"\n");
    EXPECT_EQ(-2, Get("Farlink"));
    EXPECT_STREQ("", buf);
}

TEST_F(HubinfoTest, MissingOrEmptyKeyFails) {
    WriteDeviceFiles();
    root.write("/etc.defaults/VERSION", "productversion=\"7.2\"\nbuildnumber=\"\"\n");
    EXPECT_EQ(-2, Get("Farlink"));
    root.write("/etc.defaults/zepainfo.conf", "modelname=\"ZS220\"\n");
    root.write("/etc.defaults/VERSION", "productversion=\"7.2\"\nbuildnumber=\"1\"\n");
    EXPECT_EQ(-2, Get("Farlink"));
    EXPECT_EQ(ZEPA_ERR_KEY_NOT_FOUND, VLIBCErrGet());
}

TEST_F(HubinfoTest, FilesOutsideTheRootAreNotRead) {
    // The real system's files never count: only the root's.
    EXPECT_EQ(-2, Get("Farlink"));
}

TEST_F(HubinfoTest, TooSmallBufferFails) {
    WriteDeviceFiles();
    const int exact = static_cast<int>(strlen("Farlink/7.2-64570 (ZS220)"));
    EXPECT_EQ(-3, Get("Farlink", exact));
    EXPECT_STREQ("", buf);
    EXPECT_EQ(ZEPA_ERR_BUFFER_TOO_SMALL, VLIBCErrGet());
    EXPECT_EQ(0, Get("Farlink", exact + 1));
    EXPECT_STREQ("Farlink/7.2-64570 (ZS220)", buf);
}

TEST_F(HubinfoTest, BadArgumentsFail) {
    WriteDeviceFiles();
    EXPECT_EQ(-1, Get(nullptr));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
    EXPECT_EQ(-1, Get(""));
    EXPECT_EQ(-1, Get("Farlink", 0));
    EXPECT_EQ('x', buf[0]);  // a zero size writes nothing
    EXPECT_EQ(-1, VLIBHubinfoUserAgentGet("Farlink", nullptr, 10));
}

}  // namespace
