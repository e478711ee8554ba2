// The library's replaceable calls (common/seams.h), for tests: include this
// header, set what the test needs, and keep a SeamGuard so that every seam is
// back to the library's own call when the test ends.
#ifndef ZEPARELAYD_TESTS_SUPPORT_SEAMS_H
#define ZEPARELAYD_TESTS_SUPPORT_SEAMS_H

#include "common/seams.h"

namespace ZEPA {
namespace Relay {

class SeamGuard {
public:
    SeamGuard()
        : _logCtime(g_logCtime),
          _statusSleep(g_statusSleep),
          _tunnelWaitSeconds(GetTunnelWaitSeconds()),
          _tunnelFileOps(g_tunnelFileOps),
          _tunnelShell(g_tunnelShell),
          _systemLogHook(GetSystemLogHook()) {}
    ~SeamGuard() {
        g_logCtime = _logCtime;
        g_statusSleep = _statusSleep;
        SetTunnelWaitSeconds(_tunnelWaitSeconds);
        g_tunnelFileOps = _tunnelFileOps;
        g_tunnelShell = _tunnelShell;
        SetSystemLogHook(_systemLogHook);
    }
    SeamGuard(const SeamGuard&) = delete;
    SeamGuard& operator=(const SeamGuard&) = delete;

private:
    char* (*_logCtime)(const time_t*, char*);
    void (*_statusSleep)(unsigned int);
    unsigned int _tunnelWaitSeconds;
    TunnelFileOps _tunnelFileOps;
    int (*_tunnelShell)(const char*);
    SystemLogHook _systemLogHook;
};

}  // namespace Relay
}  // namespace ZEPA

#endif
