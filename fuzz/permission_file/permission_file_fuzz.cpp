// Any bytes as the service permission file: the mask is read without a
// crash, holds only known permissions, and its JSON form maps back to it.
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include <zeparelayd/config.h>
#include <zeparelayd/permission.h>

#include "fuzz_support.h"

using namespace ZEPA::Relay;
using fuzzsupport::Check;

namespace {

const unsigned KNOWN = 0x3F;

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const std::string path = fuzzsupport::Put("/usr/zepa/etc/zeparelayd/services.conf", data, size);
    ServicePermission permission(false);
    const unsigned mask = permission.GetMask();
    Check((mask & ~KNOWN) == 0, "only known permissions are granted");
    Check(ServicePermission::JsonToMask(ServicePermission::MaskToJson(mask)) == mask, "mask reads back");
    Json::Value value;
    RelaydConf::ReadJsonFile(path, value);
    Check((ServicePermission::JsonToMask(value) & ~KNOWN) == 0, "only known permissions from any value");
    return 0;
}
