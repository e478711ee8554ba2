#include "common/file_io.h"

#include <dirent.h>
#include <fcntl.h>
#include <json/reader.h>
#include <libdaemon/dpid.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdint>
#include <cstring>
#include <ctime>
#include <exception>
#include <memory>
#include <new>

#include "common/paths.h"

namespace ZEPA {
namespace Relay {
namespace FileIo {

namespace {

const char TMP_INFIX[] = ".tmp.";
const size_t RANDOM_CHARS = 8;
const char ALPHABET[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
const char DAEMON_NAME[] = "zeparelayd";
// The kernel keeps 15 characters of a command name.
const size_t COMM_CHARS = 15;

std::string RandomSuffix() {
    unsigned char bytes[RANDOM_CHARS];
    if (getrandom(bytes, sizeof(bytes), GRND_NONBLOCK) != static_cast<ssize_t>(sizeof(bytes))) {
        // Unpredictability is a bonus: the exclusive create is what keeps us safe.
        // 64 bits on every target: the generator's constants and shift need them.
        uint64_t mix = static_cast<uint64_t>(time(nullptr)) ^ (static_cast<uint64_t>(getpid()) << 16) ^
                       static_cast<uint64_t>(clock());
        for (unsigned char& b : bytes) {
            mix = mix * 6364136223846793005ULL + 1442695040888963407ULL;
            b = static_cast<unsigned char>(mix >> 33);
        }
    }
    std::string out;
    for (unsigned char b : bytes) out += ALPHABET[b % (sizeof(ALPHABET) - 1)];
    return out;
}

bool AllDigits(const std::string& s) {
    if (s.empty()) return false;
    for (char c : s)
        if (c < '0' || c > '9') return false;
    return true;
}

bool AllAlnum(const std::string& s) {
    for (char c : s)
        if (strchr(ALPHABET, c) == nullptr || c == '\0') return false;
    return true;
}

// The pid of a temporary-file name of base: "<base>.tmp.<pid>" or
// "<base>.tmp.<pid>.<random>"; 0 when the name is not of that pattern.
pid_t TemporaryPid(const std::string& name, const std::string& base) {
    const std::string prefix = base + TMP_INFIX;
    if (name.compare(0, prefix.size(), prefix) != 0) return 0;
    std::string rest = name.substr(prefix.size());
    std::string::size_type dot = rest.find('.');
    if (dot != std::string::npos) {
        std::string suffix = rest.substr(dot + 1);
        if (suffix.size() != RANDOM_CHARS || !AllAlnum(suffix)) return 0;
        rest = rest.substr(0, dot);
    }
    if (!AllDigits(rest) || rest.size() > 9) return 0;
    return static_cast<pid_t>(atol(rest.c_str()));
}

void SplitPath(const std::string& path, std::string& folder, std::string& base) {
    std::string::size_type slash = path.rfind('/');
    if (slash == std::string::npos) {
        folder = ".";
        base = path;
    } else {
        folder = slash == 0 ? "/" : path.substr(0, slash);
        base = path.substr(slash + 1);
    }
}

std::string ReadSmall(const std::string& path) {
    std::string text;
    ReadRegular(path, 256, text);  // /proc files are regular
    return text;
}

}  // namespace

ReadResult ReadRegular(const std::string& path, size_t limit, std::string& out, bool followLinks) {
    out.clear();
    int flags = O_RDONLY | O_NONBLOCK | O_CLOEXEC | O_NOCTTY;
    if (!followLinks) flags |= O_NOFOLLOW;
    int fd = open(path.c_str(), flags);
    if (fd < 0) return ReadResult::MISSING;
    std::unique_ptr<int, void (*)(int*)> guard(&fd, [](int* f) { close(*f); });
    struct stat st;
    if (fstat(fd, &st) != 0) return ReadResult::FAILED;
    if (!S_ISREG(st.st_mode)) return ReadResult::NOT_REGULAR;
    if (st.st_size < 0 || static_cast<unsigned long long>(st.st_size) > limit) return ReadResult::TOO_LARGE;
    try {
        // The size may change while we read; never take more than limit.
        char buf[16384];
        for (;;) {
            ssize_t n = read(fd, buf, sizeof(buf));
            if (n < 0 && errno == EINTR) continue;
            if (n < 0) {
                out.clear();
                return ReadResult::FAILED;
            }
            if (n == 0) break;
            if (out.size() + static_cast<size_t>(n) > limit) {
                out.clear();
                return ReadResult::TOO_LARGE;
            }
            out.append(buf, static_cast<size_t>(n));
        }
    } catch (const std::exception&) {
        out.clear();
        return ReadResult::FAILED;
    }
    return ReadResult::OK;
}

bool ParseJson(const std::string& text, Json::Value& out) {
    out = Json::Value();
    try {
        Json::CharReaderBuilder builder;
        builder["collectComments"] = false;
        builder["stackLimit"] = MAX_JSON_DEPTH;
        std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
        const char* begin = text.data();
        return reader->parse(begin, begin + text.size(), &out, nullptr);
    } catch (const std::exception&) {
        // jsoncpp throws past the nesting limit; bad_alloc for a huge input.
        // What it built of such a text is no value of ours.
        out = Json::Value();
        return false;
    }
}

std::string ClipForLog(const std::string& text) {
    if (text.size() <= MAX_LOGGED_BODY) return text;
    return text.substr(0, MAX_LOGGED_BODY) + "... (" + std::to_string(text.size()) + " bytes)";
}

int CreateTemporary(const std::string& path, std::string& name) {
    const std::string stem = path + TMP_INFIX + std::to_string(getpid()) + ".";
    int fd = -1;
    for (int attempt = 0; attempt < 100; ++attempt) {
        name = stem + RandomSuffix();
        fd = open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY, 0600);
        if (fd >= 0 || errno != EEXIST) break;
    }
    return fd;
}

bool WriteAll(int fd, const char* data, size_t size) {
    while (size > 0) {
        ssize_t n = write(fd, data, size);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        data += n;
        size -= static_cast<size_t>(n);
    }
    return true;
}

bool SyncFolderOf(const std::string& path) {
    std::string folder, base;
    SplitPath(path, folder, base);
    int fd = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return false;
    bool ok = fsync(fd) == 0;
    close(fd);
    return ok;
}

void RemoveStaleTemporaries(const std::string& path) {
    std::string folder, base;
    SplitPath(path, folder, base);
    if (base.empty()) return;
    DIR* dir = opendir(folder.c_str());
    if (dir == nullptr) return;
    const time_t now = time(nullptr);
    for (dirent* e = readdir(dir); e != nullptr; e = readdir(dir)) {
        const std::string name = e->d_name;
        pid_t pid = TemporaryPid(name, base);
        if (pid <= 0 || pid == getpid()) continue;
        struct stat st;
        if (fstatat(dirfd(dir), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
        if (!S_ISREG(st.st_mode) || st.st_uid != geteuid()) continue;
        bool dead = kill(pid, 0) != 0 && errno == ESRCH;
        bool old = now - st.st_mtime > STALE_TEMPORARY_SECONDS;
        if (dead || old) unlinkat(dirfd(dir), name.c_str(), 0);
    }
    closedir(dir);
}

bool IsDaemonProcess(pid_t pid) {
    if (pid <= 0) return false;
    if (kill(pid, 0) != 0 && errno != EPERM) return false;
    const std::string name = daemon_pid_file_ident != nullptr ? daemon_pid_file_ident : DAEMON_NAME;
    const std::string proc = std::string(Paths::PROC_DIR) + std::to_string(pid);
    std::string comm = ReadSmall(proc + "/comm");
    if (!comm.empty() && comm.back() == '\n') comm.pop_back();
    if (!comm.empty() && comm == name.substr(0, COMM_CHARS)) return true;
    // A command name changed at run time still leaves the executable's name.
    char target[4096];
    ssize_t n = readlink((proc + "/exe").c_str(), target, sizeof(target) - 1);
    if (n <= 0) return false;
    std::string exe(target, static_cast<size_t>(n));
    const std::string deleted = " (deleted)";
    if (exe.size() > deleted.size() && exe.compare(exe.size() - deleted.size(), deleted.size(), deleted) == 0)
        exe.erase(exe.size() - deleted.size());
    std::string folder, base;
    SplitPath(exe, folder, base);
    return base == name;
}

}  // namespace FileIo
}  // namespace Relay
}  // namespace ZEPA
