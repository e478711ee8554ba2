// One start of the openvpn child: the pass file, the fork, the wait for the
// up script's signal, and what the child runs before it becomes openvpn.
#define ZEPA_LOG_SOURCE "tunnel"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <zeparelayd/tunnel.h>

#include "common/file_io.h"
#include "common/log.h"
#include "common/paths.h"
#include "common/seams.h"
#include "tunnel/tunnel_internal.h"

namespace ZEPA {
namespace Relay {

namespace {

// Closes on scope exit unless released.
class FileDescriptor {
public:
    explicit FileDescriptor(int fd) : _fd(fd) {}
    ~FileDescriptor() {
        if (_fd >= 0) close(_fd);
    }
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;
    int get() const { return _fd; }
    int release() {
        int fd = _fd;
        _fd = -1;
        return fd;
    }

private:
    int _fd;
};

// The signals that end the wait for the child. They stay blocked from before
// the fork until sigsuspend, so that a child which dies or signals at once
// cannot be missed; the caller's mask comes back on scope exit.
class WaitSignals {
public:
    WaitSignals() {
        sigemptyset(&_wake);
        for (int sig : {SIGCHLD, SIGUSR2, SIGALRM, SIGTERM}) sigaddset(&_wake, sig);
        sigprocmask(SIG_BLOCK, &_wake, &_saved);
        // Everything else stays blocked during the wait.
        sigfillset(&_waitMask);
        for (int sig : {SIGCHLD, SIGUSR2, SIGALRM, SIGTERM}) sigdelset(&_waitMask, sig);
    }
    ~WaitSignals() { sigprocmask(SIG_SETMASK, &_saved, nullptr); }
    WaitSignals(const WaitSignals&) = delete;
    WaitSignals& operator=(const WaitSignals&) = delete;

