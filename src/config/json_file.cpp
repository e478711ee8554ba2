// Reading and safely rewriting JSON files: the only way any JSON file of the
// system is read or written.
#define ZEPA_LOG_SOURCE "config"

#include <json/reader.h>
#include <json/writer.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <iostream>
#include <string>

#include <zeparelayd/config.h>

#include "common/log.h"

namespace ZEPA {
namespace Relay {

Config::~Config() = default;

std::ostream& operator<<(std::ostream& os, const Config& conf) {
    Json::Value full;
    conf.Write(full, true);
    Json::FastWriter writer;
    os << writer.write(full);
    return os;
}

bool RelaydConf::ReadJsonFile(const std::string& path, Json::Value& value) {
    value = Json::Value();
    if (path.empty()) return true;
    std::ifstream in(path.c_str());
    if (!in.is_open()) return true;  // a missing file shows itself as null

    Json::Reader reader;
    if (!reader.parse(in, value, false)) {
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

bool RelaydConf::WriteJsonFile(const std::string& path, const Json::Value& value) {
    Json::StyledWriter writer;
    if (path == "-") {
        std::cout << writer.write(value) << std::flush;
        return true;
    }
    const std::string tmp = path + ".tmp." + std::to_string(getpid());
    // An empty target names no file: its temporary file is never created in
    // whatever folder the process happens to run in.
    std::ofstream out;
    if (!path.empty()) out.open(tmp.c_str(), std::ios::out | std::ios::trunc);
    if (!out.is_open()) {
        ZLOG(ZEPA_LOG_ERR, "open failed [%s]", tmp.c_str());
        unlink(tmp.c_str());
        return false;
    }
    out << writer.write(value);
    out.flush();
    bool result = out.good();
    out.close();
    if (out.fail()) result = false;
    if (!result) {
        unlink(tmp.c_str());
        return false;
    }
    chmod(tmp.c_str(), 0644);
    if (rename(tmp.c_str(), path.c_str()) != 0) {
        // Logged, not reported: the old file is still whole.
        ZLOG(ZEPA_LOG_ERR, "rename to %s failed %m", path.c_str());
        unlink(tmp.c_str());
    }
    return result;
}

}  // namespace Relay
}  // namespace ZEPA
