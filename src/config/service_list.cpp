// The relay configuration's list of relayed services.
#define ZEPA_LOG_SOURCE "config"

#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/permission.h>

#include "common/log.h"

namespace ZEPA {
namespace Relay {

namespace {
constexpr unsigned kAllPermissions = 0xFFFFFFFF;
}  // namespace

void RelaydConf::GenServiceConf() {
    ServicePermission permission(true);
    bool relayOn = GetEnableConf();
    bool supportOn = supportChannel.GetEnabled();
    services.clear();
    for (const SupportService* row = grgszSupportService; row->szName != nullptr; ++row) {
        if (relayOn && permission.IsServiceEnabled(row, 0)) {
            ServiceConf service(row->szName);
            if (service.IsValid()) services.push_back(service);
        }
        // The support channel ignores the permissions: only the row's own switches count.
        if (supportOn && permission.IsServiceEnabled(row, kAllPermissions)) {
            ServiceConf service(("support_" + std::string(row->szName)).c_str());
            if (service.IsValid()) services.push_back(service);
        }
    }
}

bool RelaydConf::AddServiceById(const std::string& id) {
    ServiceConf service(id.c_str());
    ServicePermission permission(true);
    if (!service.IsValid()) {
        // Same message as for the file's elements: the index it would have taken.
        ZLOG(ZEPA_LOG_ERR, "invalid service config: %d", static_cast<int>(services.size()));
        return false;
    }
    if (GetServiceById(id) != services.end()) return true;
    for (const SupportService* row = grgszSupportService; row->szName != nullptr; ++row) {
        if (id == row->szName && !permission.IsServiceEnabled(row, 0)) return false;
    }
    services.push_back(service);
    return true;
}

std::list<ServiceConf>::const_iterator RelaydConf::GetServiceById(const std::string& id) const {
    for (auto it = services.cbegin(); it != services.cend(); ++it)
        if (it->id == id) return it;
    return services.cend();
}

bool RelaydConf::RemoveServiceById(const std::string& id) {
    // Built only so that every edit of the list refreshes the permission file.
    ServicePermission permission(true);
    auto it = GetServiceById(id);
    if (it == services.cend()) return false;
    services.erase(it);
    return true;
}

// Deliberately always false: no row's run key is consulted here.
bool RelaydConf::CheckServiceRunKey(const SupportService* /*row*/) const { return false; }

}  // namespace Relay
}  // namespace ZEPA
