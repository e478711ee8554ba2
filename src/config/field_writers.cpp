// Field writers: each changes one top-level key of the configuration file and
// keeps every other key, also those this configuration does not know.
#define ZEPA_LOG_SOURCE "config"

#include <string>

#include <zeparelayd/config.h>

#include "common/log.h"
#include "config/config_lock.h"

namespace ZEPA {
namespace Relay {

namespace {

// The section writes itself over the file's object of that key, keeping the
// object's other keys. A member that is no object cannot hold the section and
// is replaced.
void PutSection(Json::Value& value, const char* key, const Config& section, bool full) {
    if (!value.isMember(key) || !value[key].isObject()) value[key] = Json::Value();
    section.Write(value[key], full);
}

}  // namespace

// Checks the configuration, picks the file and reads it. A file that holds no
// JSON object gives an empty one to write into.
bool RelaydConf::BeginFieldWrite(const std::string& argPath, std::string& file, Json::Value& value) const {
    if (!IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "invalid relayd config");
        return false;
    }
    file = argPath.empty() ? path : argPath;
    ReadJsonFile(file, value);
    if (!value.isObject()) value = Json::Value(Json::objectValue);
    return true;
}

bool RelaydConf::WriteServerId(const std::string& argPath) {
    // Held from the read to the rename: another process's change in between
    // would otherwise be overwritten.
    ConfigWriteLock lock(argPath.empty() ? path : argPath);
    if (!lock.Held()) return false;
    std::string file;
    Json::Value value;
    if (!BeginFieldWrite(argPath, file, value)) return false;
    value["serverID"] = serverID;
    return WriteJsonFileWithNotification(file, value);
}

bool RelaydConf::WriteAliasName(const std::string& argPath, const std::string& aliasName) {
    // Held from the read to the rename: another process's change in between
    // would otherwise be overwritten.
    ConfigWriteLock lock(argPath.empty() ? path : argPath);
    if (!lock.Held()) return false;
    std::string file;
    Json::Value value;
    if (!BeginFieldWrite(argPath, file, value)) return false;
    alias.SetAliasName(aliasName);
    PutSection(value, "server_alias", alias, true);
    return WriteJsonFileWithNotification(file, value);
}

bool RelaydConf::WriteMyHubAccount(const std::string& argPath, const std::string& account) {
    // Held from the read to the rename: another process's change in between
    // would otherwise be overwritten.
    ConfigWriteLock lock(argPath.empty() ? path : argPath);
    if (!lock.Held()) return false;
    std::string file;
    Json::Value value;
    if (!BeginFieldWrite(argPath, file, value)) return false;
    myhub.SetMyHubAccount(account);
    PutSection(value, "server_myhub", myhub, true);
    return WriteJsonFileWithNotification(file, value);
}

bool RelaydConf::WriteControlServerHost(const std::string& argPath, const std::string& host) {
    // Held from the read to the rename: another process's change in between
    // would otherwise be overwritten.
    ConfigWriteLock lock(argPath.empty() ? path : argPath);
    if (!lock.Held()) return false;
    std::string file;
    Json::Value value;
    if (!BeginFieldWrite(argPath, file, value)) return false;
    serverControl.host = host;
    PutSection(value, "server_control", serverControl, false);
    return WriteJsonFileWithNotification(file, value);
}

}  // namespace Relay
}  // namespace ZEPA
