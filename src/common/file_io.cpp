#include "common/file_io.h"

#include <dirent.h>
#include <fcntl.h>
#include <json/reader.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <exception>
#include <memory>
#include <new>

namespace ZEPA {
namespace Relay {
namespace FileIo {

namespace {

const char TMP_INFIX[] = ".tmp.";
// Deepest folder tree removed from a name that we need.
const int MAX_TREE_DEPTH = 64;

bool AllDigits(const std::string& s) {
    if (s.empty()) return false;
    for (char c : s)
        if (c < '0' || c > '9') return false;
    return true;
}

// The pid of a temporary-file name of base, "<base>.tmp.<pid>"; 0 when the
// name is not of that pattern.
pid_t TemporaryPid(const std::string& name, const std::string& base) {
    const std::string prefix = base + TMP_INFIX;
    if (name.compare(0, prefix.size(), prefix) != 0) return 0;
    const std::string rest = name.substr(prefix.size());
    if (!AllDigits(rest) || rest.size() > 9) return 0;
    return static_cast<pid_t>(atol(rest.c_str()));
}

// Removes name in the folder dirFd without following links; a folder with
// everything in it. Depth is bounded: each level holds a descriptor.
bool RemoveAt(int dirFd, const char* name, int depth) {
    if (unlinkat(dirFd, name, 0) == 0) return true;
    if (errno != EISDIR && errno != EPERM) return false;
    if (depth >= MAX_TREE_DEPTH) return false;
    int fd = openat(dirFd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0) return false;
    DIR* dir = fdopendir(fd);
    if (dir == nullptr) {
        close(fd);
        return false;
    }
    for (dirent* e = readdir(dir); e != nullptr; e = readdir(dir)) {
        if (strcmp(e->d_name, ".") == 0 || strcmp(e->d_name, "..") == 0) continue;
        RemoveAt(dirfd(dir), e->d_name, depth + 1);
    }
    closedir(dir);
    return unlinkat(dirFd, name, AT_REMOVEDIR) == 0;
}

void SplitPath(const std::string& path, std::string& folder, std::string& base) {
    std::string::size_type slash = path.rfind('/');
    if (slash == std::string::npos) {
        folder = ".";
        base = path;
    } else {
        folder = slash == 0 ? "/" : path.substr(0, slash);
        base = path.substr(slash + 1);
    }
}

}  // namespace

ReadResult ReadRegular(const std::string& path, size_t limit, std::string& out, bool followLinks) {
    out.clear();
    int flags = O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
    if (!followLinks) flags |= O_NOFOLLOW;
    int fd = open(path.c_str(), flags);
    if (fd < 0) return ReadResult::MISSING;
    std::unique_ptr<int, void (*)(int*)> guard(&fd, [](int* f) { close(*f); });
    struct stat st;
    if (fstat(fd, &st) != 0) return ReadResult::FAILED;
    if (!S_ISREG(st.st_mode)) return ReadResult::NOT_REGULAR;
    if (st.st_size < 0 || static_cast<unsigned long long>(st.st_size) > limit) return ReadResult::TOO_LARGE;
    try {
        // The size may change while we read; never take more than limit.
        char buf[16384];
        for (;;) {
            ssize_t n = read(fd, buf, sizeof(buf));
            if (n < 0 && errno == EINTR) continue;
            if (n < 0) {
                out.clear();
                return ReadResult::FAILED;
            }
            if (n == 0) break;
            if (out.size() + static_cast<size_t>(n) > limit) {
                out.clear();
                return ReadResult::TOO_LARGE;
            }
            out.append(buf, static_cast<size_t>(n));
        }
    } catch (const std::exception&) {
        out.clear();
        return ReadResult::FAILED;
    }
    return ReadResult::OK;
}

bool ParseJson(const std::string& text, Json::Value& out) {
    out = Json::Value();
    try {
        Json::CharReaderBuilder builder;
        builder["collectComments"] = false;
        builder["stackLimit"] = MAX_JSON_DEPTH;
        std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
        const char* begin = text.data();
        return reader->parse(begin, begin + text.size(), &out, nullptr);
    } catch (const std::exception&) {
        // jsoncpp throws past the nesting limit; bad_alloc for a huge input.
        // What it built of such a text is no value of ours.
        out = Json::Value();
        return false;
    }
}

std::string ClipForLog(const std::string& text) {
    if (text.size() <= MAX_LOGGED_BODY) return text;
    return text.substr(0, MAX_LOGGED_BODY) + "... (" + std::to_string(text.size()) + " bytes)";
}

std::string TemporaryName(const std::string& path) { return path + TMP_INFIX + std::to_string(getpid()); }

int OpenTemporary(const std::string& name, bool& removedForeign) {
    removedForeign = false;
    // Never through a link, never blocking on a FIFO, and nothing truncated
    // before we know it is ours.
    int fd = open(name.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY, 0600);
    if (fd >= 0) {
        struct stat st;
        if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == geteuid() && st.st_nlink == 1 &&
            ftruncate(fd, 0) == 0) {
            int flags = fcntl(fd, F_GETFL);
            if (flags != -1) fcntl(fd, F_SETFL, flags & ~O_NONBLOCK);
            return fd;
        }
        close(fd);
    } else if (errno == ENOENT || errno == ENOTDIR) {
        return -1;  // no folder to write in
    }
    // A link, FIFO, device, folder, another user's file or a second name of
    // some file: not ours to write through. Gone, and the name made anew.
    removedForeign = RemoveEntry(name, true);
    return open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY, 0600);
}

bool RemoveEntry(const std::string& path, bool ownFolders) {
    std::string folder, base;
    SplitPath(path, folder, base);
    if (base.empty() || base == "." || base == "..") return false;
    int dirFd = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dirFd < 0) return false;
    struct stat st;
    bool removed = fstatat(dirFd, base.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 &&
                   (ownFolders || !S_ISDIR(st.st_mode) || (st.st_uid != 0 && st.st_uid != geteuid())) &&
                   RemoveAt(dirFd, base.c_str(), 0);
    close(dirFd);
    return removed;
}

int Publish(const std::string& tmp, const std::string& path, bool& removedForeign) {
    removedForeign = false;
    if (rename(tmp.c_str(), path.c_str()) == 0) return 0;
    const int renameErrno = errno;
    if (renameErrno != EISDIR && renameErrno != ENOTEMPTY && renameErrno != EEXIST) return renameErrno;
    // A folder planted by another user holds the name: swap it out in one
    // step, so that readers see it or the new file and nothing in between,
    // then remove it. Our own folder there is a caller's mistake: kept.
    struct stat st;
    if (lstat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode) || st.st_uid == 0 || st.st_uid == geteuid())
        return renameErrno;
    if (renameat2(AT_FDCWD, tmp.c_str(), AT_FDCWD, path.c_str(), RENAME_EXCHANGE) != 0) return renameErrno;
    RemoveEntry(tmp, false);
    removedForeign = true;
    return 0;
}

