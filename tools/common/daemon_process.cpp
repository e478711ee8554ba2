#include "daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include <zeparelayd/daemon.h>

namespace zepatools {

namespace {

// The kernel keeps at most 15 characters of a command name.
const size_t kCommLength = 15;

// Small files of /proc and the PID file: one bounded read, no links followed.
std::string ReadSmall(const std::string& path) {
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
    if (fd < 0) return "";
    char buf[256];
    const ssize_t n = read(fd, buf, sizeof(buf) - 1);
    close(fd);
    return n > 0 ? std::string(buf, static_cast<size_t>(n)) : std::string();
}

std::string BaseName(const std::string& path) {
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
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

bool IsProgram(pid_t pid, const std::string& name) {
    if (pid <= 0 || name.empty()) return false;
    if (kill(pid, 0) != 0 && errno != EPERM) return false;
    const std::string proc = "/proc/" + std::to_string(pid);
    std::string comm = ReadSmall(proc + "/comm");
    if (!comm.empty() && comm.back() == '\n') comm.pop_back();
    if (!comm.empty() && comm == name.substr(0, kCommLength)) return true;
    // The executable, for a daemon whose command name was changed; another
    // user's process may not show it, which counts as not ours.
    char exe[4096];
    const ssize_t n = readlink((proc + "/exe").c_str(), exe, sizeof(exe) - 1);
    if (n <= 0) return false;
    std::string file = BaseName(std::string(exe, static_cast<size_t>(n)));
    const std::string deleted = " (deleted)";
    if (file.size() > deleted.size() &&
        file.compare(file.size() - deleted.size(), deleted.size(), deleted) == 0) {
        file.resize(file.size() - deleted.size());
    }
    return file == name;
}

std::string DaemonName() {
    ZEPA::Relay::Daemon::LibInit();
    std::string name = BaseName(ZEPA::Relay::Daemon::GetPidFile());
    if (name.size() > 4 && name.compare(name.size() - 4, 4, ".pid") == 0) name.resize(name.size() - 4);
    return name;
}

PidFileState DaemonFromPidFile() {
    const std::string name = DaemonName();
    const std::string pidFile = ZEPA::Relay::Daemon::GetPidFile();

    PidFileState state;
    if (access(pidFile.c_str(), F_OK) != 0) return state;
    const pid_t pid = ReadPidFile(pidFile);
    if (IsProgram(pid, name)) {
        state.pid = pid;
    } else {
        state.stale = true;
    }
    return state;
}

}  // namespace zepatools
