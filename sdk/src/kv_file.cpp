#include "kv_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>

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

bool ReadKvFile(const std::string& path, std::vector<KvLine>& lines) {
    lines.clear();
    std::ifstream in(path);
    if (!in.is_open()) return false;
    std::string text;
    std::string section;
    while (std::getline(in, text)) {
        KvLine line = ParseKvLine(text, section);
        if (line.kind == KvLine::SECTION) section = line.section;
        lines.push_back(line);
    }
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

bool WriteKvFile(const std::string& path, const std::vector<KvLine>& lines) {
    mode_t mode = 0644;
    struct stat st;
    if (stat(path.c_str(), &st) == 0) mode = st.st_mode & 07777;

    std::string tmp = path + ".tmp." + std::to_string(getpid());
    int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0) return false;
    std::string content;
    for (const KvLine& l : lines) content += l.text + "\n";
    bool ok = true;
    size_t done = 0;
    while (ok && done < content.size()) {
        ssize_t n = write(fd, content.data() + done, content.size() - done);
        if (n <= 0)
            ok = false;
        else
            done += static_cast<size_t>(n);
    }
    if (ok && fchmod(fd, mode) != 0) ok = false;
    if (close(fd) != 0) ok = false;
    if (ok && rename(tmp.c_str(), path.c_str()) != 0) ok = false;
    if (!ok) unlink(tmp.c_str());
    return ok;
}

}  // namespace zepasdk
