#include "sdk_util.h"

#include <errno.h>
#include <limits.h>
#include <sys/stat.h>

#include <cstring>

#include "zepasdk/kv.h"
#include "zepasdk/sysroot.h"

namespace zepasdk {

int FailWith(int code) {
    VLIBCErrSet(code);
    return -1;
}

bool CopyIfFits(const std::string& value, char* buf, int size) {
    if (buf == nullptr || size < 1) return false;
    buf[0] = '\0';
    if (value.size() + 1 > static_cast<size_t>(size)) return false;
    memcpy(buf, value.c_str(), value.size() + 1);
    return true;
}

std::string RootPath(const char* absPath) {
    char buf[PATH_MAX];
    if (ZEPASysRootPath(absPath, buf, sizeof(buf)) < 0) return std::string();
    return buf;
}

bool MakeParentDirs(const std::string& path) {
    for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
        std::string dir = path.substr(0, pos);
        if (mkdir(dir.c_str(), 0755) != 0 && errno != EEXIST) return false;
    }
    return true;
}

std::string HexOf(const unsigned char* bytes, size_t n) {
    static const char digits[] = "0123456789abcdef";
    std::string out;
    out.reserve(n * 2);
    for (size_t i = 0; i < n; ++i) {
        out += digits[bytes[i] >> 4];
        out += digits[bytes[i] & 0x0f];
    }
    return out;
}

}  // namespace zepasdk