bool WriteAll(int fd, const char* data, size_t size) {
    while (size > 0) {
        ssize_t n = write(fd, data, size);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

bool SyncFolderOf(const std::string& path) {
    std::string folder, base;
    SplitPath(path, folder, base);
    int fd = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return false;
    bool ok = fsync(fd) == 0;
    close(fd);
    return ok;
}

void RemoveStaleTemporaries(const std::string& path) {
    std::string folder, base;
    SplitPath(path, folder, base);
    if (base.empty()) return;
    DIR* dir = opendir(folder.c_str());
    if (dir == nullptr) return;
    const time_t now = time(nullptr);
    for (dirent* e = readdir(dir); e != nullptr; e = readdir(dir)) {
        const std::string name = e->d_name;
        pid_t pid = TemporaryPid(name, base);
        if (pid <= 0 || pid == getpid()) continue;
        struct stat st;
        if (fstatat(dirfd(dir), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
        if (!S_ISREG(st.st_mode) || st.st_uid != geteuid()) continue;
        bool dead = kill(pid, 0) != 0 && errno == ESRCH;
        bool old = now - st.st_mtime > STALE_TEMPORARY_SECONDS;
        if (dead || old) unlinkat(dirfd(dir), name.c_str(), 0);
    }
    closedir(dir);
}

}  // namespace FileIo
}  // namespace Relay
}  // namespace ZEPA
