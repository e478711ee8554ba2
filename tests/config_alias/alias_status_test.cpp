#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <zeparelayd/config_alias.h>
#include <zeparelayd/daemon.h>

#include "support/test_support.h"

using namespace ZEPA::Relay;
using zepatest::LogContains;
using zepatest::ParseJson;

namespace {

const char STATUS[] = "/tmp/hopcloud_alias.status";

class AliasStatusTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        root.mkdir("/tmp");
    }
    Json::Value FileDoc() { return ParseJson(root.read(STATUS)); }
};

}  // namespace

TEST_F(AliasStatusTest, MissingFileGivesNullDocument) {
    AliasStatus st;
    std::string status = "keep", extra = "keep";
    EXPECT_FALSE(st.GetStatus("box", status, extra));
    EXPECT_EQ("keep", status);
    EXPECT_EQ("keep", extra);
    // A null document holds no usable alias name, which an empty name matches.
    EXPECT_TRUE(st.GetStatus("", status, extra));
    EXPECT_EQ("keep", status);
    EXPECT_EQ("keep", extra);
}

TEST_F(AliasStatusTest, SetStatusWithDumpWritesFile) {
    AliasStatus st;
    EXPECT_TRUE(st.SetStatus("box", "good", "detail", true));
    EXPECT_EQ(ParseJson("{\"alias_name\":\"box\",\"status\":\"good\",\"extra\":\"detail\"}"), FileDoc());
}

TEST_F(AliasStatusTest, SetStatusWithoutDumpLeavesFileAlone) {
    AliasStatus st;
    EXPECT_TRUE(st.SetStatus("box", "good", "", false));
    EXPECT_FALSE(root.exists(STATUS));
    std::string status, extra;
    EXPECT_TRUE(st.GetStatus("box", status, extra));
    EXPECT_EQ("good", status);
}

TEST_F(AliasStatusTest, EmptyStatusIsNotWritten) {
    root.write(STATUS, "{\"alias_name\":\"box\",\"status\":\"good\",\"extra\":\"\"}");
    AliasStatus st;
    zepatest::StderrCapture cap;
    EXPECT_FALSE(st.SetStatus("other", "", "x", true));
    std::string log = cap.stop();
    EXPECT_TRUE(LogContains(log, "config_alias:")) << log;
    EXPECT_TRUE(LogContains(log, "status is not string or empty")) << log;
    EXPECT_EQ("box", FileDoc()["alias_name"].asString());
}

TEST_F(AliasStatusTest, EmptyStatusCreatesNoFile) {
    AliasStatus st;
    EXPECT_FALSE(st.SetStatus("box", "", "x", true));
    EXPECT_FALSE(root.exists(STATUS));
}

TEST_F(AliasStatusTest, ReloadReadsOtherWriter) {
    AliasStatus reader;
    AliasStatus writer;
    writer.SetStatus("box", "not_found", "e", true);
    std::string status, extra;
    EXPECT_FALSE(reader.GetStatus("box", status, extra));
    EXPECT_TRUE(reader.Reload());
    EXPECT_TRUE(reader.GetStatus("box", status, extra));
    EXPECT_EQ("not_found", status);
    EXPECT_EQ("e", extra);
}

TEST_F(AliasStatusTest, GetStatusForOtherAliasLeavesOutputs) {
    root.write(STATUS, "{\"alias_name\":\"box\",\"status\":\"good\",\"extra\":\"x\"}");
    AliasStatus st;
    std::string status = "s0", extra = "e0";
    EXPECT_FALSE(st.GetStatus("Box", status, extra));
    EXPECT_FALSE(st.GetStatus("other", status, extra));
    EXPECT_FALSE(st.GetStatus("", status, extra));
    EXPECT_EQ("s0", status);
    EXPECT_EQ("e0", extra);
    EXPECT_TRUE(st.GetStatus("box", status, extra));
    EXPECT_EQ("good", status);
    EXPECT_EQ("x", extra);
}

