// Any bytes as JSON handed to every section: Overwrite, IsValid and Write must
// not crash, and the written form must read back to the same section.
#include <json/reader.h>
#include <json/writer.h>

#include <algorithm>
#include <climits>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/config_alias.h>
#include <zeparelayd/daemon.h>

#include "fuzz_support.h"

using namespace ZEPA::Relay;
using fuzzsupport::Check;

namespace {

std::string Text(const Config& conf, bool full) {
    Json::Value out;
    Check(conf.Write(out, full), "Write returns true");
    return Json::FastWriter().write(out);
}

// Fills a fresh section from the value, then from its own written form.
template <typename Section, typename... Args>
void RoundTrip(const Json::Value& value, bool full, const char* name, Args... args) {
    Section conf(args...);
    Check(conf.Overwrite(value), name);
    conf.IsValid();
    Json::Value written;
    conf.Write(written, full);
    Section back(args...);
    back.Overwrite(written);
    Check(Text(conf, full) == Text(back, full), name);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    fuzzsupport::Use();  // token generation creates the device secret below it
    Json::Value value;
    fuzzsupport::Parse(std::string(reinterpret_cast<const char*>(data), size), value);

    RoundTrip<ServerConf>(value, true, "server section reads back", nullptr, nullptr);
    RoundTrip<MyHubConf>(value, true, "account section reads back");
    RoundTrip<SupportChannelConf>(value, true, "support channel reads back");
    RoundTrip<AliasConf>(value, false, "alias section reads back");
    RoundTrip<AliasConf>(value, true, "compact alias section reads back");
    RoundTrip<InterfaceConf>(value, true, "interface reads back");

    NetworkConf network(false);
    network.Overwrite(value);
    Check(network.IsValid(), "only valid interfaces are kept");
    Json::Value written;
    network.Write(written, true);
    NetworkConf back(false);
    back.Overwrite(written);
    Check(network == back && network.mode == back.mode, "network state reads back");

    AuthConf auth(false);
    Check(auth.Overwrite(value), "identity overwrite");
    Json::Value identity;
    auth.Write(identity, true);
    if (!auth.token.empty()) {
        AuthConf again(false);
        again.Overwrite(identity);
        Check(Text(auth, true) == Text(again, true), "identity reads back");
    }

    if (value.isObject() && value.isMember("server_alias")) {
        AliasConf alias;
        alias.Overwrite(value["server_alias"]);
        const long long t = alias.GetPollingTime();
        const long long poll = alias.GetPollSeconds();
        // [poll, 2 * poll - 1], cut at the largest int.
        Check(t >= poll && t <= std::min<long long>(2 * poll - 1, INT_MAX), "polling time in range");
    }
    return 0;
}
