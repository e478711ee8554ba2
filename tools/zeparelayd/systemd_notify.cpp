// sd_notify wrappers; without systemd support built in they do nothing.
#include "systemd_notify.h"

#ifdef ZEPA_HAVE_SYSTEMD
#include <systemd/sd-daemon.h>
#endif

namespace zeparelayd {

namespace {

void Send(const std::string& message) {
#ifdef ZEPA_HAVE_SYSTEMD
    // 0 (no NOTIFY_SOCKET) and failures alike: the daemon runs on regardless.
    (void)sd_notify(0, message.c_str());
#else
    (void)message;
#endif
}

}  // namespace

std::string ServiceStatusLine(const std::string& state, const std::string& error, const std::string& alias) {
    std::string line = state;
    if (!error.empty() && error != "success") line += " (" + error + ")";
    if (!alias.empty()) line += ", alias " + alias;
    return line;
}

void NotifyReady(const std::string& status) { Send("READY=1\nSTATUS=" + status); }

void NotifyStatus(const std::string& status) { Send("STATUS=" + status); }

void NotifyStopping() { Send("STOPPING=1"); }

}  // namespace zeparelayd
