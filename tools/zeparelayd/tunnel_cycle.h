// How the appliance is reached once registered. The control server's answer
// says it:
//   "connect": "direct"  -> state 4 "direct_connect", no tunnel;
//   "connect": "tunnel"  -> "tunnel": {"relay_ip", "relay_user", "relay_pass"}
//                           is the Tunnel section: Tunnel::Create(true) (UDP,
//                           then TCP); state 5 while it starts, 6 while it is up;
//   no "connect"         -> state 5 "connected", registered only.
// A tunnel that fails to start or closes later (SIGCHLD, then
// CheckStatusChanged) is torn down, the state is 3 with "err_network", and
// the daemon registers again after TunnelPolicy's back-off with jitter, which
// also fetches fresh credentials. "heartbeat": N in the answer registers again
// after N seconds while registered.
#ifndef ZEPARELAYD_TOOL_TUNNEL_CYCLE_H
#define ZEPARELAYD_TOOL_TUNNEL_CYCLE_H

#include <json/value.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include <zeparelayd/errors.h>
#include <zeparelayd/tunnel.h>

#include "clock.h"
#include "event_loop.h"
#include "retry_policy.h"

namespace zeparelayd {

class TunnelCycle {
public:
    struct Hooks {
        std::function<void(ZEPA::Relay::RELAYD_STATE, ZEPA::Relay::RELAYD_RET)> setState;
        // Register with the control server again (heartbeat, or reconnection
        // once the back-off has passed).
        std::function<void()> reregister;
    };

    TunnelCycle(EventLoop& loop, const Clock& clock, Hooks hooks, RandomSource random);

    // The registration's successful answer (read through server_answer.h).
    void OnRegistered(const Json::Value& answer);
    // After SIGCHLD, once the children are reaped: READY -> CLOSE.
    void OnChildExited();
    // Stop, switch-off and reload: Destroy; with waitForChild the VPN child is
    // also waited for (at most 3 s), so that none outlives the daemon.
    void Stop(bool waitForChild);

    // Whether a tunnel is asked for and not up yet or up (states 5 and 6).
    bool HasTunnel() const { return static_cast<bool>(_tunnel); }
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
    const Clock& _clock;
    TunnelPolicy _policy;
    Hooks _hooks;
    std::string _mode;  // "direct", "tunnel" or empty, from the last answer
    std::unique_ptr<ZEPA::Relay::Tunnel> _tunnel;
    std::string _peer;
    int _heartbeatSeconds;
};

}  // namespace zeparelayd

#endif
