// The whole relay configuration: defaults, merging from JSON, checks, the two
// written forms, reloading and the alias request's fields.
#define ZEPA_LOG_SOURCE "config"

#include <unistd.h>

#include <string>

#include <zeparelayd/config.h>

#include "common/log.h"
#include "common/paths.h"
#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

const char* const RelaydConf::GLOBAL_HOST = "global.zeparelay.example";

namespace {

constexpr int kDefaultLogLevel = 4;
constexpr const char kHttps[] = "https";
constexpr int kHttpsPort = 443;

ServerConf RelayServer() {
    ServerConf server(RelaydConf::GLOBAL_HOST, nullptr);
    server.protocol = kHttps;
    server.port = kHttpsPort;
    return server;
}

// The sections merged from the file, in this order, by their keys.
template <typename Fn>
void ForEachSectionKey(RelaydConf& conf, Fn fn) {
    fn("server_global", conf.serverGlobal);
    fn("server_control", conf.serverControl);
    fn("server_waitcmd", conf.serverWaitCmd);
    fn("server_alias", conf.alias);
    fn("server_myhub", conf.myhub);
    fn("support_channel", conf.supportChannel);
}

}  // namespace

RelaydConf::RelaydConf(const char* confPath)
    : enable(false),
      serverGlobal(RelayServer()),
      serverControl(RelayServer()),
      serverWaitCmd(GLOBAL_HOST, nullptr),
      network(false),
      auth(false),
      logLevel(kDefaultLogLevel),
      debug(false),
      serverIdChanged(false) {
    enable = GetEnableConf();
    // A file that cannot be used leaves the defaults; the reason is logged.
    if (confPath != nullptr) ReadConfigFile(confPath);
}

RelaydConf::~RelaydConf() = default;

bool RelaydConf::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return false;
    JsonTake::TakeAll(value, {{"serverID", serverID}, {"log_level", logLevel}, {"log_file", logFile}});
    ForEachSectionKey(*this, [&value](const char* key, Config& section) {
        if (value.isMember(key)) section.Overwrite(value[key]);
    });
    if (!value.isMember("service")) return true;
    OverwriteServices(value["service"]);
    return true;
}

// Invalid elements are reported by index; of two with one id the first wins.
void RelaydConf::OverwriteServices(const Json::Value& list) {
    services.clear();
    if (!list.isArray()) return;
    for (Json::ArrayIndex i = 0; i < list.size(); ++i) {
        ServiceConf service(list[i], true);
        if (!service.IsValid()) {
            ZLOG(ZEPA_LOG_ERR, "invalid service config: %d", static_cast<int>(i));
            continue;
        }
        if (GetServiceById(service.id) != services.end()) continue;
        services.push_back(service);
    }
}

bool RelaydConf::IsValid() const {
    if (!serverGlobal.IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "wrong global server config");
        return false;
    }
    if (!serverControl.IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "wrong control server config");
        return false;
    }
    if (!serverWaitCmd.IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "wrong wait cmd server config");
        return false;
    }
    if (!alias.IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "wrong alias cmd server config");
        return false;
    }
    if (!myhub.IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "wrong myhub cmd server config");
        return false;
    }
    for (const ServiceConf& service : services) {
        if (!service.IsValid()) {
            ZLOG(ZEPA_LOG_ERR, "wrong service [%s] config", service.id.c_str());
            return false;
        }
    }
    return true;
}

void RelaydConf::WriteServices(Json::Value& out, bool full) const {
    out = Json::Value(Json::arrayValue);
    for (const ServiceConf& service : services) {
        Json::Value element;
        service.Write(element, full);
        out.append(element);
    }
}

bool RelaydConf::Write(Json::Value& out, bool full) const {
    serverGlobal.Write(out["server_global"], full);
    serverControl.Write(out["server_control"], full);
    serverWaitCmd.Write(out["server_waitcmd"], full);
    // These three are stored in their full form in the file too.
    alias.Write(out["server_alias"], true);
    myhub.Write(out["server_myhub"], true);
    supportChannel.Write(out["support_channel"], true);
    if (!serverID.empty()) out["serverID"] = serverID;
    WriteServices(out["service"], full);
    out["log_level"] = logLevel;
    out["log_file"] = logFile;
    if (!full) return true;
    out["enable"] = enable;
    out["debug"] = debug;
    out["pid"] = static_cast<int>(getpid());
    network.Write(out["network"], true);
    return true;
}

// The identity and the two servers that the daemon learns at run time
// survive a reload; everything else comes from the default file.
bool RelaydConf::Reload() {
    AuthConf savedAuth = auth;
    ServerConf savedControl = serverControl;
    ServerConf savedWaitCmd = serverWaitCmd;
    bool savedDebug = debug;
    std::string savedMode = network.mode;

    RelaydConf fresh(Paths::Resolve(Paths::RELAYD_CONF).c_str());
    if (!fresh.IsValid()) {
        ZLOG(ZEPA_LOG_ERR, "reload config failed");
        return false;
    }
    TakeOver(fresh);
    network.ReadConf();

    auth = savedAuth;
    debug = savedDebug;
    serverWaitCmd = savedWaitCmd;
    serverControl = savedControl;
    network.mode = savedMode;
    return true;
}

void RelaydConf::TakeOver(const RelaydConf& other) {
    enable = other.enable;
    serverID = other.serverID;
    serverGlobal = other.serverGlobal;
    serverControl = other.serverControl;
    serverWaitCmd = other.serverWaitCmd;
    alias = other.alias;
    myhub = other.myhub;
    supportChannel = other.supportChannel;
    services = other.services;
    network = other.network;
    auth = other.auth;
    logFile = other.logFile;
    logLevel = other.logLevel;
    debug = other.debug;
    path = other.path;
    serverIdChanged = other.serverIdChanged;
}

void RelaydConf::DumpDataForAliasReq(Json::Value& out) {
    alias.Write(out, false);
    if (auth.serial.empty() || auth.token.empty()) auth.ReadConf();
    auth.Write(out, true);
    out["id"] = serverID;
}

}  // namespace Relay
}  // namespace ZEPA
