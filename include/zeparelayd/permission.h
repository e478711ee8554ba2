// Which groups of services the administrator lets the relay reach: a 32-bit
// mask kept in "/usr/zepa/etc/zeparelayd/services.conf".
#ifndef ZEPARELAYD_PERMISSION_H
#define ZEPARELAYD_PERMISSION_H

#include <json/value.h>

#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

class ZEPARELAYD_API ServicePermission {
public:
    // regenerate: rewrite the permission file from what the appliance offers first.
    explicit ServicePermission(bool regenerate);

    static unsigned GetMaskVal(std::string key);
    static Json::Value GetJsonVal(unsigned mask, unsigned bit, std::string key);
    static Json::Value MaskToJson(unsigned mask);
    static unsigned JsonToMask(Json::Value value);

    void GenPermissionConf();
    // extra 0 applies the granted permissions; 0xFFFFFFFF ignores them.
    bool IsServiceEnabled(const SupportService* row, unsigned extra) const;
    unsigned GetMask() const;

private:
    unsigned _mask;
};

}  // namespace Relay
}  // namespace ZEPA

#endif
