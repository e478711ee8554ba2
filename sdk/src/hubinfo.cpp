#include "zepasdk/hubinfo.h"

#include <climits>
#include <cstdio>
#include <cstring>
#include <string>

#include "zepasdk/kv.h"

namespace {

const char kModelFile[] = "/etc.defaults/zepainfo.conf";
const char kVersionFile[] = "/etc.defaults/VERSION";

// Reads one non-empty key of a file below the system root.
bool ReadKey(const char* absPath, const char* key, std::string& out) {
    char path[PATH_MAX];
    if (ZEPASysRootPath(absPath, path, sizeof(path)) < 0) return false;
    char value[256] = {0};
    if (VLIBCFileGetKeyValue(path, key, value, sizeof(value)) <= 0) return false;
    out = value;
    return true;
}

}  // namespace

extern "C" {

int VLIBHubinfoUserAgentGet(const char* product, char* buf, int size) {
    if (buf != nullptr && size > 0) buf[0] = '\0';
    if (product == nullptr || product[0] == '\0' || buf == nullptr || size < 1) {
        VLIBCErrSet(ZEPA_ERR_BAD_PARAMETERS);
        return -1;
    }
    std::string model, version, build;
    if (!ReadKey(kModelFile, "upnpmodelname", model) || !ReadKey(kVersionFile, "productversion", version) ||
        !ReadKey(kVersionFile, "buildnumber", build)) {
        return -2;
    }
    std::string agent = std::string(product) + "/" + version + "-" + build + " (" + model + ")";
    if (agent.size() >= static_cast<size_t>(size)) {
        VLIBCErrSet(ZEPA_ERR_BUFFER_TOO_SMALL);
        return -3;
    }
    memcpy(buf, agent.c_str(), agent.size() + 1);
    VLIBCErrSet(ZEPA_ERR_NONE);
    return 0;
}

}  // extern "C"
