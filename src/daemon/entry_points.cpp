// Plain C entry points: switch the daemon's debug log and read the server id,
// from the relay configuration file, whether or not the daemon runs.
#define ZEPA_LOG_SOURCE "daemon"

#include <cstdio>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>

#include "common/paths.h"
#include "config/config_lock.h"
#include "daemon/service_ids.h"

using ZEPA::Relay::Daemon;
using ZEPA::Relay::ListsServiceId;
using ZEPA::Relay::RelaydConf;
using ZEPA::Relay::ServiceIdMatch;

namespace {

const int DEBUG_LEVEL = 7;

std::string ConfPath() { return ZEPA::Relay::Paths::Resolve(ZEPA::Relay::Paths::RELAYD_CONF); }

// Asks a running daemon to re-read its configuration; no daemon is fine.
void NotifyDaemon() {
    Daemon::LibInit();
    Daemon::Hup();
}

}  // namespace

int VLIBRelaydLogStart(const char* logFile) {
    if (logFile == nullptr) return -1;
    ZEPA::Relay::ConfigWriteLock lock(ConfPath());
    if (!lock.Held()) return -1;
    Json::Value conf;
    if (!RelaydConf::ReadJsonFile(ConfPath(), conf) || !conf.isObject()) return -1;
    conf["log_level"] = DEBUG_LEVEL;
    conf["log_file"] = logFile;
    if (!RelaydConf::WriteJsonFile(ConfPath(), conf)) return -1;
    NotifyDaemon();
    return 0;
}

int VLIBRelaydLogStop(void) {
    ZEPA::Relay::ConfigWriteLock lock(ConfPath());
    if (!lock.Held()) return -1;
    Json::Value conf;
    // Deliberately no object check: a missing file is rewritten as null.
    if (!RelaydConf::ReadJsonFile(ConfPath(), conf)) return -1;
    if (conf.isObject()) {
        conf.removeMember("log_level");
        conf.removeMember("log_file");
    }
    if (!RelaydConf::WriteJsonFile(ConfPath(), conf)) return -1;
    NotifyDaemon();
    return 0;
}

int VLIBRelaydGetServerId(const char* serviceId, char* buf, unsigned int size) {
    const bool hasBuffer = buf != nullptr && size != 0;
    if (hasBuffer) buf[0] = '\0';
    Json::Value conf;
    if (!RelaydConf::ReadJsonFile(ConfPath(), conf) || !conf.isObject()) return -1;
    const std::string serverId = conf["serverID"].isString() ? conf["serverID"].asString() : std::string();
    if (serverId.empty()) return 0;
    if (hasBuffer) snprintf(buf, size, "%s", serverId.c_str());
    if (serviceId == nullptr) return 1;
    return ListsServiceId(conf, serviceId, ServiceIdMatch::STRING_ONLY) ? 1 : 0;
}
