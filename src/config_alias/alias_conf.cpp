#define ZEPA_LOG_SOURCE "config_alias"

#include <limits.h>
#include <stdlib.h>
#include <time.h>

#include <zeparelayd/config_alias.h>

#include "common/log.h"
#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

// An invented host under a reserved top-level domain; the appliance's build
// replaces it with the alias information server.
const char* const AliasConf::DEFAULT_URL = "https://aliasinfo.zepa.example";
const int AliasConf::DEFAULT_POLL_SECONDS;

namespace {

std::string StringMember(const Json::Value& section, const char* key) {
    std::string out;
    JsonTake::Take(section, key, out);
    return out;
}

int IntMember(const Json::Value& section, const char* key) {
    int out = 0;
    JsonTake::Take(section, key, out);
    return out;
}

}  // namespace

AliasConf::AliasConf() : _changed(false), _pollSeconds(DEFAULT_POLL_SECONDS), _url(DEFAULT_URL) {
    srandom(static_cast<unsigned int>(time(nullptr)));
}

AliasConf::~AliasConf() = default;

bool AliasConf::Overwrite(const Json::Value& section) {
    std::string alias = StringMember(section, "alias");
    std::string url = StringMember(section, "url");
    int poll = IntMember(section, "poll_seconds");

    // A section without "alias" switches the alias off on purpose.
    _aliasName = alias;
    if (poll > 0) _pollSeconds = poll;
    if (!url.empty()) _url = url;
    return true;
}

bool AliasConf::IsValid() const {
    if (_url.empty()) {
        ZLOG(ZEPA_LOG_ERR, "URL is empty");
        return false;
    }
    if (_pollSeconds == 0) {
        ZLOG(ZEPA_LOG_ERR, "Polling second is empty");
        return false;
    }
    return true;
}

bool AliasConf::Write(Json::Value& out, bool compact) const {
    out["alias"] = _aliasName;
    if (compact) {
        if (_url != DEFAULT_URL) out["url"] = _url;
        if (_pollSeconds != DEFAULT_POLL_SECONDS) out["poll_seconds"] = _pollSeconds;
        return true;
    }
    out["poll_seconds"] = _pollSeconds;
    out["url"] = _url;
    return true;
}

bool AliasConf::IsChanged() const { return _changed; }

void AliasConf::CommitChange() { _changed = false; }

bool AliasConf::IsAliasEnabled() const { return !_aliasName.empty(); }

bool AliasConf::SetAliasName(const std::string& name) {
    _aliasName = name;
    return true;
}

std::string AliasConf::GetAliasName() const { return _aliasName; }

std::string AliasConf::GetUrl() const { return _url; }

int AliasConf::GetPollSeconds() const { return _pollSeconds; }

int AliasConf::GetPollingTime() const {
    // Overwrite never stores a period below 1; guard anyway, a zero divisor must not happen.
    const long long poll = _pollSeconds > 0 ? _pollSeconds : DEFAULT_POLL_SECONDS;
    // A period above INT_MAX / 2 (68 years) would overflow the sum: the
    // delay stops at the largest int instead.
    const long long delay = poll + random() % poll;
    return delay > INT_MAX ? INT_MAX : static_cast<int>(delay);
}

}  // namespace Relay
}  // namespace ZEPA
