// The lock that serialises read-modify-write cycles of one configuration file
// between processes: "<file>.lock" beside it, mode 0600.
#ifndef ZEPARELAYD_SRC_CONFIG_CONFIG_LOCK_H
#define ZEPARELAYD_SRC_CONFIG_CONFIG_LOCK_H

#include <string>

#include <zeparelayd/filelock.h>

namespace ZEPA {
namespace Relay {

class ConfigWriteLock {
public:
    // Waits up to WAIT_MS for the lock. An empty path or a folder where no
    // lock file can be made takes no lock: the write itself then reports why
    // it fails.
    explicit ConfigWriteLock(const std::string& file);
    // false only when another writer kept the lock past the wait.
    bool Held() const { return _ok; }

    static const int WAIT_MS = 10000;

private:
    FileLock _lock;
    bool _ok = true;
};

}  // namespace Relay
}  // namespace ZEPA

#endif
