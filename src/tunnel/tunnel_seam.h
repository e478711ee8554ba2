// Test seams of the tunnel: the wait for the child, the calls that write the
// pass file and the shell that runs the module tool. The library's defaults
// are a 40-second wait and the plain system calls.
#ifndef ZEPARELAYD_SRC_TUNNEL_TUNNEL_SEAM_H
#define ZEPARELAYD_SRC_TUNNEL_TUNNEL_SEAM_H

#include <sys/types.h>

#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

// Seconds RunVPNTunnel waits for the up script's signal (40 by default).
ZEPARELAYD_API void SetTunnelWaitSeconds(unsigned int seconds);
ZEPARELAYD_API unsigned int GetTunnelWaitSeconds();

// The calls WritePassFile makes, in the order it makes them.
struct TunnelFileOps {
    int (*open)(const char* path, int flags, mode_t mode);
    int (*fchmod)(int fd, mode_t mode);
    ssize_t (*write)(int fd, const void* buf, size_t count);
};
ZEPARELAYD_API extern TunnelFileOps g_tunnelFileOps;

// Runs a command line through the shell (system by default).
ZEPARELAYD_API extern int (*g_tunnelShell)(const char* command);

}  // namespace Relay
}  // namespace ZEPA

#endif
