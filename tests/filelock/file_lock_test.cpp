#include <zeparelayd/filelock.h>

#include <dirent.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "support/test_support.h"

namespace {

class FileLockTest : public zepatest::RootTest {
protected:
    std::string Path(const char* name) const { return root.path(std::string("/tmp/") + name); }
    void SetUp() override {
        RootTest::SetUp();
        root.mkdir("/tmp");
    }
};

int OpenDescriptorCount() {
    int count = 0;
    DIR* dir = opendir("/proc/self/fd");
    while (dirent* entry = readdir(dir)) {
        if (entry->d_name[0] != '.') ++count;
    }
    closedir(dir);
    return count;
}

// True when an independent open file description can take an exclusive lock.
bool FreeForOthers(const std::string& path) {
    FileLock other(path.c_str());
    return other.Lock(LOCK_EX);
}

// A child process that holds an exclusive lock on path until told to go.
class LockHolder {
public:
    explicit LockHolder(const std::string& path) {
        int ready[2];
        EXPECT_EQ(0, pipe(ready));
        EXPECT_EQ(0, pipe(_release));
        _pid = fork();
        if (_pid == 0) {
            close(ready[0]);
            close(_release[1]);
            FileLock lock(path.c_str());
            char ok = lock.Lock(LOCK_EX) ? 'y' : 'n';
            if (write(ready[1], &ok, 1) != 1) _exit(2);
            char go;
            if (read(_release[0], &go, 1) < 0) _exit(3);
            _exit(0);
        }
        close(ready[1]);
        close(_release[0]);
        char ok = 'n';
        EXPECT_EQ(1, read(ready[0], &ok, 1));
        close(ready[0]);
        _holding = ok == 'y';
    }
    ~LockHolder() {
        close(_release[1]);
        int status = 0;
        waitpid(_pid, &status, 0);
    }
    bool holding() const { return _holding; }

private:
    pid_t _pid;
    int _release[2];
    bool _holding = false;
};

TEST_F(FileLockTest, PathInMissingDirectoryFailsAndHoldsNothing) {
    FileLock lock(root.path("/missing/dir/x.lock").c_str());
    errno = 0;
    EXPECT_FALSE(lock.Lock(LOCK_EX));
    EXPECT_EQ(ENOENT, errno);
    EXPECT_FALSE(zepatest::FileExists(root.path("/missing/dir/x.lock")));
}

TEST_F(FileLockTest, MissingDirectoryAfterGoodFileReleasesTheGoodOne) {
    FileLock lock(Path("a.lock").c_str());
    ASSERT_TRUE(lock.AddFile(root.path("/missing/b.lock").c_str()));
    EXPECT_FALSE(lock.Lock(LOCK_EX));
    EXPECT_TRUE(FreeForOthers(Path("a.lock")));
}

TEST_F(FileLockTest, SecondObjectOnSamePathFailsAtOnceWithWouldBlock) {
    FileLock first(Path("a.lock").c_str());
    FileLock second(Path("a.lock").c_str());
    ASSERT_TRUE(first.Lock(LOCK_EX));
    errno = 0;
    EXPECT_FALSE(second.Lock(LOCK_EX));
    EXPECT_EQ(EWOULDBLOCK, errno);
}

TEST_F(FileLockTest, LockHeldByAnotherProcessFailsWithoutWaiting) {
    LockHolder holder(Path("a.lock"));
    ASSERT_TRUE(holder.holding());
    FileLock lock(Path("a.lock").c_str());
    errno = 0;
    EXPECT_FALSE(lock.Lock(LOCK_EX));
    EXPECT_EQ(EWOULDBLOCK, errno);
    EXPECT_FALSE(lock.Lock(LOCK_SH));
}

TEST_F(FileLockTest, SecondFileBusyElsewhereReleasesTheFirst) {
    LockHolder holder(Path("b.lock"));
    ASSERT_TRUE(holder.holding());
    FileLock lock(Path("a.lock").c_str());
    lock.AddFile(Path("b.lock").c_str());
    EXPECT_FALSE(lock.Lock(LOCK_EX));
    EXPECT_TRUE(FreeForOthers(Path("a.lock")));
}

TEST_F(FileLockTest, FailedLockDropsLocksHeldBeforeTheCall) {
    FileLock lock(Path("a.lock").c_str());
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    ASSERT_FALSE(FreeForOthers(Path("a.lock")));
    LockHolder holder(Path("b.lock"));
    ASSERT_TRUE(holder.holding());
    lock.AddFile(Path("b.lock").c_str());
    EXPECT_FALSE(lock.Lock(LOCK_EX));
    EXPECT_TRUE(FreeForOthers(Path("a.lock")));
}

TEST_F(FileLockTest, LockTwiceSucceedsAndOpensEachFileOnce) {
    FileLock lock(Path("a.lock").c_str());
    lock.AddFile(Path("b.lock").c_str());
    int before = OpenDescriptorCount();
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_EQ(before + 2, OpenDescriptorCount());
    EXPECT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_EQ(before + 2, OpenDescriptorCount());
    EXPECT_TRUE(lock.Unlock());
    EXPECT_EQ(before, OpenDescriptorCount());
}

TEST_F(FileLockTest, EntryAddedWhileLockedIsHeldOnlyAfterNextLock) {
    FileLock lock(Path("a.lock").c_str());
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    ASSERT_TRUE(lock.AddFile(Path("b.lock").c_str()));
    EXPECT_TRUE(FreeForOthers(Path("b.lock")));
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_FALSE(FreeForOthers(Path("b.lock")));
    EXPECT_FALSE(FreeForOthers(Path("a.lock")));
}

TEST_F(FileLockTest, RemoveFileReturnsFalseAndKeepsTheEntry) {
    FileLock lock(Path("a.lock").c_str());
    EXPECT_FALSE(lock.RemoveFile(Path("a.lock").c_str()));
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_TRUE(zepatest::FileExists(Path("a.lock")));
    EXPECT_FALSE(FreeForOthers(Path("a.lock")));
}

TEST_F(FileLockTest, UnlockOfASetNeverLockedIsTrue) {
    FileLock lock(Path("a.lock").c_str());
    lock.AddFile(Path("b.lock").c_str());
    EXPECT_TRUE(lock.Unlock());
    EXPECT_FALSE(zepatest::FileExists(Path("a.lock")));
}

TEST_F(FileLockTest, UnlockReleasesEveryFile) {
    FileLock lock(Path("a.lock").c_str());
    lock.AddFile(Path("b.lock").c_str());
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_TRUE(lock.Unlock());
    EXPECT_TRUE(FreeForOthers(Path("a.lock")));
    EXPECT_TRUE(FreeForOthers(Path("b.lock")));
}

TEST_F(FileLockTest, LockFilesOutliveTheObjectAndItsLocks) {
    {
        FileLock lock(Path("a.lock").c_str());
        ASSERT_TRUE(lock.Lock(LOCK_EX));
    }
    EXPECT_TRUE(zepatest::FileExists(Path("a.lock")));
    EXPECT_TRUE(FreeForOthers(Path("a.lock")));
}

TEST_F(FileLockTest, CreatedLockFileHasModeSixHundred) {
    FileLock lock(Path("a.lock").c_str());
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_EQ(0600u, zepatest::FileMode(Path("a.lock")) & 0777);
}

TEST_F(FileLockTest, ExistingLockFileKeepsContentAndMode) {
    zepatest::WriteFile(Path("a.lock"), "content", 0644);
    FileLock lock(Path("a.lock").c_str());
    ASSERT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_EQ("content", zepatest::ReadFile(Path("a.lock")));
    EXPECT_EQ(0644u, zepatest::FileMode(Path("a.lock")) & 0777);
}

TEST_F(FileLockTest, SharedLocksCoexistButExcludeAnExclusiveOne) {
    FileLock first(Path("a.lock").c_str());
    FileLock second(Path("a.lock").c_str());
    ASSERT_TRUE(first.Lock(LOCK_SH));
    EXPECT_TRUE(second.Lock(LOCK_SH));
    EXPECT_FALSE(FreeForOthers(Path("a.lock")));
}

TEST_F(FileLockTest, SamePathAddedTwiceCountsAsTwoEntries) {
    FileLock exclusive(Path("a.lock").c_str());
    exclusive.AddFile(Path("a.lock").c_str());
    // The second entry opens its own description, which the first excludes.
    EXPECT_FALSE(exclusive.Lock(LOCK_EX));
    EXPECT_TRUE(FreeForOthers(Path("a.lock")));

    FileLock shared(Path("a.lock").c_str());
    shared.AddFile(Path("a.lock").c_str());
    int before = OpenDescriptorCount();
    EXPECT_TRUE(shared.Lock(LOCK_SH));
    EXPECT_EQ(before + 2, OpenDescriptorCount());
}

TEST_F(FileLockTest, NullPathsAreRefused) {
    FileLock lock(nullptr);
    EXPECT_FALSE(lock.AddFile(nullptr));
    // Nothing was added: an empty set locks and unlocks trivially.
    EXPECT_TRUE(lock.Lock(LOCK_EX));
    EXPECT_TRUE(lock.Unlock());
}

TEST_F(FileLockTest, LockNeverBlocksEvenWhenNotAskedForNonBlocking) {
    LockHolder holder(Path("a.lock"));
    ASSERT_TRUE(holder.holding());
    FileLock lock(Path("a.lock").c_str());
    // Without LOCK_NB being added this call would hang the test.
    EXPECT_FALSE(lock.Lock(LOCK_EX));
}

}  // namespace
