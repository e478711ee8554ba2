// Logging statics of Daemon: one line per message on standard error, which
// points at the log file once the process is a daemon.
#define ZEPA_LOG_SOURCE "daemon"

#include <fcntl.h>
#include <libdaemon/dlog.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>

#include "common/log.h"
#include "common/paths.h"
#include "common/seams.h"

namespace ZEPA {
namespace Relay {

int Daemon::_logLevel = 4;
std::string Daemon::_strLogFile;

namespace {

// libdaemon complains "not a valid priority value" for every level but 7 (its
// check masks wrongly); the level is stored all the same, so silence it.
void SetDaemonVerbosity(int level) {
    int savedUse = daemon_log_use;
    daemon_log_use = static_cast<daemon_log_flags>(0);
    daemon_set_verbosity(level);
    daemon_log_use = static_cast<daemon_log_flags>(savedUse);
}

}  // namespace

bool Daemon::IsLogEnable(int level) { return _logLevel >= level; }

void Daemon::Log(int level, const char* format, ...) {
    va_list args;
    va_start(args, format);
    LogV(level, format, args);
    va_end(args);
}

void Daemon::LogV(int level, const char* format, va_list args) {
    int savedErrno = errno;
    if (!IsLogEnable(level)) {
        errno = savedErrno;
        return;
    }
    char stamp[32];
    memset(stamp, 0, sizeof(stamp));
    time_t now = time(nullptr);
    if (g_logCtime(&now, stamp) != nullptr) {
        size_t len = strlen(stamp);
        if (len > 0 && stamp[len - 1] == '\n') stamp[len - 1] = '\0';
        fprintf(stderr, "%s ", stamp);
    }
    vfprintf(stderr, format, args);
    fputc('\n', stderr);
    errno = savedErrno;
}

bool Daemon::OpenLogFile(const std::string& path, int fd, int flags) {
    // Never through a link, never blocking on a FIFO, and truncated only once
    // it is known to be a plain file: a link or FIFO planted where the log
    // lives must neither hang the daemon nor have root write (or empty) some
    // other file.
    const bool truncate = (flags & O_TRUNC) != 0;
    int newFd = open(path.c_str(), (flags & ~O_TRUNC) | O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY, 0600);
    struct stat st;
    if (newFd >= 0 && (fstat(newFd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_nlink != 1 ||
                       (truncate && ftruncate(newFd, 0) != 0))) {
        close(newFd);
        newFd = -1;
    }
    if (newFd < 0) {
        ZLOG(ZEPA_LOG_ERR, "open log file [%s] failed", path.c_str());
        return false;
    }
    const int status = fcntl(newFd, F_GETFL);
    if (status != -1) fcntl(newFd, F_SETFL, status & ~O_NONBLOCK);
    if (newFd == fd) return true;
    bool ok = true;
    if (dup2(newFd, fd) < 0) {
        ZLOG(ZEPA_LOG_ERR, "dup fd failed");
        ok = false;
    }
    close(newFd);
    return ok;
}

bool Daemon::SetLogFile(const std::string& path, int level) {
    if (level >= 0) {
        _logLevel = level;
        SetDaemonVerbosity(level);
    }
    _strLogFile = path;
    if (!IsForked()) return true;
    // After daemonising an empty path falls back to the default file, unlike
    // the daemonising step itself, which then leaves stderr on /dev/null.
    const std::string target = _strLogFile.empty() ? Paths::Resolve(Paths::DEFAULT_LOG_FILE) : _strLogFile;
    OpenLogFile(target, STDERR_FILENO, O_CREAT | O_APPEND);
    return true;
}

}  // namespace Relay
}  // namespace ZEPA
