#include "kv_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <ctime>
#include <mutex>

namespace zepasdk {

namespace {

const char* const kBlanks = " \t\r\n";

std::string Trim(const std::string& s) {
    size_t b = s.find_first_not_of(kBlanks);
    if (b == std::string::npos) return "";
    size_t e = s.find_last_not_of(kBlanks);
    return s.substr(b, e - b + 1);
}

// Reads a quoted value starting after the opening quote; false when the
// closing quote is missing.
bool Unquote(const std::string& s, size_t pos, std::string& out) {
    out.clear();
    for (size_t i = pos; i < s.size(); ++i) {
        char c = s[i];
        if (c == '\\' && i + 1 < s.size() && (s[i + 1] == '"' || s[i + 1] == '\\')) {
            out += s[++i];
        } else if (c == '"') {
            return true;
        } else {
            out += c;
        }
    }
    return false;
}

}  // namespace

KvLine ParseKvLine(const std::string& text, const std::string& currentSection) {
    KvLine line{KvLine::MALFORMED, text, currentSection, "", ""};
    std::string t = Trim(text);
    if (t.empty() || t[0] == '#' || t[0] == ';') {
        line.kind = KvLine::COMMENT;
        return line;
    }
    if (t[0] == '[') {
        if (t.back() != ']') return line;
        line.kind = KvLine::SECTION;
        line.section = Trim(t.substr(1, t.size() - 2));
        return line;
    }
    size_t eq = t.find('=');
    if (eq == std::string::npos) return line;
    std::string key = Trim(t.substr(0, eq));
    if (key.empty()) return line;
    std::string rest = Trim(t.substr(eq + 1));
    std::string value;
    if (!rest.empty() && rest[0] == '"') {
        if (!Unquote(rest, 1, value)) return line;
    } else {
        value = rest;
    }
    line.kind = KvLine::ENTRY;
    line.key = key;
    line.value = value;
    return line;
}

void ParseKvContent(const std::string& content, KvFile& file) {
    file = KvFile();
    std::string section;
    size_t start = 0;
    while (start < content.size()) {
        size_t end = content.find('\n', start);
        if (end == std::string::npos) end = content.size();
        KvLine line = ParseKvLine(content.substr(start, end - start), section);
        if (line.kind == KvLine::SECTION) {
            section = line.section;
            file.index[section];
        } else if (line.kind == KvLine::ENTRY) {
            file.index[line.section].emplace(line.key, file.lines.size());
        }
        file.lines.push_back(std::move(line));
        start = end + 1;
    }
}

int KvFile::Lookup(const std::string& section, const std::string& key, std::string& value) const {
    auto sec = index.find(section);
    if (sec == index.end()) return section.empty() ? 0 : -1;
    auto entry = sec->second.find(key);
    if (entry == sec->second.end()) return 0;
    value = lines[entry->second].value;
    return 1;
}

namespace {

// Bigger files are parsed on every call rather than kept.
const off_t kCacheFileMax = 8 << 20;
const size_t kCacheEntries = 32;
// A file modified this recently may be rewritten again within the same time
// stamp (coarse clocks, file systems with 1 or 2 s granularity): compare its
// content before trusting what is kept.
const long long kRacyNs = 2000000000LL;

long long Ns(const struct timespec& t) { return t.tv_sec * 1000000000LL + t.tv_nsec; }

long long NowNs() {
    struct timespec t;
    clock_gettime(CLOCK_REALTIME, &t);
    return Ns(t);
}

struct Identity {
    dev_t dev;
    ino_t ino;
    off_t size;
    long long mtime;
    long long ctime;

    explicit Identity(const struct stat& st)
        : dev(st.st_dev), ino(st.st_ino), size(st.st_size), mtime(Ns(st.st_mtim)), ctime(Ns(st.st_ctim)) {}
    bool operator==(const Identity& o) const {
        return dev == o.dev && ino == o.ino && size == o.size && mtime == o.mtime && ctime == o.ctime;
    }
};

struct CachedFile {
    Identity id;
    std::string content;  // kept only while the entry is racy
    long long readAt;     // when the content was last read (taken before the read)
    unsigned long long lastUse;
    std::shared_ptr<const KvFile> parsed;

