// A private root holding the relay configuration's folder, with helpers on its file.
#ifndef ZEPARELAYD_TESTS_CONFIG_RELAYD_CONF_FILE_FIXTURE_H
#define ZEPARELAYD_TESTS_CONFIG_RELAYD_CONF_FILE_FIXTURE_H

#include <json/value.h>

#include <string>

#include "support/test_support.h"

namespace relaydtest {

constexpr const char kConf[] = "/usr/zepa/etc/zeparelayd/zeparelayd.conf";

class ConfFileTest : public zepatest::RootTest {
protected:
    void SetUp() override {
        RootTest::SetUp();
        root.mkdir("/usr/zepa/etc/zeparelayd");
    }
    std::string conf() const { return root.path(kConf); }
    void WriteConf(const std::string& text) { root.write(kConf, text); }
    Json::Value ConfOnDisk() const { return zepatest::ParseJson(root.read(kConf)); }
};

}  // namespace relaydtest

#endif
