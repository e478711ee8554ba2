#include "zepasdk/sysroot.h"

#include <cstring>
#include <string>

namespace {
std::string& Root() {
    static std::string root = "/";
    return root;
}
}  // namespace

extern "C" {

int ZEPASysRootSet(const char* root) {
    if (root == nullptr || root[0] == '\0') {
        Root() = "/";
        return 0;
    }
    if (root[0] != '/') return -1;
    std::string r(root);
    while (r.size() > 1 && r.back() == '/') r.pop_back();
    Root() = r;
    return 0;
}

const char* ZEPASysRootGet(void) { return Root().c_str(); }

int ZEPASysRootPath(const char* absPath, char* buf, size_t size) {
    if (buf != nullptr && size > 0) buf[0] = '\0';
    if (absPath == nullptr || absPath[0] != '/' || buf == nullptr) return -1;
    const std::string& root = Root();
    std::string full = (root == "/") ? std::string(absPath) : root + absPath;
    if (full.size() + 1 > size) return -1;
    memcpy(buf, full.c_str(), full.size() + 1);
    return static_cast<int>(full.size());
}

}  // extern "C"
