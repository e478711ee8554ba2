// The "service" array of the status file and of the configuration: is a
// service id among its elements?
#ifndef ZEPARELAYD_SRC_DAEMON_SERVICE_IDS_H
#define ZEPARELAYD_SRC_DAEMON_SERVICE_IDS_H

#include <json/value.h>

namespace ZEPA {
namespace Relay {

// How an element's "id" is compared with the id asked for.
enum class ServiceIdMatch {
    STRING_ONLY,  // only a string "id" counts (the configuration's readers)
    AS_STRING,    // any "id" jsoncpp can word as a string (the status readers)
};

// True when holder["service"] is an array with an object element whose "id"
// equals serviceId under match; false otherwise.
bool ListsServiceId(const Json::Value& holder, const char* serviceId, ServiceIdMatch match);

}  // namespace Relay
}  // namespace ZEPA

#endif
