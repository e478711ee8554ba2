#include "link_watch.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <linux/netlink.h>
#include <linux/rtnetlink.h>
#include <net/if.h>
#include <sched.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <sstream>

namespace zeparelayd {

namespace {

// From <linux/route.h>.
const unsigned kRouteUp = 0x0001;
const unsigned kRouteReject = 0x0200;
// From <linux/if.h>, which cannot be included beside <net/if.h>: carrier.
const unsigned kLowerUp = 1u << 16;

// At most 256 KiB: a table of a few thousand routes.
std::string ReadTable(pid_t pid) {
    const std::string path = "/proc/" + std::to_string(pid) + "/net/route";
    const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
    if (fd < 0) return "";
    std::string text;
    char buf[8192];
    ssize_t n;
    while (text.size() < 262144 && (n = read(fd, buf, sizeof(buf))) > 0)
        text.append(buf, static_cast<size_t>(n));
    close(fd);
    return text;
}

bool Hex32(const std::string& word, uint32_t& out) {
    if (word.empty() || word.size() > 8) return false;
    char* end = nullptr;
    const unsigned long v = strtoul(word.c_str(), &end, 16);
    if (*end != '\0') return false;
    out = static_cast<uint32_t>(v);
    return true;
}

int PrefixLength(uint32_t maskNet) {
    int n = 0;
    for (uint32_t m = ntohl(maskNet); m & 0x80000000u; m <<= 1) ++n;
    return n;
}

}  // namespace

RouteState RouteInTable(const std::string& table, const std::string& host, std::string* device) {
    struct in_addr addr;
    if (inet_pton(AF_INET, host.c_str(), &addr) != 1) return RouteState::UNKNOWN;
    std::istringstream in(table);
    std::string line;
    // "Iface Destination Gateway Flags RefCnt Use Metric Mask ..."
    if (!std::getline(in, line) || line.compare(0, 5, "Iface") != 0) return RouteState::UNKNOWN;
    int bestLength = -1;
    long bestMetric = 0;
    bool bestUsable = false;
    std::string bestDevice;
    while (std::getline(in, line)) {
        std::istringstream fields(line);
        std::string iface, dest, gateway, flags, refcnt, use, metric, mask;
        if (!(fields >> iface >> dest >> gateway >> flags >> refcnt >> use >> metric >> mask)) continue;
        // The kernel prints addresses as the 32-bit words in memory, which
        // are in network order already.
        uint32_t destNet, maskNet, flagBits;
        if (!Hex32(dest, destNet) || !Hex32(mask, maskNet) || !Hex32(flags, flagBits)) continue;
        if ((flagBits & kRouteUp) == 0 || (addr.s_addr & maskNet) != destNet) continue;
        const int length = PrefixLength(maskNet);
        const long metricValue = atol(metric.c_str());
        if (length < bestLength || (length == bestLength && metricValue >= bestMetric)) continue;
        bestLength = length;
        bestMetric = metricValue;
        bestUsable = (flagBits & kRouteReject) == 0;
        bestDevice = iface;
    }
    if (bestLength < 0 || !bestUsable) return RouteState::NO_ROUTE;
    if (device != nullptr) *device = bestDevice;
    return RouteState::ROUTE;
}

RouteState RouteToHost(pid_t pid, const std::string& host, std::string* device) {
    if (pid <= 0) return RouteState::UNKNOWN;
    const std::string table = ReadTable(pid);
    if (table.empty()) return RouteState::UNKNOWN;
    return RouteInTable(table, host, device);
}

namespace {

bool SameNamespace(pid_t pid) {
    struct stat ours, theirs;
    if (stat("/proc/self/ns/net", &ours) != 0) return false;
    if (stat(("/proc/" + std::to_string(pid) + "/ns/net").c_str(), &theirs) != 0) return false;
    return ours.st_dev == theirs.st_dev && ours.st_ino == theirs.st_ino;
}

int RouteSocket() { return socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC | SOCK_NONBLOCK, NETLINK_ROUTE); }

// A netlink socket of pid's network namespace: made by a short-lived child
// that enters the namespace (a socket stays in the namespace it was made in)
// and hands it over. -1 when that is not possible (not root).
int RouteSocketIn(pid_t pid) {
    if (SameNamespace(pid)) return RouteSocket();
    const int ns = open(("/proc/" + std::to_string(pid) + "/ns/net").c_str(), O_RDONLY | O_CLOEXEC);
    if (ns < 0) return -1;
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, pair) != 0) {
        close(ns);
        return -1;
    }
    const pid_t child = fork();
    if (child == 0) {
        const int fd = setns(ns, CLONE_NEWNET) == 0 ? RouteSocket() : -1;
        if (fd >= 0) {
            char byte = 0;
            struct iovec iov = {&byte, 1};
            char control[CMSG_SPACE(sizeof(int))] = {};
            struct msghdr msg = {};
            msg.msg_iov = &iov;
            msg.msg_iovlen = 1;
            msg.msg_control = control;
            msg.msg_controllen = sizeof(control);
            struct cmsghdr* cmsg = CMSG_FIRSTHDR(&msg);
            cmsg->cmsg_level = SOL_SOCKET;
            cmsg->cmsg_type = SCM_RIGHTS;
            cmsg->cmsg_len = CMSG_LEN(sizeof(int));
            memcpy(CMSG_DATA(cmsg), &fd, sizeof(int));
            (void)!sendmsg(pair[1], &msg, 0);
        }
        _exit(0);
    }
    close(ns);
    close(pair[1]);
    int fd = -1;
    if (child > 0) {
        // It does three system calls and ends.
        while (waitpid(child, nullptr, 0) < 0 && errno == EINTR) {
        }
        char byte;
        struct iovec iov = {&byte, 1};
        char control[CMSG_SPACE(sizeof(int))] = {};
        struct msghdr msg = {};
        msg.msg_iov = &iov;
        msg.msg_iovlen = 1;
        msg.msg_control = control;
        msg.msg_controllen = sizeof(control);
        if (recvmsg(pair[0], &msg, MSG_DONTWAIT | MSG_CMSG_CLOEXEC) == 1) {
            struct cmsghdr* cmsg = CMSG_FIRSTHDR(&msg);
            if (cmsg != nullptr && cmsg->cmsg_level == SOL_SOCKET && cmsg->cmsg_type == SCM_RIGHTS &&
                cmsg->cmsg_len == CMSG_LEN(sizeof(int))) {
                memcpy(&fd, CMSG_DATA(cmsg), sizeof(int));
            }
        }
    }
    close(pair[0]);
    return fd;
}

}  // namespace

