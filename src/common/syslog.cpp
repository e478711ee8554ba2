#include "common/syslog.h"

#include <syslog.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>

namespace ZEPA {
namespace Relay {

namespace {
SystemLogHook g_hook = nullptr;
}

void SetSystemLogHook(SystemLogHook hook) { g_hook = hook; }

void SystemLog(int priority, const char* format, ...) {
    int savedErrno = errno;
    va_list args;
    va_start(args, format);
    if (g_hook) {
        char line[2048];
        vsnprintf(line, sizeof(line), format, args);
        g_hook(priority, line);
    } else {
        vsyslog(priority, format, args);
    }
    va_end(args);
    errno = savedErrno;
}

}  // namespace Relay
}  // namespace ZEPA
