// Plain C entry points: switch the daemon's debug log and read the server id,
// from the relay configuration file, whether or not the daemon runs.
#define ZEPA_LOG_SOURCE "daemon"

#include <cstdio>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/daemon.h>

#include "common/paths.h"

using ZEPA::Relay::Daemon;
using ZEPA::Relay::RelaydConf;

namespace {

const int DEBUG_LEVEL = 7;

std::string ConfPath() { return ZEPA::Relay::Paths::Resolve(ZEPA::Relay::Paths::RELAYD_CONF); }

// Asks a running daemon to re-read its configuration; no daemon is fine.
void NotifyDaemon() {
    Daemon::LibInit();
    Daemon::Hup();
}

bool ListsService(const Json::Value& conf, const char* serviceId) {
    const Json::Value& services = conf["service"];
    if (!services.isArray()) return false;
    for (const Json::Value& service : services) {
        if (service.isObject() && service["id"].isString() && service["id"].asString() == serviceId)
            return true;
    }
    return false;
}

}  // namespace

int VLIBRelaydLogStart(const char* logFile) {
    if (logFile == nullptr) return -1;
    Json::Value conf;
    if (!RelaydConf::ReadJsonFile(ConfPath(), conf) || !conf.isObject()) return -1;
    conf["log_level"] = DEBUG_LEVEL;
    conf["log_file"] = logFile;
    if (!RelaydConf::WriteJsonFile(ConfPath(), conf)) return -1;
    NotifyDaemon();
    return 0;
}

int VLIBRelaydLogStop(void) {
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
    return ListsService(conf, serviceId) ? 1 : 0;
}
