#define ZEPA_LOG_SOURCE "config"

#include <zeparelayd/config.h>

#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

// An invented name under a reserved top-level domain; the appliance's build
// replaces it with the account service's real entry point.
const char* const MyHubConf::DEFAULT_HOST = "account.zepahub.example";

MyHubConf::MyHubConf() : _host(DEFAULT_HOST) {}

MyHubConf::~MyHubConf() = default;

bool MyHubConf::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return true;
    JsonTake::TakeAll(value, {{"account", _account}, {"host", _host}});
    return true;
}

bool MyHubConf::IsValid() const { return true; }

bool MyHubConf::Write(Json::Value& out, bool full) const {
    out["account"] = _account;
    // A default host is never stored, so a later change of the default reaches every device.
    if (full && _host != DEFAULT_HOST) out["host"] = _host;
    return true;
}

std::string MyHubConf::GetHost() const { return _host; }

std::string MyHubConf::GetMyHubAccount() const { return _account; }

bool MyHubConf::SetMyHubAccount(const std::string& account) {
    _account = account;
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
