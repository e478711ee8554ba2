#define ZEPA_LOG_SOURCE "config"

#include "config/config_lock.h"

#include <sys/file.h>
#include <unistd.h>

#include <cerrno>

#include "common/log.h"

namespace ZEPA {
namespace Relay {

namespace {

std::string LockName(const std::string& file) { return file.empty() ? std::string() : file + ".lock"; }

}  // namespace

ConfigWriteLock::ConfigWriteLock(const std::string& file)
    : _lock(file.empty() ? nullptr : LockName(file).c_str()) {
    if (file.empty()) return;
    unsigned int pauseUs = 100;
    for (int waitedUs = 0;;) {
        if (_lock.Lock(LOCK_EX)) return;
        if (errno != EWOULDBLOCK) {
            ZLOG(ZEPA_LOG_DEBUG, "lock [%s] not taken: %m", LockName(file).c_str());
            return;
        }
        if (waitedUs >= WAIT_MS * 1000) break;
        usleep(pauseUs);
        waitedUs += static_cast<int>(pauseUs);
        if (pauseUs < 10000) pauseUs *= 2;
    }
    ZLOG(ZEPA_LOG_ERR, "lock [%s] busy", LockName(file).c_str());
    _ok = false;
}

}  // namespace Relay
}  // namespace ZEPA
