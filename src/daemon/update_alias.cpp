// Asks the daemon that last wrote the status file to update its alias now.
#define ZEPA_LOG_SOURCE "daemon"

#include <csignal>

#include "common/log.h"
#include "daemon/status_file.h"

namespace ZEPA {
namespace Relay {

int Daemon::UpdateAlias() {
    Json::Value status;
    pid_t pid = 0;
    int ret = LoadStatusFile(status, pid);
    if (ret != 0) return ret;
    // SIGRTMIN is a run-time value on Linux, never a constant.
    return kill(pid, SIGRTMIN + 1) == 0 ? 0 : 1;
}

}  // namespace Relay
}  // namespace ZEPA
