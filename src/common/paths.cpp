#include "common/paths.h"

// The optional system-root hook of the platform library, declared weak so that
// the library links and runs against a platform library without it (see paths.h).
extern "C" const char* ZEPASysRootGet(void) __attribute__((weak));

namespace ZEPA {
namespace Relay {
namespace Paths {

namespace {
std::string SystemRoot() {
    if (ZEPASysRootGet == nullptr) return "/";
    const char* root = ZEPASysRootGet();
    return root != nullptr && root[0] != '\0' ? root : "/";
}
}  // namespace

std::string Resolve(const std::string& absPath) {
    std::string root = SystemRoot();
    if (root == "/" || absPath.empty() || absPath[0] != '/') return absPath;
    return root + absPath;
}

}  // namespace Paths
}  // namespace Relay
}  // namespace ZEPA
