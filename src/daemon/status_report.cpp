// Status(false): the command-line report of the daemon's state and alias.
#define ZEPA_LOG_SOURCE "daemon"

#include <json/writer.h>
#include <unistd.h>

#include <iostream>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/config_alias.h>

#include <zeparelayd/errors.h>

#include "common/log.h"
#include "common/paths.h"
#include "daemon/status_file.h"

namespace ZEPA {
namespace Relay {

namespace {

void PrintLine(const char* label, const std::string& value) { std::cout << label << value << std::endl; }

// The alias name as a RelaydConf built from confPath would hold it. Only the
// alias section is read: a whole configuration re-derives every service's
// ports from the system (firewall definitions, router rules), which a status
// line does not show and which grows with the router rules.
std::string AliasNameOf(const std::string& confPath) {
    AliasConf alias;
    Json::Value value;
    const bool existed = access(confPath.c_str(), F_OK) == 0;
    if (!RelaydConf::ReadJsonFile(confPath, value)) return alias.GetAliasName();
    // A corrupt file is set aside by the reader and counts as no configuration.
    if (existed && access(confPath.c_str(), F_OK) != 0) return alias.GetAliasName();
    if (value.isObject() && value.isMember("server_alias")) alias.Overwrite(value["server_alias"]);
    return alias.GetAliasName();
}

}  // namespace

int PrintStatusReport() {
    AliasStatus aliasStatus;
    const std::string aliasName = AliasNameOf(Paths::Resolve(Paths::RELAYD_CONF));
    std::string serverId, state, error;
    if (!Daemon::GetStatus(serverId, state, error, nullptr)) {
        std::cout << "get status failed" << std::endl;
        return RELAYD_RESULT_UNAVAILABLE;
    }
    std::string aliasWord, unused;
    aliasStatus.GetStatus(aliasName, aliasWord, unused);
    PrintLine("serverID: ", serverId);
    PrintLine("state: ", state);
    PrintLine("alias: ", aliasName);
    PrintLine("alias_status: ", aliasWord);
    if (error != "success") PrintLine("error: ", error);
    return state == "not_running" ? RELAYD_RESULT_NOT_RUNNING : RELAYD_RESULT_OK;
}

int Daemon::Status(bool debug) {
    if (debug) {
        Json::Value dump;
        int ret = DebugStatus(dump);
        if (ret == RELAYD_RESULT_OK) {
            Json::FastWriter writer;
            std::cout << writer.write(dump) << std::flush;
        } else {
            std::cout << "get status failed" << std::endl;
        }
        return ret;
    }
    return PrintStatusReport();
}

}  // namespace Relay
}  // namespace ZEPA
