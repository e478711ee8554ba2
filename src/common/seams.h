// The library's replaceable calls, all in one place: the few points where a
// test substitutes a call whose outcome it cannot steer for real (a failing
// clock, a pause, a shell, the system log). None is exported from the shared
// library; tests reach them through the internal static library
// (tests/support/seams.h restores them after each test).
#ifndef ZEPARELAYD_SRC_COMMON_SEAMS_H
#define ZEPARELAYD_SRC_COMMON_SEAMS_H

#include <sys/types.h>

#include <ctime>

namespace ZEPA {
namespace Relay {

// Logger: the time-stamp conversion (ctime_r by default).
extern char* (*g_logCtime)(const time_t*, char*);

// Debug status query: sleeps the given microseconds between reads (usleep by default).
extern void (*g_statusSleep)(unsigned int usec);

// Tunnel: seconds RunVPNTunnel waits for the up script's signal (40 by default).
void SetTunnelWaitSeconds(unsigned int seconds);
unsigned int GetTunnelWaitSeconds();

// Tunnel: the calls WritePassFile makes, in the order it makes them.
struct TunnelFileOps {
    int (*open)(const char* path, int flags, mode_t mode);
    int (*fchmod)(int fd, mode_t mode);
    ssize_t (*write)(int fd, const void* buf, size_t count);
};
extern TunnelFileOps g_tunnelFileOps;

// Tunnel: runs a command line through the shell (system by default).
extern int (*g_tunnelShell)(const char* command);

// System log: when set, every system-log line goes to the hook instead of syslog.
using SystemLogHook = void (*)(int priority, const char* message);
void SetSystemLogHook(SystemLogHook hook);
SystemLogHook GetSystemLogHook();

}  // namespace Relay
}  // namespace ZEPA

#endif