    bool Racy() const { return readAt - id.mtime < kRacyNs; }
};

std::mutex g_cacheLock;
std::unordered_map<std::string, CachedFile> g_cache;
unsigned long long g_useCounter = 0;

// Reads a regular file whole; false when it cannot be opened or read, or is
// something else (a FIFO would block, a device never ends).
bool ReadRegularFile(const std::string& path, std::string& content, struct stat& st) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
    if (fd < 0) return false;
    bool ok = fstat(fd, &st) == 0 && S_ISREG(st.st_mode);
    content.clear();
    if (ok && st.st_size > 0) content.reserve(static_cast<size_t>(st.st_size));
    char buf[65536];
    while (ok) {
        ssize_t n = read(fd, buf, sizeof(buf));
        if (n == 0) break;
        if (n < 0) {
            if (errno != EINTR) ok = false;
            continue;
        }
        content.append(buf, static_cast<size_t>(n));
    }
    close(fd);
    return ok;
}

void EvictOldest() {
    auto oldest = g_cache.begin();
    for (auto it = g_cache.begin(); it != g_cache.end(); ++it) {
        if (it->second.lastUse < oldest->second.lastUse) oldest = it;
    }
    if (oldest != g_cache.end()) g_cache.erase(oldest);
}

// The kept parse when the file is unchanged; null otherwise.
std::shared_ptr<const KvFile> Kept(const std::string& path, const struct stat& st) {
    auto it = g_cache.find(path);
    if (it == g_cache.end()) return nullptr;
    CachedFile& entry = it->second;
    if (!(entry.id == Identity(st))) {
        g_cache.erase(it);
        return nullptr;
    }
    if (entry.Racy()) {
        long long readAt = NowNs();
        std::string content;
        struct stat now;
        if (!ReadRegularFile(path, content, now) || !(Identity(now) == entry.id) ||
            content != entry.content) {
            g_cache.erase(it);
            return nullptr;
        }
        entry.readAt = readAt;
        if (!entry.Racy()) entry.content.clear();
    }
    entry.lastUse = ++g_useCounter;
    return entry.parsed;
}

}  // namespace

std::shared_ptr<const KvFile> LoadKvFile(const std::string& path) {
    std::lock_guard<std::mutex> guard(g_cacheLock);
    struct stat st;
    if (stat(path.c_str(), &st) != 0) {
        g_cache.erase(path);
        return nullptr;
    }
    if (std::shared_ptr<const KvFile> kept = Kept(path, st)) return kept;

    long long readAt = NowNs();
    std::string content;
    if (!ReadRegularFile(path, content, st)) return nullptr;
    auto parsed = std::make_shared<KvFile>();
    ParseKvContent(content, *parsed);
    if (st.st_size <= kCacheFileMax) {
        if (g_cache.size() >= kCacheEntries) EvictOldest();
        CachedFile entry{Identity(st), std::move(content), readAt, ++g_useCounter, parsed};
        if (!entry.Racy()) entry.content.clear();
        g_cache.erase(path);
        g_cache.emplace(path, std::move(entry));
    }
    return parsed;
}

void ForgetKvFile(const std::string& path) {
    std::lock_guard<std::mutex> guard(g_cacheLock);
    g_cache.erase(path);
}

bool ReadKvFile(const std::string& path, std::vector<KvLine>& lines) {
    lines.clear();
    std::shared_ptr<const KvFile> file = LoadKvFile(path);
    if (!file) return false;
    lines = file->lines;
    return true;
}

std::string FormatKvEntry(const std::string& key, const std::string& value) {
    std::string out = key + "=\"";
    for (char c : value) {
        if (c == '"' || c == '\\') out += '\\';
        out += c;
    }
    return out + "\"";
}

namespace {

// The temporary file of a write: a leftover of ours at the name is reused;
// anything else (a link, FIFO, folder, another user's file, a file with a
// second name) is removed and the name created exclusively.
int OpenKvTemporary(const std::string& tmp) {
    int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC | O_NOCTTY, 0600);
    if (fd >= 0) {
        struct stat st;
        if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_uid == geteuid() && st.st_nlink == 1 &&
            ftruncate(fd, 0) == 0) {
            int flags = fcntl(fd, F_GETFL);
            if (flags != -1) fcntl(fd, F_SETFL, flags & ~O_NONBLOCK);
            return fd;
        }
        close(fd);
    } else if (errno == ENOENT || errno == ENOTDIR) {
        return -1;
    }
    if (unlink(tmp.c_str()) != 0 && errno == EISDIR) rmdir(tmp.c_str());
    return open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC | O_NOCTTY, 0600);
}

// fsync of the folder holding path, so that the rename into it is durable.
void SyncFolderOf(const std::string& path) {
    const std::string::size_type slash = path.rfind('/');
    const std::string folder = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
    int fd = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) return;
    fsync(fd);
    close(fd);
}

}  // namespace

bool WriteKvFile(const std::string& path, const std::vector<KvLine>& lines) {
    mode_t mode = 0644;
    struct stat st;
    if (stat(path.c_str(), &st) == 0) mode = st.st_mode & 07777;

    std::string tmp = path + ".tmp." + std::to_string(getpid());
    int fd = OpenKvTemporary(tmp);
    if (fd < 0) return false;
    std::string content;
    for (const KvLine& l : lines) content += l.text + "\n";
    bool ok = true;
    size_t done = 0;
    while (ok && done < content.size()) {
        ssize_t n = write(fd, content.data() + done, content.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0)
            ok = false;
        else
            done += static_cast<size_t>(n);
    }
    // The data reaches the disk before the name does: a power loss leaves
    // the old settings or the new ones, never an empty file.
    if (ok && fsync(fd) != 0) ok = false;
    if (ok && fchmod(fd, mode) != 0) ok = false;
    if (close(fd) != 0) ok = false;
    if (ok && rename(tmp.c_str(), path.c_str()) != 0) ok = false;
    if (ok) SyncFolderOf(path);
    if (!ok) unlink(tmp.c_str());
    ForgetKvFile(path);
    return ok;
}

}  // namespace zepasdk
