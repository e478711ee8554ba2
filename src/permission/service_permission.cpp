#define ZEPA_LOG_SOURCE "config"

#include <unistd.h>
#include <zepasdk/kv.h>
#include <zepasdk/service.h>

#include <cstring>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/permission.h>

#include "common/paths.h"

namespace ZEPA {
namespace Relay {

namespace {

constexpr unsigned kAnyPermission = 0xFFFFFFFF;

// The permissions in the order of the permission file.
const struct {
    const char* key;
    unsigned bit;
} kPermissions[] = {
    {"mobile_apps", 0x1},  {"picturedock", 0x2}, {"syncdock", 0x4},
    {"file_sharing", 0x8}, {"nos_portal", 0x10}, {"photo_portal", 0x20},
};

bool ReadPermissionFile(Json::Value& value) {
    return RelaydConf::ReadJsonFile(Paths::Resolve(Paths::PERMISSION_CONF), value);
}

// The settings switch of a catalogue row. The HTTP portal also counts as on
// when the redirect to HTTPS is set but HTTPS itself is not running.
bool RowSwitchOn(const SupportService* row) {
    std::string file = Paths::Resolve(row->szConfFile);
    if (VLIBCFileCheckKeyValue(file.c_str(), row->szKey, row->szValue, row->iCheckOpt) == 1) return true;
    if (strcmp(row->szKey, "redirectHTTPS") != 0) return false;
    std::string info = Paths::Resolve(Paths::ZEPAINFO_CONF);
    return VLIBCFileCheckKeyValue(info.c_str(), "runHTTPS", "yes", 0) != 1;
}

bool PackageEnabled(const char* package) {
    std::string marker = Paths::Resolve(std::string(Paths::PACKAGES_DIR) + package + "/enabled");
    return access(marker.c_str(), F_OK) == 0;
}

// The permissions that the appliance currently offers.
unsigned OfferedMask(const ServicePermission& permission) {
    unsigned mask = 0;
    for (const SupportService* row = grgszSupportService; row->szName != nullptr; ++row) {
        if (row->uMask == kAnyPermission) continue;
        if (permission.IsServiceEnabled(row, kAnyPermission)) mask |= row->uMask;
    }
    return mask;
}

// "enabled" of the first element of old whose "id" is id, read as a boolean
// (a value that is none counts as not granted); true when no element has id.
bool OldEnabled(const Json::Value& old, const std::string& id) {
    if (!old.isArray()) return true;
    for (const Json::Value& element : old) {
        if (!element.isObject() || !element["id"].isString() || element["id"].asString() != id) continue;
        return element["enabled"].isConvertibleTo(Json::booleanValue) ? element["enabled"].asBool() : false;
    }
    return true;
}

}  // namespace

ServicePermission::ServicePermission(bool regenerate) : _mask(0) {
    if (regenerate) GenPermissionConf();
    Json::Value value(Json::arrayValue);
    if (!ReadPermissionFile(value)) value = Json::Value(Json::arrayValue);
    _mask = JsonToMask(value);
}

unsigned ServicePermission::GetMaskVal(std::string key) {
    for (const auto& permission : kPermissions)
        if (key == permission.key) return permission.bit;
    return 0;
}

Json::Value ServicePermission::GetJsonVal(unsigned mask, unsigned bit, std::string key) {
    Json::Value entry(Json::objectValue);
    entry["id"] = key;
    entry["enabled"] = (mask & bit) != 0;
    return entry;
}

Json::Value ServicePermission::MaskToJson(unsigned mask) {
    Json::Value list(Json::arrayValue);
    for (const auto& permission : kPermissions) list.append(GetJsonVal(mask, permission.bit, permission.key));
    return list;
}

unsigned ServicePermission::JsonToMask(Json::Value value) {
    if (!value.isArray() || value.empty()) return 0;
    unsigned mask = 0;
    for (const Json::Value& element : value) {
        if (!element.isObject() || !element["enabled"].isBool() || !element["enabled"].asBool()) continue;
        std::string key = element["id"].isString() ? element["id"].asString() : std::string();
        mask |= GetMaskVal(key);
    }
    return mask;
}

// The first generation lists every permission; later ones only what is
// offered, keeping the administrator's choice and granting what is new. The
// asymmetry is deliberate.
void ServicePermission::GenPermissionConf() {
    Json::Value offered = MaskToJson(OfferedMask(*this));
    Json::Value old;
    Json::Value content;
    // A missing file reads as null: that is the first generation.
    if (!ReadPermissionFile(old) || !old.isArray()) {
        content = offered;
    } else {
        content = Json::Value(Json::arrayValue);
        for (const Json::Value& entry : offered) {
            if (!entry["enabled"].asBool()) continue;
            std::string id = entry["id"].asString();
            Json::Value kept(Json::objectValue);
            kept["id"] = id;
            kept["enabled"] = OldEnabled(old, id);
            content.append(kept);
        }
    }
    if (RelaydConf::WriteJsonFile(Paths::Resolve(Paths::PERMISSION_CONF), content))
        _mask = JsonToMask(content);
}

bool ServicePermission::IsServiceEnabled(const SupportService* row, unsigned extra) const {
    if (((_mask | extra) & row->uMask) == 0) return false;
    if (row->szConfFile != nullptr && !RowSwitchOn(row)) return false;
    if (row->szServiceName != nullptr && VLIBServiceIsEnabled(row->szServiceName) != 1) return false;
    if (row->szPackage != nullptr) return PackageEnabled(row->szPackage);
    return true;
}

unsigned ServicePermission::GetMask() const { return _mask; }

}  // namespace Relay
}  // namespace ZEPA
