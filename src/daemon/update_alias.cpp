// Asks the daemon that last wrote the status file to update its alias now.
#define ZEPA_LOG_SOURCE "daemon"

#include <csignal>

#include <zeparelayd/errors.h>

#include "common/log.h"
#include "daemon/status_file.h"

namespace ZEPA {
namespace Relay {

int Daemon::UpdateAlias() {
    Json::Value status;
    pid_t pid = 0;
    int ret = LoadStatusFile(status, pid);
    if (ret != RELAYD_RESULT_OK) return ret;
    // The status file's pid is positive here; it must also be its writer.
    ret = ProbeStatusWriter(pid);
    if (ret != RELAYD_RESULT_OK) return ret;
    // SIGRTMIN is a run-time value on Linux, never a constant.
    return kill(pid, SIGRTMIN + 1) == 0 ? RELAYD_RESULT_OK : RELAYD_RESULT_NOT_RUNNING;
}

}  // namespace Relay
}  // namespace ZEPA
