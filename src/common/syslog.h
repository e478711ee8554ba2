// The one place where the library calls syslog, so that tests can watch it.
#ifndef ZEPARELAYD_SRC_COMMON_SYSLOG_H
#define ZEPARELAYD_SRC_COMMON_SYSLOG_H

#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

// Formats like printf and hands the text to syslog (or to the hook, when set).
ZEPARELAYD_API void SystemLog(int priority, const char* format, ...) __attribute__((format(printf, 2, 3)));

// Test seam: when set, every system-log line goes to the hook instead of syslog.
using SystemLogHook = void (*)(int priority, const char* message);
ZEPARELAYD_API void SetSystemLogHook(SystemLogHook hook);

}  // namespace Relay
}  // namespace ZEPA

#endif
