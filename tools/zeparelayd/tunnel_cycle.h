// How the appliance is reached once registered. The control server's answer
// says it:
//   "connect": "direct"  -> state 4 "direct_connect", no tunnel;
//   "connect": "tunnel"  -> "tunnel": {"relay_ip", "relay_user", "relay_pass"}
//                           is the Tunnel section: Tunnel::Create(true) (UDP,
//                           then TCP); state 5 while it starts, 6 while it is up;
//   no "connect"         -> state 5 "connected", registered only.
// A tunnel that fails to start or closes later (SIGCHLD, then
// CheckStatusChanged) is torn down, the state is 3 with "err_network", and
// the daemon registers again after a back-off with jitter, which also fetches
// fresh credentials. "heartbeat": N in the answer registers again after N
// seconds while registered.
#ifndef ZEPARELAYD_TOOL_TUNNEL_CYCLE_H
#define ZEPARELAYD_TOOL_TUNNEL_CYCLE_H

#include <json/value.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include <zeparelayd/errors.h>
#include <zeparelayd/tunnel.h>

#include "event_loop.h"

namespace zeparelayd {

// The wait before registering again after the n-th tunnel failure in a row
// (n >= 1): 2 s doubling up to 5 min, plus jitter of up to a quarter of it
// taken from randomValue (any non-negative number).
int64_t TunnelBackoffMs(int failures, long randomValue);

class TunnelCycle {
public:
    struct Hooks {
        std::function<void(ZEPA::Relay::RELAYD_STATE, ZEPA::Relay::RELAYD_RET)> setState;
        // Register with the control server again (heartbeat, or reconnection
        // once the back-off has passed).
        std::function<void()> reregister;
    };

    TunnelCycle(EventLoop& loop, Hooks hooks);

    // The registration's successful answer.
    void OnRegistered(const Json::Value& answer);
    // After SIGCHLD, once the children are reaped: READY -> CLOSE.
    void OnChildExited();
    // Stop, switch-off and reload: Destroy; with waitForChild the VPN child is
    // also waited for (at most 3 s), so that none outlives the daemon.
    void Stop(bool waitForChild);

    // "connect" and, once a tunnel was asked for, "tunnel" (Tunnel::Write in
    // its full form, "peer_ip", "failures"); never the password.
    Json::Value Status() const;
    void Dump(Json::Value& out) const;

private:
    void Open();
    void Failed(ZEPA::Relay::RELAYD_RET error);
    void ScheduleHeartbeat();
    void Teardown(bool waitForChild);

    EventLoop& _loop;
    Hooks _hooks;
    std::string _mode;  // "direct", "tunnel" or empty, from the last answer
    std::unique_ptr<ZEPA::Relay::Tunnel> _tunnel;
    std::string _peer;
    int _failures;
    int _heartbeatSeconds;
};

}  // namespace zeparelayd

#endif
