#define RLOG_SOURCE "tunnel_cycle"

#include "tunnel_cycle.h"

#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>

#include "link_watch.h"
#include "log.h"
#include "relayd_protocol.h"
#include "server_answer.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

const char kOpenTimer[] = "tunnel";
const char kHeartbeatTimer[] = "heartbeat";
const char kRetryTimer[] = "tunnel_retry";
const char kUpWaitTimer[] = "tunnel_up_wait";
const char kEndTimer[] = "tunnel_end";
const char kLinkTimer[] = "tunnel_link";

bool SameEndpoint(const Tunnel& a, const Tunnel& b) {
    return a.relay_ip == b.relay_ip && a.relay_user == b.relay_user && a.relay_pass == b.relay_pass;
}

// In the forked child, before it becomes openvpn: the daemon's handlers and
// blocked signals must not reach the VPN program.
void ResetSignalsForChild() {
    for (int sig = 1; sig < NSIG; ++sig) {
        if (sig == SIGKILL || sig == SIGSTOP) continue;
        signal(sig, SIG_DFL);
    }
    sigset_t none;
    sigemptyset(&none);
    sigprocmask(SIG_SETMASK, &none, nullptr);
}

}  // namespace

TunnelCycle::TunnelCycle(EventLoop& loop, const Clock& clock, OutcomeHandler onOutcome, RandomSource random)
    : _loop(loop),
      _clock(clock),
      _policy(clock, std::move(random)),
      _onOutcome(std::move(onOutcome)),
      _heartbeatSeconds(0),
      _upWaitMs(UP_WAIT_MS),
      _starting(false),
      _startDeferred(false),
      _startedMs(0),
      _linkDown(false) {}

void TunnelCycle::Deliver(TunnelOutcome::Kind kind, RELAYD_RET error, int64_t retryMs) {
    if (!_onOutcome) return;
    TunnelOutcome outcome;
    outcome.kind = kind;
    outcome.error = error;
    outcome.retryMs = retryMs;
    _onOutcome(outcome);
}

bool TunnelCycle::IsUp() const {
    return _tunnel && !_starting && _tunnel->GetStatus() == TUNNEL_STATUS_READY && !_peer.empty() &&
           !_linkDown;
}

