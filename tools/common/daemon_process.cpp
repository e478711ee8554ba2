#include "daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include <zeparelayd/daemon.h>

namespace zepatools {

namespace {

// The PID file: one bounded read, no links followed.
std::string ReadSmall(const std::string& path) {
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
    if (fd < 0) return "";
    char buf[256];
    const ssize_t n = read(fd, buf, sizeof(buf) - 1);
    close(fd);
    return n > 0 ? std::string(buf, static_cast<size_t>(n)) : std::string();
}

}  // namespace

pid_t ReadPidFile(const std::string& path) {
    const std::string text = ReadSmall(path);
    if (text.empty()) return -1;
    char* end = nullptr;
    errno = 0;
    const long pid = strtol(text.c_str(), &end, 10);
    if (errno != 0 || end == text.c_str() || (*end != '\n' && *end != '\0')) return -1;
    return pid > 0 && pid < (1L << 22) ? static_cast<pid_t>(pid) : -1;
}

PidFileState DaemonFromPidFile() {
    ZEPA::Relay::Daemon::LibInit();
    const std::string pidFile = ZEPA::Relay::Daemon::GetPidFile();

    PidFileState state;
    struct stat st;
    if (lstat(pidFile.c_str(), &st) != 0) return state;
    const pid_t pid = ReadPidFile(pidFile);
    if (ZEPA::Relay::Daemon::ProbeFilePid(pidFile, pid) == 0) {
        state.pid = pid;
    } else {
        state.stale = true;
    }
    return state;
}

}  // namespace zepatools
