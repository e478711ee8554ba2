// Loading and storing the whole relay configuration file, and the notice to
// the administrators that follows a change of the server id.
#define ZEPA_LOG_SOURCE "config"

#include <unistd.h>
#include <zepasdk/kv.h>

#include <string>

#include <zeparelayd/config.h>

#include "common/log.h"
#include "common/paths.h"
#include "config/config_lock.h"

namespace ZEPA {
namespace Relay {

namespace {

// Written back only where the file already has them, so that defaults held in
// memory do not appear in a file that never named them.
const char* const kKeysOnlyWhenPresent[] = {"log_level", "log_file", "server_global", "server_waitcmd"};

void NotifyServerIdChange() {
    std::string notifier = Paths::Resolve(Paths::NOTIFIER);
    // The notifier's result is not ours to act on.
    VLIBCExec(notifier.c_str(), "@administrators", "relayservice:relayservice_serverid_change_title",
              "relayservice:relayservice_serverid_change_msg", NULL);
}

}  // namespace

bool RelaydConf::ReadConfigFile(const std::string& confPath) {
    Json::Value value;
    bool existed = access(confPath.c_str(), F_OK) == 0;
    if (!ReadJsonFile(confPath, value)) {
        ZLOG(ZEPA_LOG_ERR, "invalid config: %s", confPath.c_str());
        return false;
    }
    // The reader sets a corrupt file aside: whatever the parser built from it
    // before the error is no configuration.
    if (existed && access(confPath.c_str(), F_OK) != 0) value = Json::Value();
    path = confPath;
    if (!Overwrite(value)) {
        ZLOG(ZEPA_LOG_ERR, "invalid relayd config: can not overwrite default");
        return false;
    }
    if (!IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "invalid relayd config");
        return false;
    }
    return true;
}

// Rebuilds the file from memory: keys of the file that this configuration
// does not know are dropped on purpose.
bool RelaydConf::WriteConfigFile(const std::string& confPath) {
    if (!IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "invalid relayd config");
        return false;
    }
    ConfigWriteLock lock(confPath);
    if (!lock.Held()) return false;
    Json::Value old;
    if (!ReadJsonFile(confPath, old)) {
        ZLOG(ZEPA_LOG_WARNING, "drop crrupted config: [%s]", confPath.c_str());
        old = Json::Value(Json::objectValue);
    }
    Json::Value value;
    if (!Write(value, false)) return false;
    for (const char* key : kKeysOnlyWhenPresent) {
        if (!old.isObject() || !old.isMember(key)) value.removeMember(key);
    }
    return WriteJsonFileWithNotification(confPath, value);
}

bool RelaydConf::WriteConfigFile() { return WriteConfigFile(path); }

bool RelaydConf::WriteJsonFileWithNotification(const std::string& filePath, const Json::Value& value) {
    if (!WriteJsonFile(filePath, value)) return false;
    if (!serverIdChanged) return true;
    NotifyServerIdChange();
    serverIdChanged = false;
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
