// Where the daemon and the programs around it meet on disk.
#include <cstdio>

#include <zeparelayd/daemon.h>

#include "common/paths.h"

namespace ZEPA {
namespace Relay {

std::string Daemon::GetConfPath() { return Paths::Resolve(Paths::RELAYD_CONF); }

std::string Daemon::GetStatusPath() { return Paths::Resolve(Paths::STATUS_FILE); }

std::string Daemon::GetDebugPath(int pid) {
    char name[1024];
    snprintf(name, sizeof(name), Paths::DEBUG_FILE_FORMAT, pid);
    return Paths::Resolve(name);
}

std::string Daemon::ResolvePath(const std::string& absPath) {
    return absPath.empty() ? std::string() : Paths::Resolve(absPath);
}

}  // namespace Relay
}  // namespace ZEPA
