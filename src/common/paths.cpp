#include "common/paths.h"

#include <zepasdk/sysroot.h>

namespace ZEPA {
namespace Relay {
namespace Paths {

std::string Resolve(const std::string& absPath) {
    std::string root = ZEPASysRootGet();
    if (root == "/" || absPath.empty() || absPath[0] != '/') return absPath;
    return root + absPath;
}

}  // namespace Paths
}  // namespace Relay
}  // namespace ZEPA
