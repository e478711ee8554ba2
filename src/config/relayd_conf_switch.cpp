// The relay's on/off switch and the time zone live in the system's main
// key/value file, not in the relay configuration.
#define ZEPA_LOG_SOURCE "config"

#include <strings.h>
#include <zepasdk/kv.h>

#include <cstring>
#include <string>

#include <zeparelayd/config.h>

#include "common/log.h"
#include "common/paths.h"

namespace ZEPA {
namespace Relay {

std::string RelaydConf::GetTimeZone() {
    char buf[256];
    memset(buf, 0, sizeof(buf));
    const std::string file = Paths::Resolve(Paths::ZEPAINFO_CONF);
    if (VLIBCFileGetKeyValue(file.c_str(), "timezone", buf, sizeof(buf)) < 1) return "";
    return buf;
}

bool RelaydConf::SetEnableConf(bool enable) const {
    const char* value = enable ? "yes" : "no";
    if (VLIBCINFOSetKeyValue("runrelayd", value) < 0) {
        ZLOG(ZEPA_LOG_ERR, "write zepainfo [runrelayd=%s] failed", value);
        return false;
    }
    return true;
}

bool RelaydConf::GetEnableConf() const {
    char buf[8];
    memset(buf, 0, sizeof(buf));
    const std::string file = Paths::Resolve(Paths::ZEPAINFO_CONF);
    if (VLIBCFileGetKeyValue(file.c_str(), "runrelayd", buf, sizeof(buf)) < 1) strcpy(buf, "no");
    return strcasecmp(buf, "yes") == 0;
}

}  // namespace Relay
}  // namespace ZEPA
