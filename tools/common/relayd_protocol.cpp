#include "relayd_protocol.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include <zeparelayd/daemon.h>

namespace zepatools {

namespace {

const DaemonSignal kMeanings[] = {
    DaemonSignal::STOP,       DaemonSignal::RELOAD,    DaemonSignal::DEBUG_DUMP,  DaemonSignal::UPDATE_ALIAS,
    DaemonSignal::REOPEN_LOG, DaemonSignal::TUNNEL_UP, DaemonSignal::CHILD_EXITED};

}  // namespace

int SignalOf(DaemonSignal meaning) {
    switch (meaning) {
        case DaemonSignal::STOP:
            return SIGTERM;
        case DaemonSignal::RELOAD:
            return SIGHUP;
        case DaemonSignal::DEBUG_DUMP:
            return SIGUSR1;
        case DaemonSignal::UPDATE_ALIAS:
            return SIGRTMIN + 1;
        case DaemonSignal::REOPEN_LOG:
            // SIGUSR2 belongs to the tunnel's up script.
            return SIGRTMIN + 2;
        case DaemonSignal::TUNNEL_UP:
            return SIGUSR2;
        case DaemonSignal::CHILD_EXITED:
            return SIGCHLD;
        case DaemonSignal::OTHER:
            break;
    }
    return 0;
}

DaemonSignal MeaningOf(int sig) {
    if (sig <= 0) return DaemonSignal::OTHER;
    if (sig == SIGINT || sig == SIGQUIT) return DaemonSignal::STOP;
    for (DaemonSignal meaning : kMeanings) {
        if (SignalOf(meaning) == sig) return meaning;
    }
    return DaemonSignal::OTHER;
}

std::vector<int> DaemonSignals() {
    // Stop signals besides SIGTERM; SIGPIPE, SIGALRM and SIGRTMIN+5 are
    // handled and do nothing.
    std::vector<int> sigs = {SIGINT, SIGQUIT, SIGPIPE, SIGALRM, SIGRTMIN + 5};
    for (DaemonSignal meaning : kMeanings) sigs.push_back(SignalOf(meaning));
    return sigs;
}

sigset_t DaemonSignalSet() {
    sigset_t set;
    sigemptyset(&set);
    for (int sig : DaemonSignals()) sigaddset(&set, sig);
    return set;
}

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

bool IsRunningDaemon(pid_t pid) { return pid > 0 && DaemonFromPidFile().pid == pid; }

}  // namespace zepatools
