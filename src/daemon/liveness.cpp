// Whether the process a status or PID file names is the one that wrote it.
// The file must be one that only root or the caller could have written, the
// process must answer signal 0, and it must have started before the file was
// last written: a process started later has taken over a recycled pid.
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include <zeparelayd/daemon.h>

#include "common/file_io.h"
#include "common/paths.h"

namespace ZEPA {
namespace Relay {

namespace {

const int PROBE_LIVE = 0;
const int PROBE_GONE = 1;
const int PROBE_UNTRUSTED = 255;

// The boot time comes in whole seconds and moves with the clock's
// corrections; a writer that wrote its file right after it started must
// still read as the writer.
const long START_SLACK_SECONDS = 2;

bool ReadProcFile(const std::string& path, std::string& text) {
    return FileIo::ReadRegular(path, 64 * 1024, text, false) == FileIo::ReadResult::OK;
}

// Boot time in seconds since the epoch, from "btime" of /proc/stat.
bool BootTime(long long& boot) {
    std::string text;
    if (!ReadProcFile(std::string(Paths::PROC_DIR) + "stat", text)) return false;
    const std::string key = "\nbtime ";
    std::string::size_type at = text.find(key);
    if (at == std::string::npos) return false;
    char* end = nullptr;
    errno = 0;
    boot = strtoll(text.c_str() + at + key.size(), &end, 10);
    return errno == 0 && end != text.c_str() + at + key.size() && boot > 0;
}

// Start of pid in seconds since the epoch: field 22 of /proc/<pid>/stat
// (clock ticks since boot) plus the boot time. The command name (field 2)
// may hold blanks and parentheses, so fields are counted from its last ")".
bool StartTime(int pid, long long& start) {
    std::string text;
    if (!ReadProcFile(std::string(Paths::PROC_DIR) + std::to_string(pid) + "/stat", text)) return false;
    std::string::size_type close = text.rfind(')');
    if (close == std::string::npos) return false;
    const char* p = text.c_str() + close + 1;
    // Field 3 (the state) follows the name; 19 more to reach field 22.
    for (int field = 3; field < 22; ++field) {
        while (*p == ' ') ++p;
        while (*p != ' ' && *p != '\0') ++p;
        if (*p == '\0') return false;
    }
    char* end = nullptr;
    errno = 0;
    unsigned long long ticks = strtoull(p, &end, 10);
    if (errno != 0 || end == p) return false;
    long hz = sysconf(_SC_CLK_TCK);
    long long boot = 0;
    if (hz <= 0 || !BootTime(boot)) return false;
    start = boot + static_cast<long long>(ticks / static_cast<unsigned long long>(hz));
    return true;
}

}  // namespace

int Daemon::ProbeFilePid(const std::string& path, int pid) {
    // 0 and negative pids address process groups: never a daemon.
    if (pid <= 0) return PROBE_UNTRUSTED;
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) return PROBE_GONE;
    // Only a plain file that nobody but root or we could have written names
    // a process we may signal: another user's file, a link, a second name
    // of some other file or a file others may write can name any pid.
    if (!S_ISREG(st.st_mode) || st.st_nlink != 1) return PROBE_UNTRUSTED;
    if (st.st_uid != 0 && st.st_uid != geteuid()) return PROBE_UNTRUSTED;
    if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) return PROBE_UNTRUSTED;
    // Any failure counts as gone, EPERM included: a process we may not
    // signal is one we can neither stop nor ask anything.
    if (kill(pid, 0) != 0) return PROBE_GONE;
    long long start = 0;
    if (!StartTime(pid, start)) {
        // Without /proc the signal's answer is all there is; a process that
        // ended in the meantime is gone.
        return kill(pid, 0) == 0 ? PROBE_LIVE : PROBE_GONE;
    }
    if (start > static_cast<long long>(st.st_mtime) + START_SLACK_SECONDS) return PROBE_GONE;
    return PROBE_LIVE;
}

}  // namespace Relay
}  // namespace ZEPA
