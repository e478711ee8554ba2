// Reading the daemon's status file, shared by the status readers.
#ifndef ZEPARELAYD_SRC_DAEMON_STATUS_FILE_H
#define ZEPARELAYD_SRC_DAEMON_STATUS_FILE_H

#include <json/value.h>
#include <sys/types.h>

namespace ZEPA {
namespace Relay {

// Opens the status file and parses it into out (which starts null), then
// takes its "pid". 0 with pid set, 1 when there is no file, 255 (reported
// to the system log) when the content or its pid is broken.
int LoadStatusFile(Json::Value& out, pid_t& pid);

// Daemon::ProbeFilePid on the status file; an untrusted file is reported to
// the system log as a bad status file.
int ProbeStatusWriter(pid_t pid);

// Status(false): server id, state, alias and error lines on standard output.
int PrintStatusReport();

}  // namespace Relay
}  // namespace ZEPA

#endif