void TunnelCycle::OnRegistered(const Json::Value& answer) {
    _loop.CancelTimer(kHeartbeatTimer);
    _loop.CancelTimer(kRetryTimer);
    int beat = 0;
    _heartbeatSeconds = AnswerInt(answer, "heartbeat", beat) && beat > 0 ? beat : 0;
    _mode.clear();
    AnswerString(answer, "connect", _mode);

    if (_mode == "tunnel") {
        Tunnel next(AnswerSection(answer, "tunnel"));
        if (_tunnel && SameEndpoint(*_tunnel, next) &&
            (_starting || (_tunnel->IsAlive() && _tunnel->GetStatus() == TUNNEL_STATUS_READY))) {
            // A heartbeat that changes nothing keeps the tunnel, or the start
            // under way.
            Deliver(IsUp() ? TunnelOutcome::UP : TunnelOutcome::REGISTERED);
        } else {
            Teardown(false);
            _tunnel.reset(new Tunnel(next));
            Deliver(TunnelOutcome::REGISTERED);
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
        Deliver(_mode == "direct" ? TunnelOutcome::DIRECT : TunnelOutcome::REGISTERED);
    }
    ScheduleHeartbeat();
}

void TunnelCycle::ScheduleHeartbeat() {
    if (_heartbeatSeconds <= 0) return;
    _loop.SetTimer(kHeartbeatTimer, static_cast<int64_t>(_heartbeatSeconds) * 1000, [this] {
        RLOG(LOG_DEBUG, "heartbeat: registering again");
        Deliver(TunnelOutcome::REGISTER_AGAIN);
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
    _tunnel->status = TUNNEL_STATUS_NONE;
    _tunnel->pid = -1;
    _starting = true;
    _linkDown = false;
    _link.Stop();
    _peer.clear();
    _protocols = {"udp", "tcp"};
    _startedMs = _clock.NowMs();
    StartNext();
}

// One protocol: pass file, child, then the wait for the up script as a timer.
void TunnelCycle::StartNext() {
    if (!_starting || !_tunnel) return;
    if (!_ending.empty()) {
        // Two openvpn on one device fail: the next one waits for the last.
        _startDeferred = true;
        return;
    }
    _startDeferred = false;
    if (_protocols.empty()) {
        _starting = false;
        _tunnel->status = TUNNEL_STATUS_FAILED;
        _tunnel->pid = -1;
        RLOG(LOG_WARNING, "tunnel to [%s] failed after %lld ms", _tunnel->relay_ip.c_str(),
             static_cast<long long>(_clock.NowMs() - _startedMs));
        Failed(RELAYD_ERR_NETWORK);
        return;
    }
    _protocol = _protocols.front();
    _protocols.erase(_protocols.begin());
    _tunnel->pid = -1;
    _tunnel->status = TUNNEL_STATUS_NONE;
    _passFile = Tunnel::GetPassFilePath(_tunnel->relay_user);
    if (_passFile.empty() || !_tunnel->WritePassFile(_passFile)) {
        RemovePassFile();
        ProtocolFailed();
        return;
    }
    const pid_t child = fork();
    if (child < 0) {
        RLOG(LOG_ERR, "fork failed (%d)", errno);
        RemovePassFile();
        ProtocolFailed();
        return;
    }
    if (child == 0) {
        ResetSignalsForChild();
        _tunnel->TunnelExec(_passFile.c_str(), _protocol.c_str());
    }
    _tunnel->pid = child;
    RLOG(LOG_DEBUG, "openvpn %d started over %s", static_cast<int>(child), _protocol.c_str());
    _loop.SetTimer(kUpWaitTimer, _upWaitMs, [this] { WaitExpired(); });
}

void TunnelCycle::OnUpSignal() {
    if (!_tunnel) return;
    const std::string peer = Tunnel::GetVpnTunnelPeerIp();
    if (_starting) {
        if (_tunnel->pid > 0 && !peer.empty() && _tunnel->IsAlive()) {
            Up(peer);
        } else {
            RLOG(LOG_DEBUG, "up signal without a peer address: still waiting");
        }
        return;
    }
    if (_tunnel->GetStatus() == TUNNEL_STATUS_READY && !peer.empty() && _tunnel->IsAlive()) {
        // openvpn has connected again after a loss.
        _peer = peer;
        if (_linkDown) {
            _linkDown = false;
            RLOG(LOG_NOTICE, "tunnel to [%s] is back, peer [%s]", _tunnel->relay_ip.c_str(), peer.c_str());
            Deliver(TunnelOutcome::UP);
        }
    }
}

// The up script did not report in time. A signal may have been lost: a peer
// address that is there counts; without one the attempt has failed.
void TunnelCycle::WaitExpired() {
    if (!_starting || !_tunnel) return;
    const std::string peer = Tunnel::GetVpnTunnelPeerIp();
    if (!peer.empty() && _tunnel->IsAlive()) {
        Up(peer);
        return;
    }
    RLOG(LOG_WARNING, "no peer address from openvpn over %s after %lld ms: attempt failed", _protocol.c_str(),
         static_cast<long long>(_upWaitMs));
    const pid_t pid = _tunnel->pid;
    _tunnel->pid = -1;
    RemovePassFile();
    if (pid > 0) EndChild(pid);
    ProtocolFailed();
}

void TunnelCycle::ProtocolFailed() {
    _loop.CancelTimer(kUpWaitTimer);
    if (_tunnel) _tunnel->pid = -1;
    StartNext();
}

void TunnelCycle::Up(const std::string& peer) {
    _loop.CancelTimer(kUpWaitTimer);
    RemovePassFile();
    _starting = false;
    _linkDown = false;
    _tunnel->status = TUNNEL_STATUS_READY;
    _peer = peer;
    _policy.OnUp();
    _link.Start(_tunnel->pid, _tunnel->relay_ip);
    RLOG(LOG_NOTICE, "tunnel up in %lld ms over %s, pid %d, peer [%s]",
         static_cast<long long>(_clock.NowMs() - _startedMs), _protocol.c_str(), _tunnel->pid, _peer.c_str());
    Deliver(TunnelOutcome::UP);
    _loop.SetTimer(kLinkTimer, LINK_CHECK_MS, [this] { CheckLink(); });
}

// The down script removes the peer address when openvpn loses its link and
// restarts; the up script writes it again once the link is back. A link that
// goes down (no route to the relay, or its device without carrier) is seen
// at once, long before openvpn's ping timeout; it is back when the way is.
void TunnelCycle::CheckLink() {
    if (!_tunnel || _starting || _tunnel->GetStatus() != TUNNEL_STATUS_READY) return;
    const std::string peer = Tunnel::GetVpnTunnelPeerIp();
    const bool noWay = _link.Check() == LinkWatch::DOWN;
    if ((peer.empty() || noWay) && !_linkDown) {
        _linkDown = true;
        if (noWay) {
            RLOG(LOG_WARNING, "tunnel to [%s] lost its link: no way to the relay", _tunnel->relay_ip.c_str());
        } else {
            RLOG(LOG_WARNING, "tunnel to [%s] lost its link: openvpn reconnects", _tunnel->relay_ip.c_str());
        }
        Deliver(TunnelOutcome::LINK_LOST, RELAYD_ERR_NETWORK);
    } else if (!peer.empty() && !noWay && _linkDown) {
        _linkDown = false;
        _peer = peer;
        RLOG(LOG_NOTICE, "tunnel to [%s] is back, peer [%s]", _tunnel->relay_ip.c_str(), peer.c_str());
        Deliver(TunnelOutcome::UP);
    }
    _loop.SetTimer(kLinkTimer, LINK_CHECK_MS, [this] { CheckLink(); });
}

void TunnelCycle::Failed(RELAYD_RET error, bool wasUp) {
    Teardown(false);
    const int64_t delay = wasUp ? _policy.OnClosed() : _policy.OnFailure();
    RLOG(LOG_INFO, "tunnel retry %d in %lld ms", _policy.Failures(), static_cast<long long>(delay));
    _loop.CancelTimer(kHeartbeatTimer);
    _loop.SetTimer(kRetryTimer, delay, [this] { Deliver(TunnelOutcome::REGISTER_AGAIN); });
    Deliver(TunnelOutcome::FAILED, error, delay);
}

// True once the child is gone (reaped here, or by someone else before).
bool TunnelCycle::Reap(pid_t pid) {
    if (pid <= 0) return true;
    pid_t reaped;
    do {
        reaped = waitpid(pid, nullptr, WNOHANG);
    } while (reaped < 0 && errno == EINTR);
    if (reaped == pid) return true;
    if (reaped < 0) return kill(pid, 0) != 0;
    return false;
}

void TunnelCycle::OnChildExited() {
    for (auto it = _ending.begin(); it != _ending.end();) {
        it = Reap(*it) ? _ending.erase(it) : std::next(it);
    }
    if (_ending.empty()) _loop.CancelTimer(kEndTimer);
    if (_tunnel && _tunnel->pid > 0 && Reap(_tunnel->pid)) {
        if (_starting) {
            RLOG(LOG_INFO, "openvpn %d over %s ended before the tunnel came up", _tunnel->pid,
                 _protocol.c_str());
            RemovePassFile();
            ProtocolFailed();
        } else {
            _tunnel->IsAlive();  // pid -1
            if (_tunnel->CheckStatusChanged()) {
                RLOG(LOG_WARNING, "tunnel to [%s] closed", _tunnel->relay_ip.c_str());
                Failed(RELAYD_ERR_NETWORK, true);
            }
        }
    }
    if (_startDeferred && _ending.empty()) StartNext();
}

void TunnelCycle::Stop(bool waitForChild) {
    _loop.CancelTimer(kHeartbeatTimer);
    _loop.CancelTimer(kRetryTimer);
    Teardown(waitForChild);
    _tunnel.reset();
    _mode.clear();
    _policy.Reset();
}

void TunnelCycle::EndChild(pid_t pid) {
    if (kill(pid, SIGTERM) != 0) return;
    _ending.insert(pid);
    _loop.SetTimer(kEndTimer, END_GRACE_MS, [this] {
        for (pid_t p : _ending) {
            RLOG(LOG_WARNING, "openvpn %d still runs %lld ms after SIGTERM: killed", static_cast<int>(p),
                 static_cast<long long>(END_GRACE_MS));
            kill(p, SIGKILL);
        }
    });
}

void TunnelCycle::RemovePassFile() {
    if (!_passFile.empty()) unlink(_passFile.c_str());
    _passFile.clear();
}

void TunnelCycle::Teardown(bool waitForChild) {
    _loop.CancelTimer(kOpenTimer);
    _loop.CancelTimer(kUpWaitTimer);
    _loop.CancelTimer(kLinkTimer);
    _link.Stop();
    _peer.clear();
    _linkDown = false;
    _starting = false;
    _startDeferred = false;
    _protocols.clear();
    RemovePassFile();
    if (_tunnel) {
        const pid_t pid = _tunnel->pid;
        const bool alive = pid > 0 && !Reap(pid) && _tunnel->IsAlive();
        if (alive) {
            // SIGTERM, the modules unloaded, the info file removed.
            _tunnel->Destroy();
            _ending.insert(pid);
            _loop.SetTimer(kEndTimer, END_GRACE_MS, [this] {
                for (pid_t p : _ending) kill(p, SIGKILL);
            });
        } else {
            _tunnel->pid = -1;
        }
        // A child that died without its down script leaves the file.
        unlink(Tunnel::GetInfoFilePath().c_str());
    }
    if (!waitForChild || _ending.empty()) return;
    // The loop has ended: the children are waited for here. Each takes about
    // a second to tell the relay it leaves.
    for (int i = 0; i < 300 && !_ending.empty(); ++i) {
        for (auto it = _ending.begin(); it != _ending.end();) {
            it = Reap(*it) ? _ending.erase(it) : std::next(it);
        }
        if (_ending.empty()) break;
        struct timespec ts = {0, 10 * 1000000L};
        nanosleep(&ts, nullptr);
    }
    for (pid_t p : _ending) {
        RLOG(LOG_WARNING, "openvpn %d still runs after 3 s: killed", static_cast<int>(p));
        kill(p, SIGKILL);
        waitpid(p, nullptr, 0);
    }
    _ending.clear();
    _loop.CancelTimer(kEndTimer);
}

Json::Value TunnelCycle::Status() const {
    namespace key = zepatools::status_key;
    Json::Value out(Json::objectValue);
    out[key::kConnect] = _mode;
    if (!_tunnel) return out;
    Json::Value& tunnel = out[key::kTunnel];
    _tunnel->Write(tunnel, true);
    // Up only while a peer address is known: a reconnecting openvpn is not.
    if (_linkDown) tunnel[key::kTunnelStatus] = Tunnel::GetStatusStr(TUNNEL_STATUS_NONE);
    tunnel[key::kTunnelPeerIp] = _peer;
    tunnel[key::kTunnelFailures] = _policy.Failures();
    if (_starting) tunnel[key::kTunnelStarting] = _protocol;
    // Never shown, whatever Write does with the section in the future.
    tunnel.removeMember("relay_pass");
    return out;
}

void TunnelCycle::Dump(Json::Value& out) const {
    out = Status();
    out["heartbeat_s"] = _heartbeatSeconds;
    out["heartbeat_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kHeartbeatTimer));
    out["open_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kOpenTimer));
    out["up_wait_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kUpWaitTimer));
    out["ending"] = static_cast<Json::UInt>(_ending.size());
    _policy.Dump(out["retry"]);
    out["retry"]["retry_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(kRetryTimer));
}

}  // namespace zeparelayd
