// Status readers: run in other processes than the daemon and report to the
// system log, never to the library log.
#define ZEPA_LOG_SOURCE "daemon"

#include <fcntl.h>
#include <libdaemon/dpid.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>

#include <zeparelayd/errors.h>
#include <zeparelayd/filelock.h>

#include "common/file_io.h"
#include "common/log.h"
#include "common/paths.h"
#include "common/seams.h"
#include "daemon/service_ids.h"
#include "daemon/status_file.h"

namespace ZEPA {
namespace Relay {

namespace {

const int STATE_NOT_RUNNING = 1;
const int ERROR_NONE = 0;
const char NOT_RELAYED[] = "--";

// The daemon gets 50 us, then up to 30 reads 100 us apart, to write its dump.
const unsigned int FIRST_PAUSE_US = 50;
const unsigned int RETRY_PAUSE_US = 100;
const int PARSE_ATTEMPTS = 30;

int IntMember(const Json::Value& value, const char* key, int fallback) {
    if (!value.isObject() || !value.isMember(key) || !value[key].isInt()) return fallback;
    return value[key].asInt();
}

// Numbers outside the enumeration's range all word as "err_unknown".
RELAYD_RET ErrorCode(int errorNo) {
    if (errorNo < 0 || errorNo > RELAYD_ERR_UNKNOWN) return RELAYD_ERR_UNKNOWN;
    return static_cast<RELAYD_RET>(errorNo);
}

// Reads the dump the daemon writes after SIGUSR1; the caller holds the lock.
int ReadDebugDump(const std::string& path, Json::Value& out) {
    g_statusSleep(FIRST_PAUSE_US);
    for (int attempt = 1;; ++attempt) {
        // Never through a link planted at the name, never blocking on a FIFO.
        std::string text;
        FileIo::ReadResult read = FileIo::ReadRegular(path, FileIo::MAX_FILE_BYTES, text, false);
        if (read != FileIo::ReadResult::OK && read != FileIo::ReadResult::TOO_LARGE) {
            ZSYSLOG(LOG_ERR, "zeparelayd status file is not ready");
            unlink(path.c_str());
            return RELAYD_RESULT_BROKEN;
        }
        if (read == FileIo::ReadResult::OK && FileIo::ParseJson(text, out)) {
            unlink(path.c_str());
            return RELAYD_RESULT_OK;
        }
        if (attempt == PARSE_ATTEMPTS) {
            ZSYSLOG(LOG_DEBUG, "zeparelayd status parse failed");
            unlink(path.c_str());
            return RELAYD_RESULT_BUSY;
        }
        g_statusSleep(RETRY_PAUSE_US);
    }
}

// The debug file is created by the query. Whatever else stands at its name
// (a link, FIFO, folder or file that another user planted) would keep every
// query from an answer: it is removed, and the name created exclusively. A
// file of ours or root's is another query's, or a leftover, and is left to
// the lock.
void ClaimDebugFile(const std::string& path) {
    struct stat st;
    if (lstat(path.c_str(), &st) == 0) {
        if (S_ISREG(st.st_mode) && st.st_nlink == 1 && (st.st_uid == 0 || st.st_uid == geteuid())) return;
        if (FileIo::RemoveEntry(path, true)) ZSYSLOG(LOG_WARNING, "removed what stood at %s", path.c_str());
    }
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY, 0600);
    if (fd >= 0) close(fd);
}

}  // namespace

int LoadStatusFile(Json::Value& out, pid_t& pid) {
    out = Json::Value();
    std::string text;
    FileIo::ReadResult read =
        FileIo::ReadRegular(Paths::Resolve(Paths::STATUS_FILE), FileIo::MAX_FILE_BYTES, text);
    if (read == FileIo::ReadResult::MISSING) return RELAYD_RESULT_NOT_RUNNING;
    // A FIFO, device, folder or oversized file is as broken as bad JSON.
    if (read != FileIo::ReadResult::OK || !FileIo::ParseJson(text, out)) {
        ZSYSLOG(LOG_ERR, "bad zeparelayd status file");
        return RELAYD_RESULT_BROKEN;
    }
    // 0 and negative pids address process groups: never a daemon.
    if (!out.isObject() || !out.isMember("pid") || !out["pid"].isInt() || out["pid"].asInt() <= 0) {
        ZSYSLOG(LOG_ERR, "bad zeparelayd status pid");
        return RELAYD_RESULT_BROKEN;
    }
    pid = out["pid"].asInt();
    return RELAYD_RESULT_OK;
}

int ProbeStatusWriter(pid_t pid) {
    int probe = Daemon::ProbeFilePid(Daemon::GetStatusPath(), pid);
    // Planted by another user, or writable by one: it names no daemon of ours.
    if (probe == RELAYD_RESULT_BROKEN) ZSYSLOG(LOG_ERR, "bad zeparelayd status file");
    return probe;
}

int Daemon::GetStatus(Json::Value& out) {
    pid_t pid = 0;
    int ret = LoadStatusFile(out, pid);
    if (ret != RELAYD_RESULT_OK) return ret;
    return ProbeStatusWriter(pid);
}

bool Daemon::GetStatus(std::string& serverId, std::string& state, std::string& error, const char* serviceId) {
    serverId.clear();
    state.clear();
    error.clear();
    Json::Value status;
    int probe = GetStatus(status);
    const Json::Value& file = status;
    if (file.isObject() && file["serverID"].isString()) serverId = file["serverID"].asString();
    int stateNo = IntMember(file, "state", STATE_NOT_RUNNING);
    int errorNo = IntMember(file, "error", ERROR_NONE);
    if (probe == RELAYD_RESULT_BROKEN) return false;
    // A stale file or a service not relayed both read as "not running".
    bool relayed = probe == RELAYD_RESULT_OK &&
                   (serviceId == nullptr || ListsServiceId(file, serviceId, ServiceIdMatch::AS_STRING));
    if (!relayed) {
        stateNo = STATE_NOT_RUNNING;
        errorNo = ERROR_NONE;
        if (serviceId != nullptr) serverId = NOT_RELAYED;
    }
    state = GetStateStr(static_cast<RELAYD_STATE>(stateNo));
    error = GetErrorStr(ErrorCode(errorNo));
    return true;
}

int Daemon::DebugStatus(Json::Value& out) {
    LibInit();
    out = Json::Value();
    pid_t pid = daemon_pid_file_is_running();
    if (pid < 0) return RELAYD_RESULT_NOT_RUNNING;
    if (pid == 0) {
        // kill(0, ...) would signal our own process group.
        ZSYSLOG(LOG_ERR, "bad zeparelayd status pid");
        return RELAYD_RESULT_BROKEN;
    }
    // A PID file left by a crash may name a pid that another process has since taken.
    int probe = ProbeFilePid(GetPidFile(), pid);
    if (probe == RELAYD_RESULT_BROKEN) ZSYSLOG(LOG_ERR, "bad zeparelayd status pid");
    if (probe != RELAYD_RESULT_OK) return probe;
    const std::string path = Daemon::GetDebugPath(pid);
    ClaimDebugFile(path);
    FileLock lock(path.c_str());
    if (!lock.Lock(LOCK_EX)) {
        ZSYSLOG(LOG_INFO, "lock failed");
        return RELAYD_RESULT_BUSY;
    }
    // The pid checked above, not a second read of the PID file.
    if (kill(pid, SIGUSR1) != 0) {
        // The empty debug file is left behind on purpose.
        ZSYSLOG(LOG_ERR, "daemon is not running");
        return RELAYD_RESULT_NOT_RUNNING;
    }
    return ReadDebugDump(path, out);
}

}  // namespace Relay
}  // namespace ZEPA
