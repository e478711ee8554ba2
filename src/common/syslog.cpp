#include "common/syslog.h"

#include <syslog.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>

#include "common/seams.h"

namespace ZEPA {
namespace Relay {

void SystemLog(int priority, const char* format, ...) {
    int savedErrno = errno;
    va_list args;
    va_start(args, format);
    SystemLogHook hook = GetSystemLogHook();
    if (hook) {
        char line[2048];
        vsnprintf(line, sizeof(line), format, args);
        hook(priority, line);
    } else {
        vsyslog(priority, format, args);
    }
    va_end(args);
    errno = savedErrno;
}

}  // namespace Relay
}  // namespace ZEPA
