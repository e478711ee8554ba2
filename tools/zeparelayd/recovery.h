// What an earlier instance that ended without cleaning up (kill -9, a crash)
// may have left, found and removed at start, before any tunnel is opened:
//   - its openvpn, still connected to the relay: a second one for the same
//     appliance would make the relay drop the first session and fail on the
//     busy device. Ours only when the process runs the program "openvpn" and
//     its "--auth-user-pass" names a pass file of this system root, and its up
//     command names no daemon that the PID file names as running;
//   - pass files ("/tmp/.tunnel.<user>", credentials in clear), the tunnel
//     info file, debug dumps of instances that no longer run.
// The status file is rewritten by the start itself.
#ifndef ZEPARELAYD_TOOL_RECOVERY_H
#define ZEPARELAYD_TOOL_RECOVERY_H

#include <sys/types.h>

#include <string>
#include <vector>

namespace zeparelayd {

struct Leftovers {
    std::vector<pid_t> openvpn;      // ended
    std::vector<std::string> files;  // removed
};

// Openvpn processes of this system root's tunnel that no running daemon owns.
std::vector<pid_t> FindLeftoverOpenvpn();

// Ends (SIGTERM, SIGKILL after graceMs) and removes what FindLeftoverOpenvpn
// and the file patterns above find; logs each. Blocks at most graceMs.
Leftovers RemoveLeftovers(int graceMs = 3000);

// Readers take a PID or status file as stale when its process started after
// the file was last written, by the wall clock. After the clock was set
// forward (a first time sync) the running daemon's files would read so: they
// are stamped anew. Only plain files of ours are touched.
void RefreshLivenessStamps();

}  // namespace zeparelayd

#endif
