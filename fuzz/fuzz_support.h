// Shared by the fuzz targets: a private system root for targets that read and
// write files (made on the first input, removed at exit), a property check,
// and the bounded, exception-free JSON parse the daemon uses for answers.
#ifndef ZEPARELAYD_FUZZ_FUZZ_SUPPORT_H
#define ZEPARELAYD_FUZZ_FUZZ_SUPPORT_H

#include <json/reader.h>

#include <unistd.h>
#include <zepasdk/sysroot.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <string>

#include <zeparelayd/daemon.h>

namespace fuzzsupport {

inline std::string& Dir() {
    static std::string dir;
    return dir;
}

// Creates the root once, quiets the library log, returns the root folder.
inline const std::string& Use() {
    if (!Dir().empty()) return Dir();
    static char tmpl[] = "/tmp/zepafuzz.XXXXXX";
    if (mkdtemp(tmpl) == nullptr) abort();
    Dir() = tmpl;
    ZEPASysRootSet(tmpl);
    ZEPA::Relay::Daemon::_logLevel = 2;  // failure lines are expected here
    atexit([] {
        std::string cmd = "rm -rf '" + Dir() + "'";
        if (system(cmd.c_str()) != 0) fprintf(stderr, "could not remove %s\n", Dir().c_str());
    });
    std::string cmd =
        "mkdir -p '" + Dir() + "/usr/zepa/etc/zeparelayd' '" + Dir() + "/tmp' '" + Dir() + "/etc'";
    if (system(cmd.c_str()) != 0) abort();
    return Dir();
}

// Writes bytes to absPath below the root.
inline std::string Put(const std::string& absPath, const uint8_t* data, size_t size) {
    std::string path = Use() + absPath;
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
    return path;
}

// Aborts with the property's name when it does not hold.
inline void Check(bool ok, const char* what) {
    if (!ok) {
        fprintf(stderr, "property failed: %s\n", what);
        abort();
    }
}

// Depth-bounded parse that never throws; out is null after a failure.
inline bool Parse(const std::string& text, Json::Value& out) {
    Json::CharReaderBuilder builder;
    builder["stackLimit"] = 64;
    std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
    try {
        if (reader->parse(text.data(), text.data() + text.size(), &out, nullptr)) return true;
    } catch (const Json::Exception&) {
    }
    out = Json::Value();
    return false;
}

}  // namespace fuzzsupport

#endif
