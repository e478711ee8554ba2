#include "common/seams.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

namespace ZEPA {
namespace Relay {

namespace {
unsigned int g_tunnelWaitSeconds = 40;
SystemLogHook g_systemLogHook = nullptr;

int OpenFile(const char* path, int flags, mode_t mode) { return open(path, flags, mode); }
void Usleep(unsigned int usec) { usleep(usec); }
}  // namespace

char* (*g_logCtime)(const time_t*, char*) = ctime_r;
void (*g_statusSleep)(unsigned int usec) = Usleep;
TunnelFileOps g_tunnelFileOps = {OpenFile, fchmod, write};
int (*g_tunnelShell)(const char* command) = system;

void SetTunnelWaitSeconds(unsigned int seconds) { g_tunnelWaitSeconds = seconds; }
unsigned int GetTunnelWaitSeconds() { return g_tunnelWaitSeconds; }

void SetSystemLogHook(SystemLogHook hook) { g_systemLogHook = hook; }
SystemLogHook GetSystemLogHook() { return g_systemLogHook; }

}  // namespace Relay
}  // namespace ZEPA