LinkWatch::~LinkWatch() { Stop(); }

bool LinkWatch::Start(pid_t pid, const std::string& host) {
    Stop();
    if (RouteToHost(pid, host) != RouteState::ROUTE) return false;
    _pid = pid;
    _host = host;
    _netlink = RouteSocketIn(pid);
    return true;
}

void LinkWatch::Stop() {
    if (_netlink >= 0) close(_netlink);
    _netlink = -1;
    _pid = -1;
    _host.clear();
}

LinkWatch::State LinkWatch::Check() {
    if (_pid <= 0) return UNKNOWN;
    std::string device;
    switch (RouteToHost(_pid, _host, &device)) {
        case RouteState::NO_ROUTE:
            return DOWN;
        case RouteState::UNKNOWN:
            return UNKNOWN;
        case RouteState::ROUTE:
            break;
    }
    const State dev = Device(device);
    // Without an answer about the device, the route is all there is.
    return dev == UNKNOWN ? UP : dev;
}

LinkWatch::State LinkWatch::Device(const std::string& name) {
    if (_netlink < 0 || name.empty() || name.size() >= IFNAMSIZ) return UNKNOWN;
    struct {
        struct nlmsghdr header;
        struct ifinfomsg info;
        char attributes[RTA_SPACE(IFNAMSIZ)];
    } request;
    memset(&request, 0, sizeof(request));
    struct rtattr* attr = reinterpret_cast<struct rtattr*>(request.attributes);
    attr->rta_type = IFLA_IFNAME;
    attr->rta_len = static_cast<unsigned short>(RTA_LENGTH(name.size() + 1));
    memcpy(RTA_DATA(attr), name.c_str(), name.size() + 1);
    request.header.nlmsg_len = NLMSG_LENGTH(sizeof(struct ifinfomsg)) + RTA_ALIGN(attr->rta_len);
    request.header.nlmsg_type = RTM_GETLINK;
    request.header.nlmsg_flags = NLM_F_REQUEST;
    request.header.nlmsg_seq = ++_seq;
    request.info.ifi_family = AF_UNSPEC;
    if (send(_netlink, &request, request.header.nlmsg_len, 0) < 0) return UNKNOWN;
    // The kernel answers inside send(): the reply is queued already. Older
    // replies (none normally) are skipped by their sequence number.
    alignas(struct nlmsghdr) char buf[16384];
    for (int reads = 0; reads < 8; ++reads) {
        const ssize_t n = recv(_netlink, buf, sizeof(buf), MSG_DONTWAIT);
        if (n <= 0) return UNKNOWN;
        int len = static_cast<int>(n);
        for (struct nlmsghdr* h = reinterpret_cast<struct nlmsghdr*>(buf); NLMSG_OK(h, len);
             h = NLMSG_NEXT(h, len)) {
            if (h->nlmsg_seq != _seq) continue;
            if (h->nlmsg_type != RTM_NEWLINK || h->nlmsg_len < NLMSG_LENGTH(sizeof(struct ifinfomsg))) {
                return UNKNOWN;  // an error: no such device here
            }
            const struct ifinfomsg* info = static_cast<const struct ifinfomsg*>(NLMSG_DATA(h));
            const unsigned up = IFF_UP | kLowerUp;
            return (info->ifi_flags & up) == up ? UP : DOWN;
        }
    }
    return UNKNOWN;
}

}  // namespace zeparelayd
