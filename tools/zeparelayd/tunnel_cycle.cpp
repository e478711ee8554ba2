#define ZEPA_LOG_SOURCE "tunnel_cycle"

#include "tunnel_cycle.h"

#include <signal.h>
#include <sys/wait.h>
#include <time.h>

#include <cerrno>
#include <cstdlib>

#include "common/log.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

const char kOpenTimer[] = "tunnel";
const char kHeartbeatTimer[] = "heartbeat";
const char kRetryTimer[] = "register";

bool SameEndpoint(const Tunnel& a, const Tunnel& b) {
    return a.relay_ip == b.relay_ip && a.relay_user == b.relay_user && a.relay_pass == b.relay_pass;
}

}  // namespace

int64_t TunnelBackoffMs(int failures, long randomValue) {
    int64_t delay = 2000;
    for (int i = 1; i < failures && delay < 300000; ++i) delay *= 2;
    if (delay > 300000) delay = 300000;
    if (randomValue < 0) randomValue = 0;
    return delay + randomValue % (delay / 4 + 1);
}

TunnelCycle::TunnelCycle(EventLoop& loop, Hooks hooks)
    : _loop(loop), _hooks(std::move(hooks)), _failures(0), _heartbeatSeconds(0) {}

void TunnelCycle::OnRegistered(const Json::Value& answer) {
    _loop.CancelTimer(kHeartbeatTimer);
    const Json::Value& beat = answer["heartbeat"];
    _heartbeatSeconds = beat.isInt() && beat.asInt() > 0 ? beat.asInt() : 0;
    const Json::Value& connect = answer["connect"];
    _mode = connect.isString() ? connect.asString() : std::string();

    if (_mode == "tunnel") {
        Tunnel next(answer["tunnel"].isObject() ? answer["tunnel"] : Json::Value(Json::objectValue));
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
            ZLOG(ZEPA_LOG_WARNING, "unknown connect mode [%s], taken as registered only", _mode.c_str());
        }
        Teardown(false);
        _tunnel.reset();
        _failures = 0;
        _hooks.setState(_mode == "direct" ? RELAYD_STATE_DIRECT_CONNECT : RELAYD_STATE_CONNECTED,
                        RELAYD_SUCCESS);
    }
    ScheduleHeartbeat();
}

void TunnelCycle::ScheduleHeartbeat() {
    if (_heartbeatSeconds <= 0) return;
    _loop.SetTimer(kHeartbeatTimer, static_cast<int64_t>(_heartbeatSeconds) * 1000, [this] {
        ZLOG(ZEPA_LOG_DEBUG, "heartbeat: registering again");
        _hooks.reregister();
    });
}

void TunnelCycle::Open() {
    if (!_tunnel) return;
    if (!_tunnel->IsValid()) {
        _tunnel->status = TUNNEL_STATUS_INVALID_CONF;
        ZLOG(ZEPA_LOG_ERR, "the control server's tunnel answer is incomplete");
        Failed(RELAYD_ERR_NOT_SUPPORT);
        return;
    }
    ZLOG(ZEPA_LOG_INFO, "opening a tunnel to [%s] as [%s]", _tunnel->relay_ip.c_str(),
         _tunnel->relay_user.c_str());
    // Blocks until the up script signals, the child dies or 40 s pass, per
    // protocol; the signal handlers it relies on are libdaemon's.
    const int64_t started = NowMs();
    if (!_tunnel->Create(true)) {
        ZLOG(ZEPA_LOG_WARNING, "tunnel to [%s] failed after %lld ms", _tunnel->relay_ip.c_str(),
             static_cast<long long>(NowMs() - started));
        Failed(RELAYD_ERR_NETWORK);
        return;
    }
    _failures = 0;
    _peer = Tunnel::GetVpnTunnelPeerIp();
    ZLOG(ZEPA_LOG_NOTICE, "tunnel up in %lld ms, pid %d, peer [%s]",
         static_cast<long long>(NowMs() - started), _tunnel->pid, _peer.c_str());
    _hooks.setState(RELAYD_STATE_CONNECTED_ALT, RELAYD_SUCCESS);
}

void TunnelCycle::Failed(RELAYD_RET error) {
    Teardown(false);
    ++_failures;
    const int64_t delay = TunnelBackoffMs(_failures, random());
    ZLOG(ZEPA_LOG_INFO, "tunnel retry %d in %lld ms", _failures, static_cast<long long>(delay));
    _loop.CancelTimer(kHeartbeatTimer);
    _hooks.setState(RELAYD_STATE_LOGIN, error);
    _loop.SetTimer(kRetryTimer, delay, [this] { _hooks.reregister(); });
}

void TunnelCycle::OnChildExited() {
    if (!_tunnel || !_tunnel->CheckStatusChanged()) return;
    ZLOG(ZEPA_LOG_WARNING, "tunnel to [%s] closed", _tunnel->relay_ip.c_str());
    Failed(RELAYD_ERR_NETWORK);
}

void TunnelCycle::Stop(bool waitForChild) {
    _loop.CancelTimer(kHeartbeatTimer);
    Teardown(waitForChild);
    _tunnel.reset();
    _mode.clear();
    _failures = 0;
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
    ZLOG(ZEPA_LOG_WARNING, "openvpn %d still runs after 3 s: killed", pid);
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
    tunnel["failures"] = _failures;
    return out;
}

void TunnelCycle::Dump(Json::Value& out) const {
    out = Status();
    out["heartbeat_s"] = _heartbeatSeconds;
    out["heartbeat_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kHeartbeatTimer));
    out["open_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kOpenTimer));
}

}  // namespace zeparelayd
