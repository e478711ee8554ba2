#define ZEPA_LOG_SOURCE "config"

#include <zeparelayd/config.h>

#include "config/json_take.h"

namespace ZEPA {
namespace Relay {

SupportChannelConf::SupportChannelConf() : _enabled(false) {}

SupportChannelConf::~SupportChannelConf() = default;

bool SupportChannelConf::Overwrite(const Json::Value& value) {
    JsonTake::Take(value, "enabled", _enabled);
    return true;
}

bool SupportChannelConf::IsValid() const { return true; }

bool SupportChannelConf::Write(Json::Value& out, bool /*full*/) const {
    out["enabled"] = _enabled;
    return true;
}

void SupportChannelConf::SetEnabled(bool enabled) { _enabled = enabled; }

bool SupportChannelConf::GetEnabled() const { return _enabled; }

}  // namespace Relay
}  // namespace ZEPA
