// Whether the appliance still has a way to the relay, as the openvpn child
// sees it: a route to the relay, and that route's device up with carrier. A
// link that goes down (interface down, address or lease lost) takes its
// routes with it; a cable pulled, or the other end gone, leaves the route and
// drops the carrier. openvpn itself notices either only when its ping
// timeout runs out, which the relay may set to 30 s or more.
//
// All of it is read in the child's own network namespace, whatever the
// daemon's: the routing table through /proc/<pid>/net/route, the device
// through a netlink socket opened in that namespace.
#ifndef ZEPARELAYD_TOOL_LINK_WATCH_H
#define ZEPARELAYD_TOOL_LINK_WATCH_H

#include <sys/types.h>

#include <string>

namespace zeparelayd {

enum class RouteState { UNKNOWN, ROUTE, NO_ROUTE };

// The main IPv4 table's text (as in /proc/net/route), longest prefix first,
// then the lower metric: a usable route to host (its device in *device), none
// (or only a blackhole, unreachable or prohibit one), or UNKNOWN when host is
// no IPv4 address or the table cannot be read.
RouteState RouteInTable(const std::string& table, const std::string& host, std::string* device = nullptr);

// The same for the table of pid's network namespace.
RouteState RouteToHost(pid_t pid, const std::string& host, std::string* device = nullptr);

class LinkWatch {
public:
    enum State { UNKNOWN, UP, DOWN };

    LinkWatch() = default;
    ~LinkWatch();
    LinkWatch(const LinkWatch&) = delete;
    LinkWatch& operator=(const LinkWatch&) = delete;

    // Watches the way from pid's namespace to host. False (nothing watched)
    // when that namespace has no route to host in its main table now (policy
    // routing): its absence later would say nothing. Without access to the
    // namespace's devices only the route is watched.
    bool Start(pid_t pid, const std::string& host);
    void Stop();
    bool Watching() const { return _pid > 0; }

    // DOWN: no route, or the route's device is down or has no carrier. UNKNOWN
    // when nothing is watched or the table cannot be read (the process gone).
    State Check();

private:
    // The device's IFF_UP and IFF_LOWER_UP; UNKNOWN when it cannot be asked.
    State Device(const std::string& name);

    pid_t _pid = -1;
    std::string _host;
    int _netlink = -1;
    unsigned _seq = 0;
};

}  // namespace zeparelayd

#endif