    void Suspend() const { sigsuspend(&_waitMask); }
    // The child must not start openvpn with the wait's signals blocked.
    void RestoreInChild() const { sigprocmask(SIG_SETMASK, &_saved, nullptr); }

private:
    sigset_t _wake;
    sigset_t _waitMask;
    sigset_t _saved;
};

enum class Reaped { NONE, OTHERS_ONLY, OURS };

// Reaps every dead child without blocking, so that a dead VPN child no longer
// looks alive to kill(pid, 0).
Reaped ReapDeadChildren(pid_t ours) {
    Reaped result = Reaped::NONE;
    for (;;) {
        pid_t reaped = waitpid(-1, nullptr, WNOHANG);
        if (reaped < 0 && errno == EINTR) continue;
        if (reaped <= 0) return result;
        if (reaped == ours)
            result = Reaped::OURS;
        else if (result == Reaped::NONE)
            result = Reaped::OTHERS_ONLY;
    }
}

// Suspends until the child dies, the up script signals, the alarm rings or
// SIGTERM comes. The death of another child (an earlier VPN child stopped
// just before, say) is not a reason to stop waiting for this one.
void WaitForChild(const WaitSignals& signals, pid_t child) {
    alarm(GetTunnelWaitSeconds());
    for (;;) {
        signals.Suspend();
        const Reaped reaped = ReapDeadChildren(child);
        const unsigned int left = alarm(0);
        if (reaped != Reaped::OTHERS_ONLY || left == 0 || kill(child, 0) != 0) return;
        alarm(left);
    }
}

bool WriteAll(int fd, const char* data, size_t size) {
    size_t done = 0;
    while (done < size) {
        ssize_t written = g_tunnelFileOps.write(fd, data + done, size - done);
        if (written < 0 && errno == EINTR) continue;
        if (written <= 0) {
            if (written == 0) errno = EIO;
            return false;
        }
        done += static_cast<size_t>(written);
    }
    return true;
}

}  // namespace

bool Tunnel::RunVPNTunnel(const char* proto) {
    pid = -1;
    status = TUNNEL_STATUS_NONE;
    if (!IsSafeTunnelUser(relay_user)) {
        ZLOG(ZEPA_LOG_ERR, "unsafe tunnel user name refused");
        return IsAlive();
    }
    char name[1024];
    snprintf(name, sizeof(name), Paths::TUNNEL_PASS_FORMAT, relay_user.c_str());
    const std::string path = Paths::Resolve(name);

    if (!WritePassFile(path)) {
        unlink(path.c_str());
        return IsAlive();
    }

    WaitSignals signals;
    pid_t child = fork();
    if (child < 0) {
        ZLOG(ZEPA_LOG_ERR, "fork failed %s", strerror(errno));
        unlink(path.c_str());
        return IsAlive();
    }
    if (child == 0) {
        signals.RestoreInChild();
        TunnelExec(path.c_str(), proto);
    }

    pid = child;
    WaitForChild(signals, child);
    unlink(path.c_str());
    return IsAlive();
}

namespace {

// Whatever stands at the name (our leftover of an earlier run, a link, a
// FIFO, a folder, another user's file, a file with a second hard link) is
// removed first, and the name is created exclusively: nothing planted is
// ever written into, and nothing planted keeps the tunnel from starting.
int CreatePassFile(const std::string& path) {
    const int flags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY;
    int fd = g_tunnelFileOps.open(path.c_str(), flags, 0600);
    if (fd >= 0 || errno != EEXIST) return fd;
    struct stat st;
    const bool ours =
        lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == geteuid() && st.st_nlink == 1;
    if (!FileIo::RemoveEntry(path, true)) {
        errno = EEXIST;
        return -1;
    }
    if (!ours) ZLOG(ZEPA_LOG_WARNING, "removed what stood at %s", path.c_str());
    return g_tunnelFileOps.open(path.c_str(), flags, 0600);
}

}  // namespace

// The mode is set on the open descriptor before the secret is written, so
// that a file left over with a wider mode is narrowed first.
bool Tunnel::WritePassFile(const std::string& path) const {
    // Created exclusively: nothing planted under the name (a link, a file
    // with a second hard link, another user's file) is ever written into.
    FileDescriptor fd(CreatePassFile(path));
    if (fd.get() < 0) {
        const int openErrno = errno;
        ZLOG(ZEPA_LOG_ERR, "open [%s] failed, %s", path.c_str(), strerror(openErrno));
        // What stands at the name is not ours to remove.
        if (openErrno != EEXIST) unlink(path.c_str());
        return false;
    }
    if (g_tunnelFileOps.fchmod(fd.get(), 0600) != 0) {
        ZLOG(ZEPA_LOG_ERR, "chmod [%s] failed, %s", path.c_str(), strerror(errno));
        close(fd.release());
        unlink(path.c_str());
        return false;
    }
    char content[1024];
    int length = snprintf(content, sizeof(content), "%s\n%s", relay_user.c_str(), relay_pass.c_str());
    if (length < 0) length = 0;
    if (length > static_cast<int>(sizeof(content)) - 1) length = sizeof(content) - 1;
    const bool written = WriteAll(fd.get(), content, static_cast<size_t>(length));
    const int writeErrno = errno;
    explicit_bzero(content, sizeof(content));
    const bool closed = close(fd.release()) == 0;
    if (!written || !closed) {
        ZLOG(ZEPA_LOG_ERR, "write pass failed, %s", strerror(written ? errno : writeErrno));
        unlink(path.c_str());
        return false;
    }
    return true;
}

void Tunnel::TunnelExec(const char* passFile, const char* proto) const {
    const char* protoWord = strcmp(proto, "tcp") == 0 ? "tcp-client" : "udp";
    const pid_t parent = getppid();
    if (parent <= 0) _exit(0);
    char upCommand[1024];
    char downCommand[1024];
    snprintf(upCommand, sizeof(upCommand), "%s %d", Paths::Resolve(Paths::TUNNEL_UP_SCRIPT).c_str(),
             static_cast<int>(parent));
    snprintf(downCommand, sizeof(downCommand), "%s", Paths::Resolve(Paths::TUNNEL_DOWN_SCRIPT).c_str());

    const std::string load = Paths::Resolve(Paths::IPTABLESTOOL) + " --insmod farlinka-tunnel " + modules;
    g_tunnelShell(load.c_str());

    const std::string program = Paths::Resolve(Paths::OPENVPN);
    const std::string ca = Paths::Resolve(Paths::TUNNEL_CA_CERT);
    execl(program.c_str(), "openvpn", "--client", "--mute-replay-warnings", "--auth-nocache", "--nobind",
          "--tun-mtu", "1400", "--ping-exit", "10", "--connect-retry-max", "3", "--proto", protoWord,
          "--remote", relay_ip.c_str(), "--port", "443", "--dev", "tun1000", "--ca", ca.c_str(),
          "--script-security", "2", "--auth-user-pass", passFile, "--remap-usr1", "SIGTERM", "--cipher",
          "none", "--comp-lzo", "adaptive", "--reneg-sec", "0", "--verb", "0", "--route-up", upCommand,
          "--down", downCommand, "--zepa-no-verify", static_cast<char*>(nullptr));
    ZLOG(ZEPA_LOG_ERR, "execl openvpn failed, %s", strerror(errno));
    _exit(0);
}

}  // namespace Relay
}  // namespace ZEPA
