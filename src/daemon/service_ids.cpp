#include "daemon/service_ids.h"

namespace ZEPA {
namespace Relay {

bool ListsServiceId(const Json::Value& holder, const char* serviceId, ServiceIdMatch match) {
    if (!holder.isObject()) return false;
    const Json::Value& services = holder["service"];
    if (!services.isArray()) return false;
    for (const Json::Value& service : services) {
        if (!service.isObject()) continue;
        const Json::Value& id = service["id"];
        const bool wordable =
            match == ServiceIdMatch::STRING_ONLY ? id.isString() : id.isConvertibleTo(Json::stringValue);
        if (wordable && id.asString() == serviceId) return true;
    }
    return false;
}

}  // namespace Relay
}  // namespace ZEPA
