// Any bytes as the status file and the alias status file, read as the tools
// read them: no crash, no signal to anyone but a live daemon, and results
// only from the documented set.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include <zeparelayd/config_alias.h>
#include <zeparelayd/daemon.h>

#include "fuzz_support.h"

using namespace ZEPA::Relay;
using fuzzsupport::Check;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    fuzzsupport::Put("/tmp/.zeparelayd.status", data, size);
    Json::Value out;
    int ret = Daemon::GetStatus(out);
    Check(ret == 0 || ret == 1 || ret == 255, "status result");
    std::string id, state, error;
    if (Daemon::GetStatus(id, state, error, nullptr)) Check(!state.empty(), "a readable file is worded");
    Daemon::GetStatus(id, state, error, "nos_portal");
    ret = Daemon::UpdateAlias();
    Check(ret == 0 || ret == 1 || ret == 255, "alias trigger result");

    fuzzsupport::Put("/tmp/hopcloud_alias.status", data, size);
    AliasStatus alias;
    std::string word, extra;
    bool valid = alias.IsValid();
    bool found = alias.GetStatus("", word, extra);
    (void)valid;
    (void)found;
    return 0;
}
