#include "support/test_support.h"

#include <dirent.h>
#include <fcntl.h>
#include <json/reader.h>
#include <json/writer.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zepasdk/sysroot.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include <zeparelayd/daemon.h>

namespace zepatest {

namespace {

void RemoveTree(const std::string& dir) {
    std::string cmd = "rm -rf '" + dir + "'";
    if (system(cmd.c_str()) != 0) fprintf(stderr, "warning: could not remove %s\n", dir.c_str());
}

std::string MakeTempFile(const char* prefix) {
    std::string tmpl = std::string("/tmp/") + prefix + ".XXXXXX";
    int fd = mkstemp(&tmpl[0]);
    if (fd < 0) throw std::runtime_error("mkstemp failed");
    close(fd);
    return tmpl;
}

int Redirect(int target, const std::string& file) {
    fflush(target == 2 ? stderr : stdout);
    int saved = dup(target);
    int fd = open(file.c_str(), O_WRONLY | O_TRUNC);
    dup2(fd, target);
    close(fd);
    return saved;
}

void Restore(int target, int saved) {
    fflush(target == 2 ? stderr : stdout);
    dup2(saved, target);
    close(saved);
}

}  // namespace

TempRoot::TempRoot() {
    char tmpl[] = "/tmp/zepatest.XXXXXX";
    if (mkdtemp(tmpl) == nullptr) throw std::runtime_error("mkdtemp failed");
    _dir = tmpl;
    ZEPASysRootSet(_dir.c_str());
}

TempRoot::~TempRoot() {
    ZEPASysRootSet("/");
    RemoveTree(_dir);
}

std::string TempRoot::path(const std::string& absPath) const { return _dir + absPath; }

void TempRoot::write(const std::string& absPath, const std::string& content, mode_t mode) const {
    WriteFile(path(absPath), content, mode);
}

std::string TempRoot::read(const std::string& absPath) const { return ReadFile(path(absPath)); }

bool TempRoot::exists(const std::string& absPath) const { return FileExists(path(absPath)); }

void TempRoot::mkdir(const std::string& absPath) const { MakeDirs(path(absPath)); }

StderrCapture::StderrCapture() : _file(MakeTempFile("zepatest-stderr")), _stopped(false) {
    _saved = Redirect(2, _file);
}

StderrCapture::~StderrCapture() { stop(); }

std::string StderrCapture::stop() {
    if (_stopped) return "";
    _stopped = true;
    Restore(2, _saved);
    std::string text = ReadFile(_file);
    unlink(_file.c_str());
    return text;
}

StdoutCapture::StdoutCapture() : _file(MakeTempFile("zepatest-stdout")), _stopped(false) {
    _saved = Redirect(1, _file);
}

StdoutCapture::~StdoutCapture() { stop(); }

std::string StdoutCapture::stop() {
    if (_stopped) return "";
    _stopped = true;
    Restore(1, _saved);
    std::string text = ReadFile(_file);
    unlink(_file.c_str());
    return text;
}

std::vector<std::string> LogMessages(const std::string& captured) {
    std::vector<std::string> out;
    std::istringstream in(captured);
    std::string line;
    while (std::getline(in, line)) {
        // "Mon Jan  5 09:07:03 2015 " is 25 characters.
        if (line.size() >= 25 && line[24] == ' ' && line[3] == ' ' && line[7] == ' ')
            out.push_back(line.substr(25));
        else
            out.push_back(line);
    }
    return out;
}

bool LogContains(const std::string& captured, const std::string& needle) {
    for (const std::string& m : LogMessages(captured))
        if (m.find(needle) != std::string::npos) return true;
    return false;
}

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

void WriteFile(const std::string& path, const std::string& content, mode_t mode) {
    size_t slash = path.rfind('/');
    if (slash != std::string::npos && slash > 0) MakeDirs(path.substr(0, slash));
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << content;
    out.close();
    chmod(path.c_str(), mode);
}

bool FileExists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

std::string FindProgram(const std::string& name) {
    const char* path = getenv("PATH");
    std::istringstream dirs(path != nullptr ? path : "/usr/bin:/bin");
    for (std::string dir; std::getline(dirs, dir, ':');) {
        if (dir.empty()) continue;
        const std::string candidate = dir + "/" + name;
        if (access(candidate.c_str(), X_OK) == 0) return candidate;
    }
    return "";
}

bool SetAge(const std::string& path, int seconds) {
    timespec times[2];
    clock_gettime(CLOCK_REALTIME, &times[0]);
    times[0].tv_sec -= seconds;
    times[1] = times[0];
    return utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW) == 0;
}

