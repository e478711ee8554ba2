// The one place where the library calls syslog, so that tests can watch it
// (the hook in common/seams.h).
#ifndef ZEPARELAYD_SRC_COMMON_SYSLOG_H
#define ZEPARELAYD_SRC_COMMON_SYSLOG_H

namespace ZEPA {
namespace Relay {

// Formats like printf and hands the text to syslog (or to the hook, when set).
void SystemLog(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

}  // namespace Relay
}  // namespace ZEPA

#endif
