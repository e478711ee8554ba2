// The tunnel section, its status words, and the life of the openvpn child
// seen from the daemon: start with fall-back, liveness, teardown.
#define ZEPA_LOG_SOURCE "tunnel"

#include <signal.h>

#include <zepasdk/kv.h>
#include <cstdio>

#include <zeparelayd/tunnel.h>

#include "common/log.h"
#include "common/paths.h"
#include "common/seams.h"
#include "tunnel/tunnel_internal.h"

namespace ZEPA {
namespace Relay {

namespace {

const char kModules[] =
    "x_tables.ko ip_tables.ko iptable_filter.ko nf_conntrack.ko nf_defrag_ipv4.ko nf_conntrack_ipv4.ko "
    "nf_nat.ko iptable_nat.ko ipt_REDIRECT.ko xt_multiport.ko xt_tcpudp.ko xt_state.ko ipt_MASQUERADE.ko "
    "tun.ko";

void TakeString(const Json::Value& value, const char* key, std::string& member) {
    if (value.isMember(key) && value[key].isString()) member = value[key].asString();
}

// Walks the list backwards from its last blank, each piece keeping its
// leading blank. The walk ends when no earlier blank is left, so the first
// module is deliberately never unloaded.
std::string ReversedModules(const std::string& modules) {
    std::string reversed;
    size_t end = modules.size();
    size_t blank = modules.rfind(' ');
    while (blank != std::string::npos) {
        reversed += modules.substr(blank, end - blank);
        if (blank == 0) break;
        end = blank;
        blank = modules.rfind(' ', blank - 1);
    }
    return reversed;
}

}  // namespace

bool IsSafeTunnelUser(const std::string& user) {
    if (user.find("..") != std::string::npos) return false;
    for (unsigned char c : user) {
        if (c == '/' || c < 0x20 || c == 0x7f) return false;
    }
    return true;
}

Tunnel::Tunnel() : pid(-1), modules(kModules), status(TUNNEL_STATUS_NONE) {}

Tunnel::Tunnel(const Json::Value& value) : Tunnel() { Overwrite(value); }

Tunnel::~Tunnel() {}

bool Tunnel::Overwrite(const Json::Value& value) {
    if (!value.isObject()) return true;
    TakeString(value, "relay_ip", relay_ip);
    TakeString(value, "relay_pass", relay_pass);
    TakeString(value, "relay_user", relay_user);
    return true;
}

bool Tunnel::IsValid() const {
    if (relay_ip.empty() || relay_user.empty() || relay_pass.empty()) {
        ZLOG(ZEPA_LOG_DEBUG, "invalid tunnel server info");
        return false;
    }
    // The user name becomes part of the pass file's name under /tmp.
    if (!IsSafeTunnelUser(relay_user)) {
        ZLOG(ZEPA_LOG_ERR, "unsafe tunnel user name refused");
        return false;
    }
    return true;
}

// The password is written in neither form.
bool Tunnel::Write(Json::Value& out, bool full) const {
    out["relay_ip"] = relay_ip;
    if (full) {
        out["relay_user"] = relay_user;
        out["status"] = GetStatusStr(status);
        out["pid"] = pid;
    }
    return true;
}

std::string Tunnel::GetHost() const { return relay_ip; }

TUNNEL_STATUS Tunnel::GetStatus() const { return status; }

std::string Tunnel::GetStatusStr(TUNNEL_STATUS status) {
    switch (status) {
        case TUNNEL_STATUS_NONE:
            return "NONE";
        case TUNNEL_STATUS_READY:
            return "READY";
        case TUNNEL_STATUS_CLOSE:
            return "CLOSE";
        case TUNNEL_STATUS_FAILED:
            return "FAILED";
        case TUNNEL_STATUS_INVALID_CONF:
            return "INVALID_CONF";
    }
    return "(unknown)";
}

bool Tunnel::Create(bool tryUdp) {
    if (!IsValid()) return false;
    if (tryUdp && RunVPNTunnel("udp")) {
        status = TUNNEL_STATUS_READY;
        return true;
    }
    if (RunVPNTunnel("tcp")) {
        status = TUNNEL_STATUS_READY;
        return true;
    }
    status = TUNNEL_STATUS_FAILED;
    pid = -1;
    return false;
}

bool Tunnel::IsAlive() {
    if (pid < 0) {
        pid = -1;
        return false;
    }
    if (kill(pid, 0) == 0) return true;
    pid = -1;
    return false;
}

bool Tunnel::CheckStatusChanged() {
    if (!IsAlive() && status == TUNNEL_STATUS_READY) {
        status = TUNNEL_STATUS_CLOSE;
        return true;
    }
    return false;
}

bool Tunnel::Destroy() {
    if (!IsAlive()) return true;
    ZLOG(ZEPA_LOG_DEBUG, "kill openvpn %d", pid);
    const bool delivered = kill(pid, SIGTERM) == 0;
    if (delivered) {
        // The unload tag differs from the load tag on purpose: keep both as they are.
        const std::string unload =
            Paths::Resolve(Paths::IPTABLESTOOL) + " --rmmod farlink-tunnel " + ReversedModules(modules);
        g_tunnelShell(unload.c_str());
        pid = -1;
    }
    const std::string removeInfo = "rm -f " + Paths::Resolve(Paths::TUNNEL_INFO_FILE);
    g_tunnelShell(removeInfo.c_str());
    return delivered;
}

std::string Tunnel::GetVpnTunnelPeerIp() {
    char buf[1024] = {0};
    const std::string info = Paths::Resolve(Paths::TUNNEL_INFO_FILE);
    if (VLIBCFileGetKeyValue(info.c_str(), "peer_ip", buf, sizeof(buf)) <= 0) return std::string();
    return buf;
}

std::string Tunnel::GetProgramPath() { return Paths::Resolve(Paths::OPENVPN); }
std::string Tunnel::GetCaCertPath() { return Paths::Resolve(Paths::TUNNEL_CA_CERT); }
std::string Tunnel::GetUpScriptPath() { return Paths::Resolve(Paths::TUNNEL_UP_SCRIPT); }
std::string Tunnel::GetDownScriptPath() { return Paths::Resolve(Paths::TUNNEL_DOWN_SCRIPT); }
std::string Tunnel::GetModuleToolPath() { return Paths::Resolve(Paths::IPTABLESTOOL); }
std::string Tunnel::GetTunDevicePath() { return Paths::Resolve(Paths::TUN_DEVICE); }

std::string Tunnel::GetPassFilePath(const std::string& user) {
    if (user.empty() || !IsSafeTunnelUser(user)) return std::string();
    char name[1024];
    snprintf(name, sizeof(name), Paths::TUNNEL_PASS_FORMAT, user.c_str());
    return Paths::Resolve(name);
}

std::string Tunnel::GetInfoFilePath() { return Paths::Resolve(Paths::TUNNEL_INFO_FILE); }

}  // namespace Relay
}  // namespace ZEPA
