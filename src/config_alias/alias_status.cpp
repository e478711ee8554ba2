#define ZEPA_LOG_SOURCE "config_alias"

#include <zeparelayd/config.h>
#include <zeparelayd/config_alias.h>

#include "common/log.h"
#include "common/paths.h"
#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

namespace {

std::string StatusFile() { return Paths::Resolve(Paths::ALIAS_STATUS_FILE); }

bool StringOf(const Json::Value& doc, const char* key, std::string& out) {
    return JsonTake::Take(doc, key, out);
}

}  // namespace

AliasStatus::AliasStatus() { Reload(); }

AliasStatus::~AliasStatus() = default;

std::string AliasStatus::GetPath() { return StatusFile(); }

bool AliasStatus::Reload() { return RelaydConf::ReadJsonFile(StatusFile(), _doc); }

bool AliasStatus::IsValid() const {
    if (!_doc.isObject()) {
        // The word "array" is the message's own, although an object is required.
        ZLOG(ZEPA_LOG_ERR, "status should be array");
        return false;
    }
    if (!_doc.isMember("alias_name")) {
        ZLOG(ZEPA_LOG_ERR, "alias name is not object member");
        return false;
    }
    if (!_doc.isMember("status")) {
        ZLOG(ZEPA_LOG_ERR, "status is not object member");
        return false;
    }
    if (!_doc["status"].isString() || _doc["status"].asString().empty()) {
        ZLOG(ZEPA_LOG_ERR, "status is not string or empty");
        return false;
    }
    return true;
}

bool AliasStatus::DumpToFile() {
    if (!IsValid()) return false;
    return RelaydConf::WriteJsonFile(StatusFile(), _doc);
}

bool AliasStatus::SetStatus(const std::string& aliasName, const std::string& status, const std::string& extra,
                            bool dump) {
    if (!_doc.isObject()) _doc = Json::Value(Json::objectValue);
    _doc["alias_name"] = aliasName;
    _doc["status"] = status;
    _doc["extra"] = extra;
    if (!dump) return true;
    return DumpToFile();
}

bool AliasStatus::GetStatus(const std::string& aliasName, std::string& status, std::string& extra) const {
    std::string stored;
    StringOf(_doc, "alias_name", stored);
    if (stored != aliasName) return false;
    StringOf(_doc, "status", status);
    StringOf(_doc, "extra", extra);
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
