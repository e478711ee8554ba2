// Readiness and a one-line status for systemd's Type=notify services. Every
// call does nothing unless the service manager gave the daemon a notification
// socket (NOTIFY_SOCKET), so the forked appliance start is unaffected.
#ifndef ZEPARELAYD_TOOL_SYSTEMD_NOTIFY_H
#define ZEPARELAYD_TOOL_SYSTEMD_NOTIFY_H

#include <string>

namespace zeparelayd {

// The status line: the state word, the error word unless it is "success", and
// the alias status word when there is one ("connected, alias good",
// "login (err_network)").
std::string ServiceStatusLine(const std::string& state, const std::string& error, const std::string& alias);

// READY=1 with the first status line, once the daemon answers signals.
void NotifyReady(const std::string& status);
// STATUS=<line> whenever the published state changes.
void NotifyStatus(const std::string& status);
// STOPPING=1 on the way out.
void NotifyStopping();

}  // namespace zeparelayd

#endif
