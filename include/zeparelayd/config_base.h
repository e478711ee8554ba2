// Config, the interface every configuration section implements, on its own so
// that the relay configuration (config.h) and the alias configuration
// (config_alias.h) both build on it without including each other.
#ifndef ZEPARELAYD_CONFIG_BASE_H
#define ZEPARELAYD_CONFIG_BASE_H

#include <json/value.h>

#include <cstddef>
#include <ostream>

#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

// Limits of every JSON file the library reads (configuration, status, alias
// status, permission and debug files): a larger or deeper file is refused
// like a broken one, before it can cost memory or stack.
constexpr size_t JSON_FILE_MAX_BYTES = 1024 * 1024;
constexpr int JSON_FILE_MAX_DEPTH = 64;

// A configuration section: filled from JSON, checked, written back.
// Write(out, false) is the persistent form stored in the file; Write(out, true)
// the full form that adds volatile, derived or secret fields.
class ZEPARELAYD_API Config {
public:
    virtual bool Overwrite(const Json::Value& value) = 0;
    virtual bool IsValid() const = 0;
    virtual bool Write(Json::Value& out, bool full) const = 0;
    virtual ~Config();
};

// Prints the full form of any section as one compact JSON line.
ZEPARELAYD_API std::ostream& operator<<(std::ostream& os, const Config& conf);

}  // namespace Relay
}  // namespace ZEPA

#endif
