// How the appliance is reached once registered. The control server's answer
// says it (see README.md, "Connection"):
//   "connect": "direct"  -> state 4 "direct_connect", no tunnel;
//   "connect": "tunnel"  -> "tunnel": {"relay_ip", "relay_user", "relay_pass"}
//                           is the Tunnel section: Tunnel::Create(true) (UDP,
//                           then TCP); state 6 while it is up;
//   no "connect"         -> state 5 "connected", registered only.
// A tunnel that fails to start or closes later (SIGCHLD, then
// CheckStatusChanged) is torn down and the daemon registers again after a
// back-off with jitter, which also fetches fresh tunnel credentials. An
// answer with "heartbeat": N registers again after N seconds while connected.
#define ZEPA_LOG_SOURCE "tunnel_cycle"

#include <signal.h>
#include <sys/wait.h>
#include <time.h>

#include <cerrno>
#include <cstdlib>

#include "common/log.h"
#include "relay_daemon.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

// Tunnel retries: 2 s doubling up to 5 min, plus up to a quarter of jitter so
// that appliances cut off together do not come back in step.
int64_t TunnelBackoffMs(int failures) {
    int64_t delay = 2000;
    for (int i = 1; i < failures && delay < 300000; ++i) delay *= 2;
    if (delay > 300000) delay = 300000;
    return delay + random() % (delay / 4 + 1);
}

bool SameEndpoint(const Tunnel& a, const Tunnel& b) {
    return a.relay_ip == b.relay_ip && a.relay_user == b.relay_user && a.relay_pass == b.relay_pass;
}

}  // namespace

bool RelayDaemon::IsRegistered() const {
    return _state == RELAYD_STATE_DIRECT_CONNECT || _state == RELAYD_STATE_CONNECTED ||
           _state == RELAYD_STATE_CONNECTED_ALT;
}

void RelayDaemon::OnRegistered(const Json::Value& answer) {
    _loop.CancelTimer("heartbeat");
    const Json::Value& beat = answer["heartbeat"];
    _heartbeatSeconds = beat.isInt() && beat.asInt() > 0 ? beat.asInt() : 0;

    const Json::Value& connect = answer["connect"];
    _connectMode = connect.isString() ? connect.asString() : std::string();
    if (_connectMode == "tunnel") {
        Tunnel next(answer["tunnel"].isObject() ? answer["tunnel"] : Json::Value(Json::objectValue));
        if (_tunnel && _tunnel->IsAlive() && _tunnel->GetStatus() == TUNNEL_STATUS_READY &&
            SameEndpoint(*_tunnel, next)) {
            // A heartbeat that changes nothing keeps the tunnel.
            SetState(RELAYD_STATE_CONNECTED_ALT, RELAYD_SUCCESS);
        } else {
            TeardownTunnel(false);
            _tunnel.reset(new Tunnel(next));
            SetState(RELAYD_STATE_CONNECTED, RELAYD_SUCCESS);
            // Opened from a timer, so that the status above is out first.
            _loop.SetTimer("tunnel", 0, [this] { OpenTunnel(); });
        }
    } else {
        if (!_connectMode.empty() && _connectMode != "direct") {
            ZLOG(ZEPA_LOG_WARNING, "unknown connect mode [%s], taken as registered only",
                 _connectMode.c_str());
        }
        TeardownTunnel(false);
        _tunnel.reset();
        _tunnelFailures = 0;
        SetState(_connectMode == "direct" ? RELAYD_STATE_DIRECT_CONNECT : RELAYD_STATE_CONNECTED,
                 RELAYD_SUCCESS);
    }
    ScheduleHeartbeat();
}

void RelayDaemon::ScheduleHeartbeat() {
    if (_heartbeatSeconds <= 0) return;
    _loop.SetTimer("heartbeat", static_cast<int64_t>(_heartbeatSeconds) * 1000, [this] {
        ZLOG(ZEPA_LOG_DEBUG, "heartbeat: registering again");
        StartRegistration();
    });
}

