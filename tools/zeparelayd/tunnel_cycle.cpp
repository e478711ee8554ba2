#define RLOG_SOURCE "tunnel_cycle"

#include "tunnel_cycle.h"

#include <signal.h>
#include <sys/wait.h>
#include <time.h>

#include <cerrno>

#include "log.h"
#include "server_answer.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

const char kOpenTimer[] = "tunnel";
const char kHeartbeatTimer[] = "heartbeat";
const char kRetryTimer[] = "tunnel_retry";

bool SameEndpoint(const Tunnel& a, const Tunnel& b) {
    return a.relay_ip == b.relay_ip && a.relay_user == b.relay_user && a.relay_pass == b.relay_pass;
}

}  // namespace

TunnelCycle::TunnelCycle(EventLoop& loop, const Clock& clock, Hooks hooks, RandomSource random)
    : _loop(loop),
      _clock(clock),
      _policy(clock, std::move(random)),
      _hooks(std::move(hooks)),
      _heartbeatSeconds(0) {}

void TunnelCycle::OnRegistered(const Json::Value& answer) {
    _loop.CancelTimer(kHeartbeatTimer);
    _loop.CancelTimer(kRetryTimer);
    _policy.OnAttempt();
    int beat = 0;
    _heartbeatSeconds = AnswerInt(answer, "heartbeat", beat) && beat > 0 ? beat : 0;
    _mode.clear();
    AnswerString(answer, "connect", _mode);

    if (_mode == "tunnel") {
        Tunnel next(AnswerSection(answer, "tunnel"));
        if (_tunnel && _tunnel->IsAlive() && _tunnel->GetStatus() == TUNNEL_STATUS_READY &&
            SameEndpoint(*_tunnel, next)) {
            // A heartbeat that changes nothing keeps the tunnel.
            _hooks.setState(RELAYD_STATE_CONNECTED_ALT, RELAYD_SUCCESS);
        } else {
            Teardown(false);
            _tunnel.reset(new Tunnel(next));
            _hooks.setState(RELAYD_STATE_CONNECTED, RELAYD_SUCCESS);
            // Opened from a timer, so that the state above is out first.
            _loop.SetTimer(kOpenTimer, 0, [this] { Open(); });
        }
    } else {
        if (!_mode.empty() && _mode != "direct") {
            RLOG(LOG_WARNING, "unknown connect mode [%s], taken as registered only", _mode.c_str());
        }
        Teardown(false);
        _tunnel.reset();
        _policy.Reset();
        _hooks.setState(_mode == "direct" ? RELAYD_STATE_DIRECT_CONNECT : RELAYD_STATE_CONNECTED,
                        RELAYD_SUCCESS);
    }
    ScheduleHeartbeat();
}

void TunnelCycle::ScheduleHeartbeat() {
    if (_heartbeatSeconds <= 0) return;
    _loop.SetTimer(kHeartbeatTimer, static_cast<int64_t>(_heartbeatSeconds) * 1000, [this] {
        RLOG(LOG_DEBUG, "heartbeat: registering again");
        _hooks.reregister();
    });
}

void TunnelCycle::Open() {
    if (!_tunnel) return;
    if (!_tunnel->IsValid()) {
        _tunnel->status = TUNNEL_STATUS_INVALID_CONF;
        RLOG(LOG_ERR, "the control server's tunnel answer is incomplete");
        Failed(RELAYD_ERR_NOT_SUPPORT);
        return;
    }
    RLOG(LOG_INFO, "opening a tunnel to [%s] as [%s]", _tunnel->relay_ip.c_str(),
         _tunnel->relay_user.c_str());
    // Blocks until the up script signals, the child dies or 40 s pass, per
    // protocol; the signal handlers it relies on are libdaemon's.
    const int64_t started = _clock.NowMs();
    if (!_tunnel->Create(true)) {
        RLOG(LOG_WARNING, "tunnel to [%s] failed after %lld ms", _tunnel->relay_ip.c_str(),
             static_cast<long long>(_clock.NowMs() - started));
        Failed(RELAYD_ERR_NETWORK);
        return;
    }
    _policy.OnUp();
    _peer = Tunnel::GetVpnTunnelPeerIp();
    RLOG(LOG_NOTICE, "tunnel up in %lld ms, pid %d, peer [%s]",
         static_cast<long long>(_clock.NowMs() - started), _tunnel->pid, _peer.c_str());
    _hooks.setState(RELAYD_STATE_CONNECTED_ALT, RELAYD_SUCCESS);
}

void TunnelCycle::Failed(RELAYD_RET error) {
    Teardown(false);
    const int64_t delay = _policy.OnFailure();
    RLOG(LOG_INFO, "tunnel retry %d in %lld ms", _policy.Failures(), static_cast<long long>(delay));
    _loop.CancelTimer(kHeartbeatTimer);
    _hooks.setState(RELAYD_STATE_LOGIN, error);
    _loop.SetTimer(kRetryTimer, delay, [this] {
        _policy.OnAttempt();
        _hooks.reregister();
    });
}

void TunnelCycle::OnChildExited() {
    if (!_tunnel || !_tunnel->CheckStatusChanged()) return;
    RLOG(LOG_WARNING, "tunnel to [%s] closed", _tunnel->relay_ip.c_str());
    Failed(RELAYD_ERR_NETWORK);
}

void TunnelCycle::Stop(bool waitForChild) {
    _loop.CancelTimer(kHeartbeatTimer);
    _loop.CancelTimer(kRetryTimer);
    Teardown(waitForChild);
    _tunnel.reset();
    _mode.clear();
    _policy.Reset();
}

void TunnelCycle::Teardown(bool waitForChild) {
    _loop.CancelTimer(kOpenTimer);
    _peer.clear();
    if (!_tunnel) return;
    const int pid = _tunnel->pid;
    const bool wasAlive = _tunnel->IsAlive();
    // Destroy returns early for a child that is gone already (a closed
    // tunnel); its down script took the tunnel info file with it then.
    _tunnel->Destroy();
    if (!wasAlive || pid <= 0 || !waitForChild) return;
    // The child takes about a second to tell the relay it leaves.
    for (int i = 0; i < 300; ++i) {
        const pid_t reaped = waitpid(pid, nullptr, WNOHANG);
        if (reaped == pid || (reaped < 0 && errno == ECHILD)) return;
        struct timespec ts = {0, 10 * 1000000L};
        nanosleep(&ts, nullptr);
    }
    RLOG(LOG_WARNING, "openvpn %d still runs after 3 s: killed", pid);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
}

Json::Value TunnelCycle::Status() const {
    Json::Value out(Json::objectValue);
    out["connect"] = _mode;
    if (!_tunnel) return out;
    Json::Value& tunnel = out["tunnel"];
    _tunnel->Write(tunnel, true);
    tunnel["peer_ip"] = _peer;
    tunnel["failures"] = _policy.Failures();
    // Never shown, whatever Write does with the section in the future.
    tunnel.removeMember("relay_pass");
    return out;
}

void TunnelCycle::Dump(Json::Value& out) const {
    out = Status();
    out["heartbeat_s"] = _heartbeatSeconds;
    out["heartbeat_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kHeartbeatTimer));
    out["open_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kOpenTimer));
    _policy.Dump(out["retry"]);
}

}  // namespace zeparelayd
