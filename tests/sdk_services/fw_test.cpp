#include <gtest/gtest.h>
#include <zepasdk/fw.h>
#include <zepasdk/kv.h>

#include <memory>
#include <string>

#include "support/service_staging.h"
#include "support/test_support.h"

using zepatest::FwDefinition;
using zepatest::RootTest;
using zepatest::WriteFwDefinition;

namespace {

struct FwFree {
    void operator()(ZEPAFwService* p) const { ZEPAFwServiceFree(p); }
};
using FwList = std::unique_ptr<ZEPAFwService, FwFree>;

FwList Enum(int& count) {
    ZEPAFwService* raw = reinterpret_cast<ZEPAFwService*>(0x1);
    count = ZEPAFwServiceEnum(&raw);
    return FwList(raw);
}

class FwServiceTest : public RootTest {};

TEST_F(FwServiceTest, MissingFolderIsAnError) {
    int count = 0;
    FwList list = Enum(count);
    EXPECT_EQ(-1, count);
    EXPECT_EQ(nullptr, list.get());
    EXPECT_EQ(ZEPA_ERR_FILE_NOT_FOUND, VLIBCErrGet());
}

TEST_F(FwServiceTest, EmptyFolderYieldsNoEntry) {
    root.mkdir(ZEPA_FW_SERVICE_DIR);
    root.write(std::string(ZEPA_FW_SERVICE_DIR) + "/readme.txt", "name=\"x\"\nprotocol=\"tcp\"\n");
    int count = 7;
    FwList list = Enum(count);
    EXPECT_EQ(0, count);
    EXPECT_EQ(nullptr, list.get());
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
}

TEST_F(FwServiceTest, NullListArgumentIsRejected) {
    EXPECT_EQ(-1, ZEPAFwServiceEnum(nullptr));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
}

TEST_F(FwServiceTest, ReadsEveryFieldInFolderOrder) {
    WriteFwDefinition(root, {"nso_https", " 5001 , 5002,", "tcp", "Management", "HTTPS", "Admin"}, "b.conf");
    WriteFwDefinition(root, {"dns", "53", "udp", "", "", "DNS"}, "a.conf");
    WriteFwDefinition(root, {"both", "", "all", "", "", ""}, "c.conf");
    WriteFwDefinition(root, {"none", "1", "icmp", "", "", ""}, "d.conf");
    int count = 0;
    FwList list = Enum(count);
    ASSERT_EQ(4, count);
    ZEPAFwService* rec = list.get();
    EXPECT_STREQ("dns", rec->szName);
    EXPECT_EQ(0u, rec->dwTcp);
    EXPECT_EQ(1u, rec->dwUdp);
    EXPECT_STREQ("DNS", rec->szAltTitle);
    rec = rec->pNext;
    EXPECT_STREQ("nso_https", rec->szName);
    EXPECT_EQ(1u, rec->dwTcp);
    EXPECT_EQ(0u, rec->dwUdp);
    EXPECT_STREQ("Management", rec->szTitle);
    EXPECT_STREQ("HTTPS", rec->szSubTitle);
    EXPECT_STREQ("Admin", rec->szAltTitle);
    ASSERT_NE(nullptr, rec->pPorts);
    ASSERT_EQ(2, rec->pPorts->nItem);
    EXPECT_STREQ("5001", VLIBCSzListGet(rec->pPorts, 0));
    EXPECT_STREQ("5002", VLIBCSzListGet(rec->pPorts, 1));
    rec = rec->pNext;
    EXPECT_STREQ("both", rec->szName);
    EXPECT_EQ(1u, rec->dwTcp);
    EXPECT_EQ(1u, rec->dwUdp);
    EXPECT_EQ(nullptr, rec->pPorts);
    rec = rec->pNext;
    EXPECT_STREQ("none", rec->szName);
    EXPECT_EQ(0u, rec->dwTcp);
    EXPECT_EQ(0u, rec->dwUdp);
    EXPECT_EQ(nullptr, rec->pNext);
}

TEST_F(FwServiceTest, FilesWithoutNameOrWithTooLongNameAreNoDefinitions) {
    root.write(std::string(ZEPA_FW_SERVICE_DIR) + "/noname.conf", "protocol=\"tcp\"\nports=\"1\"\n");
    WriteFwDefinition(root, {std::string(ZEPA_FW_NAME_MAX, 'n'), "1"}, "long.conf");
    WriteFwDefinition(root, {"ok", "1"});
    int count = 0;
    FwList list = Enum(count);
    ASSERT_EQ(1, count);
    EXPECT_STREQ("ok", list->szName);
}

TEST_F(FwServiceTest, FindIsExactAndFirstWins) {
    WriteFwDefinition(root, {"web", "80", "tcp", "", "", "first"}, "1.conf");
    WriteFwDefinition(root, {"web", "81", "tcp", "", "", "second"}, "2.conf");
    int count = 0;
    FwList list = Enum(count);
    ASSERT_EQ(2, count);
    ZEPAFwService* rec = ZEPAFWServiceFind(list.get(), "web");
    ASSERT_NE(nullptr, rec);
    EXPECT_STREQ("first", rec->szAltTitle);
    EXPECT_EQ(nullptr, ZEPAFWServiceFind(list.get(), "WEB"));
    EXPECT_EQ(ZEPA_ERR_NOT_FOUND, VLIBCErrGet());
    EXPECT_EQ(nullptr, ZEPAFWServiceFind(nullptr, "web"));
    EXPECT_EQ(ZEPA_ERR_BAD_PARAMETERS, VLIBCErrGet());
}

TEST_F(FwServiceTest, FreeAcceptsNull) { ZEPAFwServiceFree(nullptr); }

}  // namespace
