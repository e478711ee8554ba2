// Advisory flock over a set of files held as one unit: after Lock either
// every file is locked or, on failure, none is. Never waits.
#ifndef ZEPARELAYD_FILELOCK_H
#define ZEPARELAYD_FILELOCK_H

#include <string>
#include <vector>

#include <zeparelayd/export.h>

// Deliberately in the global namespace: tools outside the library use it too.
class ZEPARELAYD_API FileLock {
public:
    // Adds path (unlocked); a null path adds nothing.
    explicit FileLock(const char* path);
    // Releases every lock held; the lock files stay on disk.
    ~FileLock();
    FileLock(const FileLock&) = delete;
    FileLock& operator=(const FileLock&) = delete;

    // Appends path to the set (the same path may be added twice). false for null.
    bool AddFile(const char* path);
    // Entries cannot be removed: always false, the set is unchanged.
    bool RemoveFile(const char* path);
    // op is LOCK_SH or LOCK_EX; LOCK_NB is always added. Files are created
    // (mode 0600) when missing; a symbolic link at a name is never followed (the
    // lock fails). Held entries are skipped. On any failure
    // everything is released and the result is false (errno from the call).
    bool Lock(int op);
    // Releases and closes every entry. true unless the set is inconsistent.
    bool Unlock();

private:
    bool Consistent() const;
    bool Fail();

    std::vector<std::string> _files;
    std::vector<int> _fds;
};

#endif