void RelayDaemon::OpenTunnel() {
    if (!_tunnel) return;
    if (!_tunnel->IsValid()) {
        _tunnel->status = TUNNEL_STATUS_INVALID_CONF;
        ZLOG(ZEPA_LOG_ERR, "the control server's tunnel answer is incomplete");
        TunnelFailed(RELAYD_ERR_NOT_SUPPORT);
        return;
    }
    ZLOG(ZEPA_LOG_INFO, "opening a tunnel to [%s] as [%s]", _tunnel->relay_ip.c_str(),
         _tunnel->relay_user.c_str());
    // Blocks until the up script signals, the child dies or 40 s pass, per
    // protocol; the handlers it needs are libdaemon's.
    const int64_t started = NowMs();
    if (!_tunnel->Create(true)) {
        ZLOG(ZEPA_LOG_WARNING, "tunnel to [%s] failed after %lld ms", _tunnel->relay_ip.c_str(),
             static_cast<long long>(NowMs() - started));
        TunnelFailed(RELAYD_ERR_NETWORK);
        return;
    }
    _tunnelFailures = 0;
    _tunnelPeer = Tunnel::GetVpnTunnelPeerIp();
    ZLOG(ZEPA_LOG_NOTICE, "tunnel up in %lld ms, pid %d, peer [%s]",
         static_cast<long long>(NowMs() - started), _tunnel->pid, _tunnelPeer.c_str());
    SetState(RELAYD_STATE_CONNECTED_ALT, RELAYD_SUCCESS);
}

void RelayDaemon::TunnelFailed(RELAYD_RET error) {
    TeardownTunnel(false);
    ++_tunnelFailures;
    const int64_t delay = TunnelBackoffMs(_tunnelFailures);
    ZLOG(ZEPA_LOG_INFO, "tunnel retry %d in %lld ms", _tunnelFailures, static_cast<long long>(delay));
    _loop.CancelTimer("heartbeat");
    SetState(RELAYD_STATE_LOGIN, error);
    _loop.SetTimer("register", delay, [this] { StartRegistration(); });
}

void RelayDaemon::CheckTunnel() {
    if (!_tunnel || !_tunnel->CheckStatusChanged()) return;
    ZLOG(ZEPA_LOG_WARNING, "tunnel to [%s] closed", _tunnel->relay_ip.c_str());
    TunnelFailed(RELAYD_ERR_NETWORK);
}

void RelayDaemon::TeardownTunnel(bool waitForChild) {
    _loop.CancelTimer("tunnel");
    _tunnelPeer.clear();
    if (!_tunnel) return;
    const int pid = _tunnel->pid;
    const bool wasAlive = _tunnel->IsAlive();
    // Destroy returns early for a child that is gone already (a closed
    // tunnel); the down script took the tunnel info file with it then.
    _tunnel->Destroy();
    if (!wasAlive || pid <= 0 || !waitForChild) return;
    // On the way out the child is waited for, so that no VPN program outlives
    // the daemon (it takes about a second to tell the relay it leaves).
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

Json::Value RelayDaemon::TunnelStatus() const {
    Json::Value out(Json::objectValue);
    out["connect"] = _connectMode;
    if (!_tunnel) return out;
    // The full form holds address, user, status word and pid; never the password.
    Json::Value& tunnel = out["tunnel"];
    _tunnel->Write(tunnel, true);
    tunnel["peer_ip"] = _tunnelPeer;
    tunnel["failures"] = _tunnelFailures;
    return out;
}

void RelayDaemon::DeleteAliasOnDisable() {
    if (!_aliasMapped || !_conf->alias.IsAliasEnabled()) return;
    _aliasMapped = false;
    Json::Value data;
    _conf->DumpDataForAliasReq(data);
    AliasRequest builder;
    std::string body, url;
    if (!builder.SetRequest(ALIAS_REQ_DELETE, data) || !builder.GetRequest(body, url)) return;
    boost::shared_ptr<Request> req(new Request(url.c_str(), body.c_str(), true));
    ZLOG(ZEPA_LOG_INFO, "relay switched off: deleting alias [%s]", _conf->alias.GetAliasName().c_str());
    // Its own tag: stopping the alias cycle must not cancel it.
    _loop.StartRequest("alias_delete", req, [this](boost::shared_ptr<Request> r) {
        ALIAS_RET ret = ALIAS_RET_UNKNOWN;
        std::string detail;
        AliasRequest::GetResponseForDaemon(r, ret, detail);
        ZLOG(ZEPA_LOG_INFO, "alias delete: %d %s", static_cast<int>(ret), detail.c_str());
        RecordAliasStatus(ret == ALIAS_RET_SUCCESS ? "deleted" : "error_delete", detail);
    });
}

}  // namespace zeparelayd
