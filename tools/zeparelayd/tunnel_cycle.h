// How the appliance is reached once registered. The control server's answer
// says it:
//   "connect": "direct"  -> state 4 "direct_connect", no tunnel;
//   "connect": "tunnel"  -> "tunnel": {"relay_ip", "relay_user", "relay_pass"}
//                           is the Tunnel section: openvpn over UDP, then TCP;
//                           state 5 while it starts, 6 while it carries traffic;
//   no "connect"         -> state 5 "connected", registered only.
//
// The start is driven from the event loop, step by step, instead of waiting
// inside Tunnel::Create: the pass file and the child are the library's
// (WritePassFile, TunnelExec), the wait for the up script is a loop timer,
// and the up script's SIGUSR2 and the child's SIGCHLD arrive as ordinary
// events (OnUpSignal, OnChildExited). So the daemon answers every signal and
// drives every request while a start runs.
//
// The tunnel counts as up only once the up script has published a peer
// address; a child still running without one after the wait is ended and the
// attempt counts as failed. A tunnel whose peer address disappears (openvpn
// restarting its connection after a link loss), or whose way to the relay
// goes (no route, or no carrier: link_watch.h), is shown as state 5 with
// "err_network" until the up script reports again or the way is back. A
// tunnel that fails to start or closes later is torn down, the state is 3
// with "err_network", and the daemon registers again after TunnelPolicy's
// wait (0 to 5 minutes after a close, 2 s doubling after a failed start),
// which also fetches fresh credentials. "heartbeat": N in the answer registers
// again after N seconds.
//
// The cycle reports each of these as a TunnelOutcome; the daemon makes the
// state of it and starts the registration when asked to.
#ifndef ZEPARELAYD_TOOL_TUNNEL_CYCLE_H
#define ZEPARELAYD_TOOL_TUNNEL_CYCLE_H

#include <json/value.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include <zeparelayd/errors.h>
#include <zeparelayd/tunnel.h>

#include "clock.h"
#include "event_loop.h"
#include "link_watch.h"
#include "retry_policy.h"

namespace zeparelayd {

// What the way the appliance is reached came to.
struct TunnelOutcome {
    enum Kind {
        DIRECT,          // reached directly, no tunnel (state 4)
        REGISTERED,      // registered only, or a tunnel on its way (state 5)
        UP,              // the tunnel carries traffic (state 6)
        LINK_LOST,       // openvpn reconnects after losing its link (state 5, "err_network")
        FAILED,          // the tunnel failed to open or closed (state 3); error says why,
                         // retryMs when the daemon registers again
        REGISTER_AGAIN,  // heartbeat or reconnection due: register now
    };
    Kind kind = REGISTERED;
    ZEPA::Relay::RELAYD_RET error = ZEPA::Relay::RELAYD_SUCCESS;
    int64_t retryMs = -1;
};

class TunnelCycle {
public:
    // How long a started openvpn has to report a peer address.
    static constexpr int64_t UP_WAIT_MS = 40000;
    // How long a child told to end has before it is killed.
    static constexpr int64_t END_GRACE_MS = 3000;
    // How often a tunnel that is up is checked for its peer address.
    static constexpr int64_t LINK_CHECK_MS = 1000;

    using OutcomeHandler = std::function<void(const TunnelOutcome&)>;

    TunnelCycle(EventLoop& loop, const Clock& clock, OutcomeHandler onOutcome, RandomSource random);

    // Tests shorten the wait for the up script.
    void SetUpWaitMs(int64_t ms) { _upWaitMs = ms; }

    // The registration's successful answer (read through server_answer.h).
    void OnRegistered(const Json::Value& answer);
    // SIGUSR2: the up script has run (a start, or openvpn reconnecting).
    void OnUpSignal();
    // SIGCHLD: reaps the cycle's own children; a start whose child died
    // fails, a tunnel that was up turns CLOSE.
    void OnChildExited();
    // Stop, switch-off and reload: the child is told to end, the pass file and
    // the tunnel info file go. With waitForChild the child is also waited for
    // (at most 3 s, then killed), so that none outlives the daemon; without,
    // its end arrives later through OnChildExited.
    void Stop(bool waitForChild);

    // Whether a tunnel is asked for and not up yet or up (states 5 and 6).
    bool HasTunnel() const { return static_cast<bool>(_tunnel); }
    // Whether a start is under way.
    bool Starting() const { return _starting; }
    // Whether the tunnel carries traffic (READY with a peer address).
    bool IsUp() const;
    // Children told to end that have not been reaped yet.
    size_t Ending() const { return _ending.size(); }
    // "connect" and, once a tunnel was asked for, "tunnel" (Tunnel::Write in
    // its full form, "peer_ip", "failures"); never the password.
    Json::Value Status() const;
    void Dump(Json::Value& out) const;

private:
    void Open();
    void StartNext();
    void WaitExpired();
    void ProtocolFailed();
    void Up(const std::string& peer);
    void CheckLink();
    // wasUp: the tunnel had come up and closed, rather than failed to start.
    void Failed(ZEPA::Relay::RELAYD_RET error, bool wasUp = false);
    void Deliver(TunnelOutcome::Kind kind, ZEPA::Relay::RELAYD_RET error = ZEPA::Relay::RELAYD_SUCCESS,
                 int64_t retryMs = -1);
    void ScheduleHeartbeat();
    void Teardown(bool waitForChild);
    void EndChild(pid_t pid);
    void RemovePassFile();
    bool Reap(pid_t pid);

    EventLoop& _loop;
    const Clock& _clock;
    TunnelPolicy _policy;
    OutcomeHandler _onOutcome;
    std::string _mode;  // "direct", "tunnel" or empty, from the last answer
    std::unique_ptr<ZEPA::Relay::Tunnel> _tunnel;
    std::string _peer;
    int _heartbeatSeconds;
    int64_t _upWaitMs;
    // The start under way: protocols still to try, the pass file it wrote.
    bool _starting;
    bool _startDeferred;  // the next protocol waits for an ended child to go
    std::vector<std::string> _protocols;
    std::string _protocol;
    std::string _passFile;
    int64_t _startedMs;
    bool _linkDown;
    LinkWatch _link;  // the way to the relay while up
    std::set<pid_t> _ending;
};

}  // namespace zeparelayd

#endif
