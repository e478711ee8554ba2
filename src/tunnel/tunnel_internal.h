// Helpers shared by the tunnel's source files.
#ifndef ZEPARELAYD_SRC_TUNNEL_TUNNEL_INTERNAL_H
#define ZEPARELAYD_SRC_TUNNEL_TUNNEL_INTERNAL_H

#include <string>

namespace ZEPA {
namespace Relay {

// False for a user name that could move the pass file out of its folder or
// break its two-line layout: "/", "..", control characters.
bool IsSafeTunnelUser(const std::string& user);

}  // namespace Relay
}  // namespace ZEPA

#endif
