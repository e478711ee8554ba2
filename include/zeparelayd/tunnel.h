// The VPN tunnel to a relay server: its section (address and credentials from
// a server answer) and the control of the openvpn child with its kernel
// modules, pass file and scripts.
#ifndef ZEPARELAYD_TUNNEL_H
#define ZEPARELAYD_TUNNEL_H

#include <json/value.h>

#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/export.h>

namespace ZEPA {
namespace Relay {

// Stored as a 32-bit integer: never renumber.
enum TUNNEL_STATUS {
    TUNNEL_STATUS_NONE = 0,
    TUNNEL_STATUS_READY = 1,
    TUNNEL_STATUS_CLOSE = 2,
    TUNNEL_STATUS_FAILED = 3,
    TUNNEL_STATUS_INVALID_CONF = 4,
};

// relay_pass is a credential: read from JSON, never written, never logged.
//
// Create and RunVPNTunnel block in sigsuspend for up to 40 seconds and must be
// called from the daemon's main thread with handlers installed for SIGCHLD,
// SIGUSR2 and SIGALRM (their default actions would end the daemon).
class ZEPARELAYD_API Tunnel : public Config {
public:
    Tunnel();
    explicit Tunnel(const Json::Value& value);
    // Does not stop the child.
    ~Tunnel() override;

    bool Overwrite(const Json::Value& value) override;
    bool IsValid() const override;
    bool Write(Json::Value& out, bool full) const override;

    std::string GetHost() const;
    TUNNEL_STATUS GetStatus() const;
    // "NONE", "READY", "CLOSE", "FAILED", "INVALID_CONF"; "(unknown)" otherwise.
    static std::string GetStatusStr(TUNNEL_STATUS status);

    // UDP first when tryUdp, then TCP; READY on success, FAILED otherwise.
    bool Create(bool tryUdp);
    // SIGTERM to the child and the modules unloaded; the status is kept.
    bool Destroy();
    // One start with proto "udp" or "tcp"; true when the child is alive after
    // the wait.
    bool RunVPNTunnel(const char* proto);
    bool WritePassFile(const std::string& path) const;
    // Runs in the forked child: loads the modules and becomes openvpn.
    [[noreturn]] void TunnelExec(const char* passFile, const char* proto) const;
    bool IsAlive();
    // READY -> CLOSE once the child is gone; true when the status changed.
    bool CheckStatusChanged();
    // "peer_ip" of the tunnel info file written by the up script; empty when missing.
    static std::string GetVpnTunnelPeerIp();

    // Where the tunnel's parts live, resolved against the system root: the VPN
    // program, the relay's CA, the up and down scripts, the module tool and
    // the kernel's tun device. For checks that look before anything runs.
    static std::string GetProgramPath();
    static std::string GetCaCertPath();
    static std::string GetUpScriptPath();
    static std::string GetDownScriptPath();
    static std::string GetModuleToolPath();
    static std::string GetTunDevicePath();

    // Where a start keeps the credentials for openvpn ("/tmp/.tunnel.<user>"
    // below the system root); empty for a user name that is refused.
    static std::string GetPassFilePath(const std::string& user);
    // The key/value file the up script writes, below the system root.
    static std::string GetInfoFilePath();

    int pid;  // -1: no child
    std::string relay_ip;
    std::string relay_user;
    std::string relay_pass;
    std::string modules;  // space separated, in load order
    TUNNEL_STATUS status;
};

}  // namespace Relay
}  // namespace ZEPA

#endif
