// Any bytes as the relay configuration file: loading never throws or
// crashes; a loaded configuration stores itself and loads back the same.
#include <json/writer.h>

#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <sstream>
#include <string>

#include <zeparelayd/config.h>

#include "fuzz_support.h"

using namespace ZEPA::Relay;
using fuzzsupport::Check;

namespace {

std::string Printed(const RelaydConf& conf) {
    std::ostringstream out;
    out << conf;
    return out.str();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string path = fuzzsupport::Put("/usr/zepa/etc/zeparelayd/zeparelayd.conf", data, size);
    RelaydConf conf(nullptr);
    bool loaded = conf.ReadConfigFile(path);
    Printed(conf);
    Json::Value raw;
    RelaydConf::ReadJsonFile(path, raw);
    RelaydConf other(nullptr);
    other.Overwrite(raw);
    other.IsValid();
    if (!loaded) return 0;
    // What loaded stores itself and loads again. The first store may drop what
    // the file alone carried (keys written only when present, services this
    // system does not offer); from then on store and load change nothing.
    const std::string stored = fuzzsupport::Use() + "/tmp/stored.conf";
    unlink(stored.c_str());
    Check(conf.WriteConfigFile(stored), "a loaded configuration is written");
    RelaydConf back(nullptr);
    Check(back.ReadConfigFile(stored), "the written configuration loads");
    Check(back.WriteConfigFile(stored), "a reloaded configuration is written");
    RelaydConf again(nullptr);
    Check(again.ReadConfigFile(stored), "the rewritten configuration loads");
    Check(Printed(back) == Printed(again), "store and load are stable");
    conf.WriteAliasName(stored, "fuzz");
    conf.WriteServerId(stored);
    return 0;
}
