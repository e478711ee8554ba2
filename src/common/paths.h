// Every fixed absolute path of the library, named once, and resolved against
// the process-wide system root. With the root "/" each resolved path is exactly
// the name below.
//
// The root comes from the optional platform hook ZEPASysRootGet (zepasdk/sysroot.h),
// which the SDK stand-in provides so that tests and demos run in a staging
// directory. The appliance's own library has no such call: the library refers
// to it weakly and uses "/" when it is absent.
#ifndef ZEPARELAYD_SRC_COMMON_PATHS_H
#define ZEPARELAYD_SRC_COMMON_PATHS_H

#include <string>

namespace ZEPA {
namespace Relay {
namespace Paths {

// Configuration.
constexpr const char RELAYD_CONF[] = "/usr/zepa/etc/zeparelayd/zeparelayd.conf";
constexpr const char ENV_CONF[] = "/usr/zepa/etc/zeparelayd/env.conf";
constexpr const char PERMISSION_CONF[] = "/usr/zepa/etc/zeparelayd/services.conf";
constexpr const char UPNP_RULES[] = "/tmp/.zeparelayd_upnp_rules";
constexpr const char ZEPAINFO_CONF[] = "/etc/zepainfo.conf";
constexpr const char ZEPAINFO_DEFAULTS_CONF[] = "/etc.defaults/zepainfo.conf";
constexpr const char PACKAGES_DIR[] = "/var/packages/";
constexpr const char PHOTO_SETTINGS_CONF[] = "/var/packages/PictureDock/etc/settings.conf";
constexpr const char SYNC_SETTING_CONF[] = "/var/packages/SyncDock/etc/setting.conf";

// The router's port-forwarding rules, a file in the folder the platform names
// (VLIBServiceRouterBasepathGet); the name is the platform's, not resolved.
constexpr const char ROUTER_PF_RULES_NAME[] = "portforward.conf";

// Runtime state.
constexpr const char STATUS_FILE[] = "/tmp/.zeparelayd.status";
constexpr const char DEBUG_FILE_FORMAT[] = "/tmp/.zeparelayd.%d.debug";
constexpr const char ALIAS_STATUS_FILE[] = "/tmp/hopcloud_alias.status";
constexpr const char DEFAULT_LOG_FILE[] = "/var/log/zeparelayd.log";
constexpr const char PID_DIR[] = "/var/run/";

// Programs.
constexpr const char NOTIFIER[] = "/usr/zepa/bin/zepanosnotify";

// Tunnel.
constexpr const char TUNNEL_PASS_FORMAT[] = "/tmp/.tunnel.%s";
constexpr const char TUNNEL_INFO_FILE[] = "/tmp/.zepa_farlink_tunnel_info";
constexpr const char TUNNEL_CA_CERT[] = "/usr/zepa/etc/zeparelayd/ca/ca.crt";
constexpr const char TUNNEL_UP_SCRIPT[] = "/usr/zepa/etc.defaults/zeparelayd/scripts/up.sh";
constexpr const char TUNNEL_DOWN_SCRIPT[] = "/usr/zepa/etc.defaults/zeparelayd/scripts/down.sh";
constexpr const char OPENVPN[] = "/usr/sbin/openvpn";
constexpr const char IPTABLESTOOL[] = "/usr/zepa/bin/iptablestool";
// The kernel's tun device that openvpn opens.
constexpr const char TUN_DEVICE[] = "/dev/net/tun";

// Process information of the running system; never resolved against the root,
// since the processes a root's files name are real.
constexpr const char PROC_DIR[] = "/proc/";

// root + absPath ("/" root: absPath unchanged).
std::string Resolve(const std::string& absPath);

}  // namespace Paths
}  // namespace Relay
}  // namespace ZEPA

#endif
