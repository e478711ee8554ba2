#include "daemon_fixture.h"

#include <poll.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "common/paths.h"
#include "support/seams.h"

namespace daemontest {

namespace {

std::vector<SyslogLine> g_lines;

void Record(int priority, const char* message) { g_lines.push_back({priority, message}); }

sigset_t WatchedSignals() {
    sigset_t set;
    sigemptyset(&set);
    for (int sig : {SIGHUP, SIGUSR1, SIGUSR2, SIGTERM, SIGINT}) sigaddset(&set, sig);
    sigaddset(&set, SIGRTMIN + 1);
    sigaddset(&set, SIGRTMIN + 5);
    return set;
}

void WriteDump(pid_t self, int dumps) {
    std::string text = "{\"pid\": " + std::to_string(self) + ", \"dumps\": " + std::to_string(dumps) + "}\n";
    FILE* f = fopen(DebugFile(self).c_str(), "w");
    if (f == nullptr) return;
    fputs(text.c_str(), f);
    fclose(f);
}

[[noreturn]] void StandInLoop(DumpMode mode, int reports) {
    sigset_t set = WatchedSignals();
    int dumps = 0;
    for (;;) {
        int sig = sigwaitinfo(&set, nullptr);
        if (sig < 0) continue;
        if (sig == SIGUSR1 && mode == DumpMode::ANSWER) WriteDump(getpid(), ++dumps);
        if (sig == SIGUSR1 && mode == DumpMode::REMOVE) unlink(DebugFile(getpid()).c_str());
        if (write(reports, &sig, sizeof(sig)) != sizeof(sig)) _exit(3);
        if (sig == SIGTERM) _exit(0);
    }
}

}  // namespace

void StartSyslogRecorder() {
    g_lines.clear();
    ZEPA::Relay::SetSystemLogHook(Record);
}

void StopSyslogRecorder() { ZEPA::Relay::SetSystemLogHook(nullptr); }

const std::vector<SyslogLine>& SyslogLines() { return g_lines; }

bool SyslogHas(int priority, const std::string& needle) {
    for (const SyslogLine& line : g_lines)
        if (line.priority == priority && line.message.find(needle) != std::string::npos) return true;
    return false;
}

int RunInChild(const std::function<int()>& body) {
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) _exit(body());
    return Reap(pid);
}

int Reap(pid_t pid) {
    int status = 0;
    pid_t got;
    do {
        got = waitpid(pid, &status, 0);
    } while (got < 0 && errno == EINTR);
    return got == pid ? status : -1;
}

int ReapAll() {
    int last = -1, status = 0;
    for (;;) {
        pid_t got = waitpid(-1, &status, 0);
        if (got > 0) {
            last = status;
        } else if (errno != EINTR) {
            return last;
        }
    }
}

pid_t PidInFile(const std::string& path) {
    std::string text = zepatest::ReadFile(path);
    if (text.empty()) return -1;
    return static_cast<pid_t>(atoi(text.c_str()));
}

std::string DebugFile(pid_t pid) {
    char name[64];
    snprintf(name, sizeof(name), "/tmp/.zeparelayd.%d.debug", static_cast<int>(pid));
    return ZEPA::Relay::Paths::Resolve(name);
}

StandInDaemon::StandInDaemon(DumpMode mode) {
    int fds[2];
    if (pipe(fds) != 0) return;
    // Block before forking so that no early signal can kill the child.
    sigset_t set = WatchedSignals(), old;
    sigprocmask(SIG_BLOCK, &set, &old);
    fflush(nullptr);
    _pid = fork();
    if (_pid == 0) {
        close(fds[0]);
        // A vendor build may name its daemon as it likes (Daemon::SetName):
        // the readers must not go by the name.
        prctl(PR_SET_NAME, "vendor-relay");
        int ready = 0;
        if (write(fds[1], &ready, sizeof(ready)) != sizeof(ready)) _exit(3);
        StandInLoop(mode, fds[1]);
    }
    sigprocmask(SIG_SETMASK, &old, nullptr);
    close(fds[1]);
    _reports = fds[0];
    int ready = -1;
    if (_pid > 0 && read(_reports, &ready, sizeof(ready)) != sizeof(ready)) Stop();
}

StandInDaemon::~StandInDaemon() {
    Stop();
    if (_reports >= 0) close(_reports);
}

int StandInDaemon::NextSignal() {
    // Bounded, so that a signal that never comes fails the test instead of hanging it.
    pollfd pfd{_reports, POLLIN, 0};
    if (poll(&pfd, 1, 30000) != 1) return 0;
    int sig = 0;
    if (read(_reports, &sig, sizeof(sig)) != sizeof(sig)) return 0;
    return sig;
}

bool StandInDaemon::NothingReported() {
    fd_set fds;
    FD_ZERO(&fds);
    FD_SET(_reports, &fds);
    timeval now{0, 0};
    return select(_reports + 1, &fds, nullptr, nullptr, &now) == 0;
}

void StandInDaemon::Stop() {
    if (_pid <= 0) return;
    kill(_pid, SIGKILL);
    Reap(_pid);
    _pid = -1;
}

void DaemonTest::SetUp() {
    RootTest::SetUp();
    root.mkdir("/var/run");
    root.mkdir("/var/log");
    root.mkdir("/tmp");
    root.mkdir("/usr/zepa/etc/zeparelayd");
    isSubreaper = prctl(PR_SET_CHILD_SUBREAPER, 1) == 0;
    StartSyslogRecorder();
}

void DaemonTest::TearDown() {
    StopSyslogRecorder();
    RootTest::TearDown();
}

void DaemonTest::WritePidFile(pid_t pid) const {
    zepatest::WriteFile(DefaultPidFile(), std::to_string(pid) + "\n");
}

}  // namespace daemontest
