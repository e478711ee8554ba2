// Which process a signal of ours may reach: the one named in the PID file,
// and only while it is the process that wrote the file (Daemon::ProbeFilePid).
// A PID file left behind by a crash can name any process once its number is
// reused.
#ifndef ZEPARELAYD_TOOL_DAEMON_PROCESS_H
#define ZEPARELAYD_TOOL_DAEMON_PROCESS_H

#include <sys/types.h>

#include <string>

namespace zepatools {

struct PidFileState {
    pid_t pid = -1;      // the running daemon, or -1
    bool stale = false;  // a PID file exists but names no daemon of ours
};

// The process id written in a PID file; -1 when the file is missing,
// unreadable or holds no positive number.
pid_t ReadPidFile(const std::string& path);

// The daemon that the library's PID file names (Daemon::GetPidFile).
PidFileState DaemonFromPidFile();

}  // namespace zepatools

#endif
