// All-or-nothing non-blocking flock over a set of files.
#include <zeparelayd/filelock.h>

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>

FileLock::FileLock(const char* path) { AddFile(path); }

FileLock::~FileLock() { Unlock(); }

bool FileLock::Consistent() const { return _files.size() == _fds.size(); }

// Releases everything but keeps errno as the failing call left it.
bool FileLock::Fail() {
    int saved = errno;
    Unlock();
    errno = saved;
    return false;
}

bool FileLock::AddFile(const char* path) {
    if (path == nullptr) return false;
    _files.emplace_back(path);
    _fds.push_back(-1);
    return true;
}

// Deliberately a stub: callers must not rely on removal.
bool FileLock::RemoveFile(const char* /*path*/) { return false; }

bool FileLock::Lock(int op) {
    if (!Consistent()) return false;
    for (size_t i = 0; i < _files.size(); ++i) {
        if (_fds[i] >= 0) continue;
        int fd =
            open(_files[i].c_str(), O_RDWR | O_CREAT | O_NONBLOCK | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY, 0600);
        if (fd < 0) return Fail();
        if (flock(fd, op | LOCK_NB) != 0) {
            int saved = errno;
            close(fd);
            errno = saved;
            return Fail();
        }
        _fds[i] = fd;
    }
    return true;
}

bool FileLock::Unlock() {
    if (!Consistent()) return false;
    for (int& fd : _fds) {
        // Entries not held pass -1, which fails harmlessly.
        flock(fd, LOCK_UN);
        close(fd);
        fd = -1;
    }
    return true;
}
