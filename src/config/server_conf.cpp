#define ZEPA_LOG_SOURCE "config"

#include <zeparelayd/config.h>

#include "common/paths.h"
#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

namespace {
const char DEFAULT_PROTOCOL[] = "http";
const int DEFAULT_PORT = 80;
const char DEFAULT_PAGE[] = "Serv.php";
const char REGION_KEY[] = "relay_region";
}  // namespace

ServerConf::ServerConf(const char* host, const char* page)
    : protocol(DEFAULT_PROTOCOL), port(DEFAULT_PORT), page(DEFAULT_PAGE) {
    if (host != nullptr) this->host = host;
    if (page != nullptr) this->page = page;
}

ServerConf::ServerConf(const Json::Value& value) : ServerConf(nullptr, nullptr) { Overwrite(value); }

ServerConf::~ServerConf() = default;

bool ServerConf::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return true;
    JsonTake::TakeAll(value,
                      {{"protocol", protocol}, {"host", host}, {"ip", ip}, {"port", port}, {"page", page}});
    return true;
}

bool ServerConf::IsValid() const {
    if (protocol.empty()) return false;
    if (port < 0) return false;
    if (host.empty() && ip.empty()) return false;
    return protocol == "http" || protocol == "https";
}

bool ServerConf::Write(Json::Value& out, bool full) const {
    out["host"] = host;
    if (!full) {
        if (host.empty()) out["ip"] = ip;
        return true;
    }
    out["ip"] = ip;
    out["protocol"] = protocol;
    out["port"] = port;
    out["page"] = page;
    return true;
}

bool ServerConf::operator==(const ServerConf& other) const {
    return host == other.host && port == other.port && protocol == other.protocol;
}

bool ServerConf::operator!=(const ServerConf& other) const { return !(*this == other); }

std::string ServerConf::GetUrl(const char* page) const {
    if (!IsValid()) return std::string();
    std::string url = protocol + "://";
    url += host.empty() ? ip : host;
    url += ":" + std::to_string(port) + "/";
    url += (page != nullptr) ? std::string(page) : this->page;
    return url;
}

std::string ServerConf::GetRegion() const {
    std::string region;
    std::string::size_type dot = host.find('.');
    // Deliberately drops the character before the first dot ("abc1.x" -> "abc");
    // a leading dot wraps to npos and keeps the whole host.
    if (dot != std::string::npos) region = host.substr(0, dot - 1);

    Json::Value env;
    if (RelaydConf::ReadJsonFile(Paths::Resolve(Paths::ENV_CONF), env) && env.isObject() &&
        env.isMember(REGION_KEY) && env[REGION_KEY].isString()) {
        region = env[REGION_KEY].asString();
    }
    return region;
}

}  // namespace Relay
}  // namespace ZEPA
