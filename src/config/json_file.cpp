// Reading and safely rewriting JSON files: the only way any JSON file of the
// system is read or written.
#define ZEPA_LOG_SOURCE "config"

#include <json/reader.h>
#include <json/writer.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <exception>
#include <iostream>
#include <string>

#include <zeparelayd/config.h>

#include "common/file_io.h"
#include "common/log.h"

namespace ZEPA {
namespace Relay {

Config::~Config() = default;

std::ostream& operator<<(std::ostream& os, const Config& conf) {
    Json::Value full;
    conf.Write(full, true);
    try {
        Json::FastWriter writer;
        os << writer.write(full);
    } catch (const std::exception&) {
        // A stream set to throw, or no memory left: the stream stays failed.
        try {
            os.setstate(std::ios::badbit);
        } catch (const std::exception&) {
        }
    }
    return os;
}

bool RelaydConf::ReadJsonFile(const std::string& path, Json::Value& value) {
    value = Json::Value();
    if (path.empty()) return true;
    // A missing, unreadable, oversized or non-regular file (a FIFO, device or
    // folder planted at the name) shows itself as null, without blocking.
    std::string text;
    if (FileIo::ReadRegular(path, FileIo::MAX_FILE_BYTES, text) != FileIo::ReadResult::OK) return true;

    if (!FileIo::ParseJson(text, value)) {
        ZLOG(ZEPA_LOG_ERR, "bad json format [%s]", path.c_str());
        const std::string bad = path + ".bad";
        if (rename(path.c_str(), bad.c_str()) != 0) {
            ZLOG(ZEPA_LOG_ERR, "rename %s to .bad failed. %m", path.c_str());
            unlink(path.c_str());
        }
    }
    // Deliberately true on every path: callers see a null or non-object value.
    return true;
}

namespace {

bool StyledText(const Json::Value& value, std::string& text) {
    try {
        Json::StyledWriter writer;
        text = writer.write(value);
        return true;
    } catch (const std::exception&) {
        return false;
    }
}

}  // namespace

bool RelaydConf::WriteJsonFile(const std::string& path, const Json::Value& value) {
    std::string text;
    if (!StyledText(value, text)) return false;
    if (path == "-") {
        std::cout << text << std::flush;
        return true;
    }
    const std::string tmp = FileIo::TemporaryName(path);
    int fd = -1;
    // An empty target names no file: nothing is created or removed in
    // whatever folder the process happens to run in.
    if (!path.empty()) {
        FileIo::RemoveStaleTemporaries(path);
        bool removedForeign = false;
        fd = FileIo::OpenTemporary(tmp, removedForeign);
        if (removedForeign) ZLOG(ZEPA_LOG_WARNING, "removed what stood at %s", tmp.c_str());
    }
    if (fd < 0) {
        ZLOG(ZEPA_LOG_ERR, "open failed [%s]", tmp.c_str());
        if (!path.empty()) unlink(tmp.c_str());
        return false;
    }
    // The data reaches the disk before the name does, so that a power loss
    // leaves the old file or the new one, never an empty one.
    bool result = FileIo::WriteAll(fd, text.data(), text.size()) && fsync(fd) == 0 && fchmod(fd, 0644) == 0;
    if (close(fd) != 0) result = false;
    if (!result) {
        unlink(tmp.c_str());
        return false;
    }
    bool removedForeign = false;
    const int renameErrno = FileIo::Publish(tmp, path, removedForeign);
    if (renameErrno != 0) {
        // Logged, not reported: the old file is still whole.
        errno = renameErrno;
        ZLOG(ZEPA_LOG_ERR, "rename to %s failed %m", path.c_str());
        unlink(tmp.c_str());
        return result;
    }
    if (removedForeign) ZLOG(ZEPA_LOG_WARNING, "removed what stood at %s", path.c_str());
    FileIo::SyncFolderOf(path);
    return result;
}

}  // namespace Relay
}  // namespace ZEPA
