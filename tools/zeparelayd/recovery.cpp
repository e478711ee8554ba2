#define RLOG_SOURCE "recovery"

#include "recovery.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <cctype>
#include <cstdlib>
#include <cstring>

#include <zeparelayd/daemon.h>
#include <zeparelayd/tunnel.h>

#include "log.h"
#include "relayd_protocol.h"

using ZEPA::Relay::Daemon;
using ZEPA::Relay::Tunnel;

namespace zeparelayd {

namespace {

// A process's arguments, at most 64 KiB of them.
std::vector<std::string> CommandLine(pid_t pid) {
    std::vector<std::string> args;
    const std::string path = "/proc/" + std::to_string(pid) + "/cmdline";
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) return args;
    std::string text;
    char buf[4096];
    ssize_t n;
    while (text.size() < 65536 && (n = read(fd, buf, sizeof(buf))) > 0)
        text.append(buf, static_cast<size_t>(n));
    close(fd);
    size_t start = 0;
    while (start < text.size()) {
        size_t end = text.find('\0', start);
        if (end == std::string::npos) end = text.size();
        args.push_back(text.substr(start, end - start));
        start = end + 1;
    }
    return args;
}

bool StartsWith(const std::string& s, const std::string& prefix) {
    return s.size() > prefix.size() && s.compare(0, prefix.size(), prefix) == 0;
}

std::string DirName(const std::string& path) {
    const size_t slash = path.rfind('/');
    return slash == std::string::npos || slash == 0 ? "/" : path.substr(0, slash);
}

std::string BaseName(const std::string& path) {
    const size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

// "/.../tmp/.tunnel." of this system root.
std::string PassFilePrefix() {
    std::string path = Tunnel::GetPassFilePath("x");
    if (!path.empty()) path.pop_back();
    return path;
}

bool AllDigits(const std::string& s) {
    if (s.empty()) return false;
    for (unsigned char c : s) {
        if (!isdigit(c)) return false;
    }
    return true;
}

// The daemon pid the up command carries ("<up script> <pid>"), -1 if none.
pid_t UpCommandPid(const std::vector<std::string>& args) {
    for (size_t i = 0; i + 1 < args.size(); ++i) {
        if (args[i] != "--route-up") continue;
        const std::string& cmd = args[i + 1];
        const size_t blank = cmd.rfind(' ');
        if (blank == std::string::npos || !AllDigits(cmd.substr(blank + 1))) return -1;
        return static_cast<pid_t>(atol(cmd.c_str() + blank + 1));
    }
    return -1;
}

// Our leftover only: regular, one link, ours. Anything else at the name is
// not ours to remove.
bool RemoveOwnFile(const std::string& path, std::vector<std::string>& removed) {
    struct stat st;
    if (lstat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_nlink != 1) return false;
    if (st.st_uid != geteuid() && st.st_uid != 0) return false;
    if (unlink(path.c_str()) != 0) return false;
    removed.push_back(path);
    return true;
}

// Alive and not a zombie waiting for its parent to reap it.
bool Running(pid_t pid) {
    if (kill(pid, 0) != 0) return false;
    const int fd = open(("/proc/" + std::to_string(pid) + "/stat").c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return true;
    char buf[512];
    const ssize_t n = read(fd, buf, sizeof(buf) - 1);
    close(fd);
    if (n <= 0) return true;
    buf[n] = '\0';
    const char* paren = strrchr(buf, ')');
    return paren == nullptr || paren[1] == '\0' || paren[2] != 'Z';
}

// An openvpn process: its command name, as the kernel keeps it.
bool IsOpenvpn(pid_t pid) {
    const int fd = open(("/proc/" + std::to_string(pid) + "/comm").c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return false;
    char buf[32];
    const ssize_t n = read(fd, buf, sizeof(buf) - 1);
    close(fd);
    if (n <= 0) return false;
    std::string comm(buf, static_cast<size_t>(n));
    if (comm.back() == '\n') comm.pop_back();
    return comm == "openvpn";
}

// The daemon of this root that the PID file names, if it runs: it keeps its
// tunnel and its dumps.
bool IsRunningDaemon(pid_t pid) { return pid != getpid() && zepatools::IsRunningDaemon(pid); }

void SleepMs(int ms) {
    struct timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
    nanosleep(&ts, nullptr);
}

}  // namespace

std::vector<pid_t> FindLeftoverOpenvpn() {
    std::vector<pid_t> found;
    const std::string prefix = PassFilePrefix();
    if (prefix.empty()) return found;
    DIR* proc = opendir("/proc");
    if (proc == nullptr) return found;
    while (struct dirent* entry = readdir(proc)) {
        if (!AllDigits(entry->d_name)) continue;
        const pid_t pid = static_cast<pid_t>(atol(entry->d_name));
        if (pid == getpid() || !IsOpenvpn(pid)) continue;
        const std::vector<std::string> args = CommandLine(pid);
        bool ours = false;
        for (size_t i = 0; i + 1 < args.size(); ++i) {
            if (args[i] == "--auth-user-pass" && StartsWith(args[i + 1], prefix) &&
                args[i + 1].find('/', prefix.size()) == std::string::npos) {
                ours = true;
            }
        }
        if (!ours) continue;
        // A daemon that still runs keeps its tunnel.
        const pid_t owner = UpCommandPid(args);
        if (IsRunningDaemon(owner)) continue;
        found.push_back(pid);
    }
    closedir(proc);
    return found;
}

Leftovers RemoveLeftovers(int graceMs) {
    Leftovers left;
    left.openvpn = FindLeftoverOpenvpn();
    for (pid_t pid : left.openvpn) {
        RLOG(LOG_NOTICE, "ending openvpn %d left by an earlier run", static_cast<int>(pid));
        kill(pid, SIGTERM);
    }
    // Not our children: their end shows in kill(pid, 0) once init reaped them.
    for (int waited = 0; waited < graceMs; waited += 10) {
        bool any = false;
        for (pid_t pid : left.openvpn) any = any || Running(pid);
        if (!any) break;
        SleepMs(10);
    }
    for (pid_t pid : left.openvpn) {
        if (Running(pid) && IsOpenvpn(pid)) {
            RLOG(LOG_WARNING, "openvpn %d still runs after %d ms: killed", static_cast<int>(pid), graceMs);
            kill(pid, SIGKILL);
        }
    }

    // Pass files of any user of this root, the tunnel info file.
    const std::string prefix = PassFilePrefix();
    if (!prefix.empty()) {
        const std::string dir = DirName(prefix);
        const std::string stem = BaseName(prefix);
        if (DIR* d = opendir(dir.c_str())) {
            while (struct dirent* entry = readdir(d)) {
                const std::string name = entry->d_name;
                if (StartsWith(name, stem)) RemoveOwnFile(dir + "/" + name, left.files);
            }
            closedir(d);
        }
    }
    RemoveOwnFile(Tunnel::GetInfoFilePath(), left.files);

    // Debug dumps (and their temporaries) of instances that no longer run.
    const std::string sample = Daemon::GetDebugPath(123456789);
    const size_t at = sample.find("123456789");
    if (at != std::string::npos) {
        const std::string dir = DirName(sample);
        const std::string before = BaseName(sample.substr(0, at));
        const std::string after = sample.substr(at + 9);
        if (DIR* d = opendir(dir.c_str())) {
            while (struct dirent* entry = readdir(d)) {
                const std::string name = entry->d_name;
                if (!StartsWith(name, before)) continue;
                const size_t end = name.find(after, before.size());
                if (end == std::string::npos) continue;
                const std::string digits = name.substr(before.size(), end - before.size());
                if (!AllDigits(digits)) continue;
                const pid_t pid = static_cast<pid_t>(atol(digits.c_str()));
                if (pid == getpid() || IsRunningDaemon(pid)) continue;
                RemoveOwnFile(dir + "/" + name, left.files);
            }
            closedir(d);
        }
    }
    for (const std::string& file : left.files)
        RLOG(LOG_NOTICE, "removed [%s] left by an earlier run", file.c_str());
    return left;
}

void RefreshLivenessStamps() {
    for (const std::string& path : {std::string(Daemon::GetPidFile()), Daemon::GetStatusPath()}) {
        const int fd = open(path.c_str(), O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
        if (fd < 0) continue;
        struct stat st;
        if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_nlink == 1 && st.st_uid == geteuid()) {
            futimens(fd, nullptr);
        }
        close(fd);
    }
}

}  // namespace zeparelayd
