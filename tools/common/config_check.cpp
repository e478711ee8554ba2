#include "config_check.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>

#include <json/reader.h>
#include <json/value.h>

#include <zeparelayd/config.h>

namespace zepatools {

namespace {

const off_t kMaxSize = static_cast<off_t>(ZEPA::Relay::JSON_FILE_MAX_BYTES);

class Checker {
public:
    Checker(const std::string& path, ConfigCheck& out) : _path(path), _out(out) {}

    bool Read() {
        // A link is followed as the library's reader does (the configuration's
        // folder is root's); what it leads to must still be a regular file.
        const int fd = open(_path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
        if (fd < 0) return Fail(std::string("cannot open: ") + strerror(errno));
        struct stat st;
        if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
            close(fd);
            return Fail("not a regular file");
        }
        if (st.st_size > kMaxSize) {
            close(fd);
            return Fail("larger than 1 MiB");
        }
        char buf[65536];
        ssize_t n;
        while ((n = read(fd, buf, sizeof(buf))) > 0 && _text.size() <= static_cast<size_t>(kMaxSize)) {
            _text.append(buf, static_cast<size_t>(n));
        }
        const int readErrno = errno;
        close(fd);
        if (n < 0) return Fail(std::string("cannot read: ") + strerror(readErrno));
        return true;
    }

    bool Parse() {
        // The library reads with a nesting limit; a file it would refuse must
        // not pass here. The older reader below gives line and column of a
        // syntax error but throws past its own, deeper limit.
        if (!WithinDepth()) {
            return Fail("nested deeper than " + std::to_string(ZEPA::Relay::JSON_FILE_MAX_DEPTH) + " levels");
        }
        try {
            Json::Reader reader;
            if (reader.parse(_text, _root, false)) return true;
            for (const Json::Reader::StructuredError& e : reader.getStructuredErrors()) {
                At(static_cast<size_t>(e.offset_start), e.message);
            }
        } catch (const std::exception& e) {
            _root = Json::Value();
            return Fail(std::string("not valid JSON (") + e.what() + ")");
        }
        if (_out.errors.empty()) Fail("not valid JSON");
        return false;
    }

    bool WithinDepth() const {
        try {
            Json::CharReaderBuilder builder;
            builder["stackLimit"] = ZEPA::Relay::JSON_FILE_MAX_DEPTH;
            std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
            Json::Value ignored;
            reader->parse(_text.data(), _text.data() + _text.size(), &ignored, nullptr);
            return true;
        } catch (const Json::Exception&) {
            return false;  // past the limit
        } catch (const std::exception&) {
            return true;  // no memory: the parse below fails and says so
        }
    }

    void CheckShape() {
        if (!_root.isObject()) {
            At(0, "the configuration must be a JSON object");
            return;
        }
        Expect("serverID", Json::stringValue, "a string");
        Expect("log_file", Json::stringValue, "a string");
        Expect("log_level", Json::intValue, "an integer");
        for (const char* key : {"server_global", "server_control", "server_waitcmd", "server_alias",
                                "server_myhub", "support_channel"}) {
            Expect(key, Json::objectValue, "an object");
        }
        Expect("service", Json::arrayValue, "an array");
        if (_root["log_level"].isInt() &&
            (_root["log_level"].asInt() < 0 || _root["log_level"].asInt() > 7)) {
            At(_root["log_level"], "\"log_level\" must be a syslog priority from 0 to 7");
        }
    }

    // What the daemon's reload would refuse, in the library's own order.
    void CheckSections() {
        if (!_out.errors.empty()) return;
        ZEPA::Relay::RelaydConf conf(nullptr);
        conf.Overwrite(_root);
        struct Section {
            const char* key;
            bool valid;
        };
        const Section sections[] = {
            {"server_global", conf.serverGlobal.IsValid()},
            {"server_control", conf.serverControl.IsValid()},
            {"server_waitcmd", conf.serverWaitCmd.IsValid()},
            {"server_alias", conf.alias.IsValid()},
            {"server_myhub", conf.myhub.IsValid()},
        };
        for (const Section& s : sections) {
            if (!s.valid) At(_root[s.key], std::string("\"") + s.key + "\" is not a usable server section");
        }
        const Json::Value& services = _root["service"];
        if (!services.isArray()) return;
        for (Json::ArrayIndex i = 0; i < services.size(); ++i) {
            const std::string where = "service " + std::to_string(i);
            if (!services[i].isObject() || !services[i]["id"].isString()) {
                At(services[i], where + " must be an object with a string \"id\"");
                continue;
            }
            ZEPA::Relay::ServiceConf service(services[i], true);
            if (!service.IsValid()) {
                _out.warnings.push_back(Where(services[i].getOffsetStart()) + where + " (\"" +
                                        services[i]["id"].asString() + "\") is invalid and will be skipped");
            }
        }
    }

private:
    bool Fail(const std::string& message) {
        _out.errors.push_back(_path + ": " + message);
        return false;
    }

    std::string Where(size_t offset) const {
        int line = 1;
        int column = 1;
        for (size_t i = 0; i < offset && i < _text.size(); ++i) {
            if (_text[i] == '\n') {
                ++line;
                column = 1;
            } else {
                ++column;
            }
        }
        return _path + ":" + std::to_string(line) + ":" + std::to_string(column) + ": ";
    }

    void At(size_t offset, const std::string& message) { _out.errors.push_back(Where(offset) + message); }
    void At(const Json::Value& value, const std::string& message) {
        At(static_cast<size_t>(value.getOffsetStart()), message);
    }

    void Expect(const char* key, Json::ValueType type, const char* what) {
        if (!_root.isMember(key)) return;
        const Json::Value& value = _root[key];
        // An int that fits counts as an int whichever way the parser stored it.
        const bool ok = type == Json::intValue ? value.isInt() : value.type() == type;
        if (!ok) At(value, std::string("\"") + key + "\" must be " + what);
    }

    const std::string& _path;
    ConfigCheck& _out;
    std::string _text;
    Json::Value _root;
};

}  // namespace

ConfigCheck CheckConfigFile(const std::string& path) {
    ConfigCheck result;
    Checker checker(path, result);
    if (checker.Read() && checker.Parse()) {
        checker.CheckShape();
        checker.CheckSections();
    }
    return result;
}

bool ReportConfigCheck(const char* program, const std::string& path) {
    const ConfigCheck check = CheckConfigFile(path);
    for (const std::string& w : check.warnings) fprintf(stderr, "%s: warning: %s\n", program, w.c_str());
    for (const std::string& e : check.errors) fprintf(stderr, "%s: %s\n", program, e.c_str());
    if (check.ok()) printf("%s: configuration OK\n", path.c_str());
    return check.ok();
}

}  // namespace zepatools
