// Process-wide state of Daemon shared by logging and process control.
#include <zeparelayd/daemon.h>

namespace ZEPA {
namespace Relay {

std::string Daemon::_strPidFile;
bool Daemon::_isForked = false;
bool Daemon::_isCreated = false;

bool Daemon::IsForked() { return _isForked; }

}  // namespace Relay
}  // namespace ZEPA