void RemoveWithBad(const std::string& path) {
    std::string cmd = "rm -rf '" + path + "' '" + path + ".bad'";
    if (system(cmd.c_str()) != 0) throw std::runtime_error("cannot remove " + path);
}

bool PlantHostile(const std::string& kind, const std::string& path) {
    RemoveWithBad(path);
    if (kind == "fifo") return mkfifo(path.c_str(), 0666) == 0;
    if (kind == "folder") {
        MakeDirs(path + "/inside");
        return true;
    }
    if (kind == "device") return symlink("/dev/zero", path.c_str()) == 0;
    // Another user's (65534) entries: only root can make them.
    if (kind == "foreign-folder") {
        MakeDirs(path + "/inside/deeper");
        WriteFile(path + "/inside/file", "x");
        if (symlink("/", (path + "/inside/to-root").c_str()) != 0) return false;
        for (const char* sub : {"/inside/deeper", "/inside/file", "/inside/to-root", "/inside", ""})
            if (lchown((path + sub).c_str(), 65534, 65534) != 0) return false;
        return true;
    }
    if (kind == "foreign-file") {
        WriteFile(path, "not yours", 0644);
        return chown(path.c_str(), 65534, 65534) == 0;
    }
    if (kind == "second-link") {
        const std::string other = path + ".elsewhere";
        WriteFile(other, "kept", 0644);
        return link(other.c_str(), path.c_str()) == 0;
    }
    if (kind == "huge") {
        int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        if (fd < 0) return false;
        bool ok = ftruncate(fd, 1024L * 1024 * 1024) == 0;
        close(fd);
        return ok;
    }
    if (kind == "nested") {
        WriteFile(path, "{\"pid\": 1, \"a\": " + std::string(1001, '[') + std::string(1001, ']') + "}");
        return true;
    }
    return false;
}

std::vector<std::string> TemporariesOf(const std::string& path) {
    std::string::size_type slash = path.rfind('/');
    std::string folder = slash == std::string::npos ? "." : path.substr(0, slash == 0 ? 1 : slash);
    std::string prefix = (slash == std::string::npos ? path : path.substr(slash + 1)) + ".tmp.";
    std::vector<std::string> names;
    DIR* dir = opendir(folder.c_str());
    if (dir == nullptr) return names;
    for (dirent* e = readdir(dir); e != nullptr; e = readdir(dir)) {
        std::string name = e->d_name;
        if (name.compare(0, prefix.size(), prefix) == 0) names.push_back(name);
    }
    closedir(dir);
    return names;
}

void MakeDirs(const std::string& path) {
    std::string cur;
    std::istringstream in(path);
    std::string part;
    if (!path.empty() && path[0] == '/') cur = "";
    while (std::getline(in, part, '/')) {
        if (part.empty()) continue;
        cur += "/" + part;
        ::mkdir(cur.c_str(), 0755);
    }
}

mode_t FileMode(const std::string& path) {
    struct stat st;
    if (stat(path.c_str(), &st) != 0) return 0;
    return st.st_mode & 07777;
}

Json::Value ParseJson(const std::string& text) {
    Json::Value v;
    Json::Reader reader;
    if (!reader.parse(text, v, false)) throw std::runtime_error("bad JSON in test: " + text);
    return v;
}

std::string ToJson(const Json::Value& value) {
    Json::FastWriter w;
    return w.write(value);
}

void RootTest::SetUp() {
    ZEPA::Relay::Daemon::_logLevel = 4;
    ZEPA::Relay::Daemon::_strLogFile.clear();
}

void RootTest::TearDown() {}

}  // namespace zepatest
