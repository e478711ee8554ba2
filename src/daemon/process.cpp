// Process control of Daemon: identity, PID file, daemonising with a start-up
// handshake, signal registration and the senders used by other processes.
#define ZEPA_LOG_SOURCE "daemon"

#include <fcntl.h>
#include <libdaemon/dfork.h>
#include <libdaemon/dlog.h>
#include <libdaemon/dpid.h>
#include <libdaemon/dsignal.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include <zeparelayd/errors.h>

#include "common/log.h"
#include "common/paths.h"

namespace ZEPA {
namespace Relay {

namespace {

const char DEFAULT_NAME[] = "zeparelayd";
const char PID_SUFFIX[] = ".pid";
// Seconds the parent waits for the child's start-up word.
const int STARTUP_WAIT_SECONDS = 20;
const int WORD_STARTED = 0;
const int WORD_NO_PID_FILE = 4;

const char* PidFileProc() { return Daemon::GetPidFile(); }

// In the parent: wait for the child's word, report it and leave with it.
[[noreturn]] void ExitWithStartupWord() {
    int word = daemon_retval_wait(STARTUP_WAIT_SECONDS);
    if (word < 0) {
        ZLOG(ZEPA_LOG_ERR, "Could not recieve return value from daemon process: %s", strerror(errno));
    }
    ZLOG(word == WORD_STARTED ? ZEPA_LOG_DEBUG : ZEPA_LOG_ERR, "%s returned %i", daemon_log_ident, word);
    exit(word);
}

}  // namespace

bool Daemon::LibInit() {
    if (_strPidFile.empty()) SetName(DEFAULT_NAME);
    return true;
}

bool Daemon::SetName(const char* name) {
    if (name == nullptr) return false;
    // The identity points into the caller's string, which must outlive us.
    const char* ident = daemon_ident_from_argv0(const_cast<char*>(name));
    daemon_log_ident = ident;
    daemon_pid_file_ident = ident;
    daemon_pid_file_proc = PidFileProc;
    _strPidFile = Paths::Resolve(Paths::PID_DIR) + ident + PID_SUFFIX;
    return true;
}

bool Daemon::SetPidFile(const char* path) {
    if (path == nullptr || path[0] == '\0') return false;
    if (path[0] != '/') {
        ZLOG(ZEPA_LOG_ERR, "pid file must be absolute path");
        return false;
    }
    _strPidFile = path;
    return true;
}

const char* Daemon::GetPidFile() { return _strPidFile.c_str(); }

bool Daemon::Init(bool fork) {
    pid_t running = daemon_pid_file_is_running();
    if (running >= 0) {
        ZLOG(ZEPA_LOG_ERR, "Daemon already running on PID file %u", static_cast<unsigned>(running));
        return false;
    }
    if (fork && !Fork()) return false;
    if (daemon_pid_file_create() < 0) {
        ZLOG(ZEPA_LOG_ERR, "Could not create PID file (%s).", strerror(errno));
        // Sent even without a fork; with no parent listening the send just fails.
        daemon_retval_send(WORD_NO_PID_FILE);
        return false;
    }
    if (fork) daemon_retval_send(WORD_STARTED);
    return true;
}

bool Daemon::Fork() {
    if (daemon_retval_init() < 0) {
        ZLOG(ZEPA_LOG_ERR, "Failed to create pipe.");
        return false;
    }
    pid_t pid = daemon_fork();
    if (pid < 0) {
        ZLOG(ZEPA_LOG_ERR, "fork failed: %s", strerror(errno));
        daemon_retval_done();
        return false;
    }
    if (pid > 0) ExitWithStartupWord();
    _isForked = true;
    // A fresh log file per daemon start; without one stderr stays on /dev/null.
    // Appending keeps lines at the end after logrotate truncates the file.
    if (!_strLogFile.empty()) OpenLogFile(_strLogFile, STDERR_FILENO, O_CREAT | O_TRUNC | O_APPEND);
    return true;
}

int Daemon::InitSignalHandler() {
    return daemon_signal_init(SIGINT, SIGTERM, SIGQUIT, SIGPIPE, SIGHUP, SIGCHLD, SIGALRM, SIGUSR1, SIGUSR2,
                              SIGRTMIN + 1, SIGRTMIN + 5, 0);
}

namespace {

// daemon_pid_file_kill, except that a PID file naming 0 (which libdaemon
// finds "running") never makes us signal our own process group.
int KillPidFile(int sig) {
    pid_t pid = daemon_pid_file_is_running();
    if (pid <= 0) {
        errno = ESRCH;
        return -1;
    }
    return kill(pid, sig);
}

}  // namespace

// The three senders deliberately report a failure in three different ways.
int Daemon::Signal(int sig) {
    if (KillPidFile(sig) < 0) {
        ZLOG(ZEPA_LOG_NOTICE, "Failed to signal daemon, %d", sig);
        return RELAYD_RESULT_UNAVAILABLE;
    }
    return RELAYD_RESULT_OK;
}

int Daemon::Kill() {
    if (KillPidFile(SIGTERM) < 0) {
        ZLOG(ZEPA_LOG_NOTICE, "Failed to kill daemon");
        return RELAYD_RESULT_UNAVAILABLE;
    }
    return RELAYD_RESULT_OK;
}

int Daemon::Hup() {
    if (KillPidFile(SIGHUP) < 0) {
        fprintf(stderr, "%s not running\n", daemon_pid_file_ident != nullptr ? daemon_pid_file_ident : "");
        return RELAYD_RESULT_UNAVAILABLE;
    }
    return RELAYD_RESULT_OK;
}

}  // namespace Relay
}  // namespace ZEPA
