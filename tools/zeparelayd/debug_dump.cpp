#include "debug_dump.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "relayd_protocol.h"

namespace zeparelayd {

namespace {

char gPath[1024];
char gTmp[1100];
// Swapped whole by the loop; the handler only ever reads the current one, and
// the loop frees a text only after it has been swapped out.
std::atomic<const std::string*> gText{nullptr};
// Dumps written so far, and as many as the loop has seen.
std::atomic<unsigned> gWrites{0};
unsigned gWritesSeen = 0;

// The temporary name is predictable and /tmp is everyone's: create it
// exclusively and never through a link. Whatever stands there (a link planted
// by another user, our own leftover) is removed once; if something is back at
// once, no dump this time rather than a write through it.
int CreateDumpTemporary() {
    const int flags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
    int fd = open(gTmp, flags, 0644);
    if (fd < 0 && errno == EEXIST && (unlink(gTmp) == 0 || (errno == EISDIR && rmdir(gTmp) == 0)))
        fd = open(gTmp, flags, 0644);
    return fd;
}

// When the temporary name stays blocked (a folder with something in it), the
// dump goes into the debug file itself, which the query has just created:
// only into a plain file with one name of root's or ours. The query reads
// until the text parses.
int OpenDumpInPlace() {
    const int fd = open(gPath, O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
    if (fd < 0) return -1;
    struct stat st;
    if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode) || st.st_nlink != 1 ||
        (st.st_uid != 0 && st.st_uid != geteuid()) || ftruncate(fd, 0) != 0) {
        close(fd);
        return -1;
    }
    return fd;
}

// Async-signal-safe only: open, unlink, rmdir, fstat, ftruncate, write,
// fchmod, close, rename.
void OnDumpSignal(int) {
    const int savedErrno = errno;
    const std::string* text = gText.load();
    if (text != nullptr) {
        int fd = CreateDumpTemporary();
        const bool inPlace = fd < 0;
        if (inPlace) fd = OpenDumpInPlace();
        if (fd >= 0) {
            const char* p = text->data();
            size_t left = text->size();
            bool ok = true;
            while (left > 0) {
                const ssize_t n = write(fd, p, left);
                if (n < 0 && errno == EINTR) continue;
                if (n <= 0) {
                    ok = false;
                    break;
                }
                p += n;
                left -= static_cast<size_t>(n);
            }
            fchmod(fd, 0644);
            close(fd);
            if (!ok) {
                if (!inPlace) unlink(gTmp);
            } else if (!inPlace && rename(gTmp, gPath) != 0) {
                unlink(gTmp);
            } else {
                gWrites.fetch_add(1);
            }
        }
    }
    errno = savedErrno;
}

}  // namespace

bool InstallDebugDump(const std::string& path) {
    if (path.size() + 1 > sizeof(gPath)) return false;
    memcpy(gPath, path.c_str(), path.size() + 1);
    snprintf(gTmp, sizeof(gTmp), "%s.tmp.%d", gPath, static_cast<int>(getpid()));
    struct sigaction sa;
    memset(&sa, 0, sizeof(sa));
    sa.sa_handler = OnDumpSignal;
    sigemptyset(&sa.sa_mask);
    sa.sa_flags = SA_RESTART;
    return sigaction(zepatools::SignalOf(zepatools::DaemonSignal::DEBUG_DUMP), &sa, nullptr) == 0;
}

void PublishDebugDump(const std::string& text) {
    const std::string* old = gText.exchange(new std::string(text));
    delete old;
}

void RemoveDebugDump() {
    signal(zepatools::SignalOf(zepatools::DaemonSignal::DEBUG_DUMP), SIG_IGN);
    delete gText.exchange(nullptr);
}

bool TakeDumpWritten() {
    const unsigned writes = gWrites.load();
    if (writes == gWritesSeen) return false;
    gWritesSeen = writes;
    return true;
}

int RemoveGivenUpDump(const std::string& path, int minAgeMs) {
    const int fd = open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY);
    if (fd < 0) return errno == ENOENT ? 0 : -1;
    struct stat st;
    int result = -1;
    if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode)) {
        // A query that runs holds the file's lock; it deletes the file itself.
        if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
            result = 1;
        } else {
            struct timespec now;
            clock_gettime(CLOCK_REALTIME, &now);
            const long long ageMs = (static_cast<long long>(now.tv_sec) - st.st_mtim.tv_sec) * 1000 +
                                    (now.tv_nsec - st.st_mtim.tv_nsec) / 1000000;
            if (ageMs < minAgeMs) {
                result = 1;
            } else {
                result = unlink(path.c_str()) == 0 ? 0 : -1;
            }
        }
    }
    close(fd);
    return result;
}

}  // namespace zeparelayd