TEST_F(AliasStatusTest, GetStatusLeavesOutputsForNonStringFields) {
    root.write(STATUS, "{\"alias_name\":\"box\",\"status\":5,\"extra\":null}");
    AliasStatus st;
    std::string status = "s0", extra = "e0";
    EXPECT_TRUE(st.GetStatus("box", status, extra));
    EXPECT_EQ("s0", status);
    EXPECT_EQ("e0", extra);
}

TEST_F(AliasStatusTest, NonStringAliasNameMatchesEmptyName) {
    root.write(STATUS, "{\"alias_name\":7,\"status\":\"good\"}");
    AliasStatus st;
    std::string status, extra = "e0";
    EXPECT_FALSE(st.GetStatus("7", status, extra));
    EXPECT_TRUE(st.GetStatus("", status, extra));
    EXPECT_EQ("good", status);
    EXPECT_EQ("e0", extra);
}

TEST_F(AliasStatusTest, ValidityChecksInOrder) {
    struct Case {
        const char* doc;
        const char* message;
    } cases[] = {
        {"[1]", "status should be array"},
        {"{\"status\":\"good\"}", "alias name is not object member"},
        {"{\"alias_name\":\"box\"}", "status is not object member"},
        {"{\"alias_name\":\"box\",\"status\":3}", "status is not string or empty"},
        {"{\"alias_name\":\"box\",\"status\":\"\"}", "status is not string or empty"},
    };
    for (const Case& c : cases) {
        root.write(STATUS, c.doc);
        AliasStatus st;
        zepatest::StderrCapture cap;
        EXPECT_FALSE(st.IsValid()) << c.doc;
        EXPECT_FALSE(st.DumpToFile()) << c.doc;
        std::string log = cap.stop();
        EXPECT_TRUE(LogContains(log, std::string("config_alias:")) && LogContains(log, c.message))
            << c.doc << " -> " << log;
        EXPECT_EQ(ParseJson(c.doc), FileDoc()) << c.doc;
    }
}

TEST_F(AliasStatusTest, AliasNameTypeIsNotChecked) {
    root.write(STATUS, "{\"alias_name\":7,\"status\":\"good\"}");
    AliasStatus st;
    EXPECT_TRUE(st.IsValid());
}

TEST_F(AliasStatusTest, SetStatusKeepsOtherKeys) {
    root.write(STATUS, "{\"alias_name\":\"box\",\"status\":\"good\",\"since\":12}");
    AliasStatus st;
    EXPECT_TRUE(st.SetStatus("box", "bad", "", true));
    Json::Value doc = FileDoc();
    EXPECT_EQ(12, doc["since"].asInt());
    EXPECT_EQ("bad", doc["status"].asString());
    EXPECT_EQ("", doc["extra"].asString());
}

TEST_F(AliasStatusTest, SetStatusReplacesBrokenDocument) {
    root.write(STATUS, "[\"x\"]");
    AliasStatus st;
    EXPECT_TRUE(st.SetStatus("box", "good", "", true));
    EXPECT_EQ("good", FileDoc()["status"].asString());
}

TEST_F(AliasStatusTest, CorruptFileIsRenamedAndReadsAsNothing) {
    root.write(STATUS, "alias_name=box");
    AliasStatus st;
    EXPECT_TRUE(root.exists(std::string(STATUS) + ".bad"));
    std::string status = "s0", extra;
    EXPECT_FALSE(st.GetStatus("box", status, extra));
    EXPECT_EQ("s0", status);
}

TEST_F(AliasStatusTest, DumpFailsWhenFolderMissing) {
    ASSERT_EQ(0, rmdir(root.path("/tmp").c_str()));
    AliasStatus st;
    zepatest::StderrCapture cap;
    EXPECT_FALSE(st.SetStatus("box", "good", "", true));
    EXPECT_TRUE(LogContains(cap.stop(), "open failed"));
    EXPECT_FALSE(root.exists(STATUS));
}

TEST_F(AliasStatusTest, PathIsTheStatusFileBelowTheRoot) {
    EXPECT_EQ(root.path(STATUS), AliasStatus::GetPath());
    AliasStatus st;
    ASSERT_TRUE(st.SetStatus("box", "good", "", true));
    EXPECT_TRUE(zepatest::FileExists(AliasStatus::GetPath()));
}
