#include <gtest/gtest.h>
#include <zepasdk/fw.h>

#include <zeparelayd/config.h>

#include "support/fake_sdk/fake_sdk.h"
#include "support/service_staging.h"
#include "support/test_support.h"

namespace {

// A broken firewall layer's lookup: whatever is asked, a definition whose
// name is empty.
PZEPAFwService FindUnnamed(PZEPAFwService /*pList*/, const char* /*szName*/) {
    static ZEPAFwService unnamed = {};
    unnamed.dwTcp = 1;
    return &unnamed;
}

class UnnamedDefinitionTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        zepafake::Reset();
        zepafake::Fake().fwServiceFind = FindUnnamed;
    }
    void TearDown() override {
        zepafake::Reset();
        RootTest::TearDown();
    }
};

TEST_F(UnnamedDefinitionTest, DefinitionWithoutNameAborts) {
    // "fast": the dying child is forked here and shares this test's root,
    // which TearDown removes; a re-run child would leave a root of its own.
    GTEST_FLAG_SET(death_test_style, "fast");
    zepatest::WriteStockFwDefinitions(root);
    EXPECT_DEATH(ZEPA::Relay::ServiceConf("nos"), "Assertion .'.0' != \\*\\(pService->szName\\)' failed");
}

TEST_F(UnnamedDefinitionTest, NoDefinitionsFailsBeforeTheLookup) {
    ZEPA::Relay::ServiceConf s("nos");
    EXPECT_FALSE(s.IsValid());
}

}  // namespace
