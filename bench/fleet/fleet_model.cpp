#include "fleet_model.h"

#include <zeparelayd/config_alias.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request_alias.h>

#include <algorithm>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <queue>
#include <random>
#include <sstream>

using namespace ZEPA::Relay;
using zeparelayd::AliasPolicy;
using zeparelayd::AliasStep;
using zeparelayd::JitterKind;
using zeparelayd::RegistrationPolicy;
using zeparelayd::TunnelPolicy;

namespace fleet {

namespace {

constexpr int64_t SECOND = 1000;
constexpr int64_t MINUTE = 60 * SECOND;
constexpr int64_t HOUR = 60 * MINUTE;
// A request to a server that accepts and never answers ends at the
// transfer time-out of the daemon's requests.
constexpr int64_t REQUEST_TIMEOUT_MS = 90 * SECOND;
// The daemon's wait for a tunnel's up script, per protocol.
constexpr int64_t TUNNEL_WAIT_MS = 40 * SECOND;
// Minutes averaging less than this are too thin for a busiest-second ratio.
constexpr double BUSY_FLOOR = 20.0;

const char* const SERIES[] = {"register", "alias_map", "alias_keep_alive", "alias", "tunnel"};

class SimClock : public zeparelayd::Clock {
public:
    int64_t NowMs() const override { return now; }
    int64_t now = 0;
};

enum Slot {
    S_BOOT,
    S_REG_TIMER,
    S_REG_DONE,
    S_HEARTBEAT,
    S_ALIAS_TIMER,
    S_ALIAS_DONE,
    S_TUNNEL_OPEN,
    S_TUNNEL_DONE,
    S_TUNNEL_RETRY,
    S_TUNNEL_CLOSED,
    SLOTS
};

// What a server does with a request sent now.
enum class Answer { OK, REFUSED, HANGS, NO_DNS, MOVED };

struct Event {
    int64_t at;
    uint32_t appliance;
    uint32_t slot;
    uint32_t generation;
    bool operator>(const Event& o) const {
        if (at != o.at) return at > o.at;
        if (appliance != o.appliance) return appliance > o.appliance;
        return slot > o.slot;
    }
};

struct Appliance {
    Appliance(const SimClock& clock, const zeparelayd::RandomSource& random, const Rules& rules)
        : registration(clock, random, rules.registration),
          alias(clock, random),
          tunnel(clock, random, rules.tunnel) {}

    RegistrationPolicy registration;
    AliasPolicy alias;
    TunnelPolicy tunnel;
    uint32_t generation[SLOTS] = {};
    bool armed[SLOTS] = {};
    RELAYD_STATE state = RELAYD_STATE_NOT_RUNNING;
    RELAYD_RET regOutcome = RELAYD_SUCCESS;
    ALIAS_RET aliasOutcome = ALIAS_RET_SUCCESS;
    ALIAS_REQUEST_CMD aliasCmd = ALIAS_REQ_MAP;       // the exchange in flight
    ALIAS_REQUEST_CMD aliasTimerCmd = ALIAS_REQ_MAP;  // what the alias timer will send
    bool tunnelMode = false;                          // the control server answers "connect": "tunnel"
    bool tunnelExists = false;
    bool tunnelUp = false;
    bool tunnelOk = false;  // outcome of the open in flight
    bool onNewHost = false;
    bool aliasGood = false;
    bool recovered = false;
};

class Fleet {
public:
    Fleet(const FleetConfig& config, const Rules& rules, const Scenario& scenario)
        : _config(config), _rules(rules), _scenario(scenario), _rng(config.seed) {
        _random = [this] { return static_cast<long>(_rng() >> 1); };
        // The library's alias polling time draws from random().
        srandom(static_cast<unsigned>(config.seed));
        const bool power = scenario.kind == ScenarioKind::POWER_RESTORE;
        _eventMs = (power ? 0 : config.warmupMs) + config.steadyWindowMs;
        _returnMs = _eventMs;
        if (scenario.kind == ScenarioKind::OUTAGE || scenario.kind == ScenarioKind::DNS_FAILURE ||
            scenario.kind == ScenarioKind::ALIAS_DOWN) {
            _returnMs = _eventMs + scenario.durationMs;
        }
        _windowStartMs = _eventMs - config.steadyWindowMs;
        _endMs = _returnMs + config.afterMs;
        // A window that does not end on a whole second still counts its last part.
        const size_t seconds = static_cast<size_t>((_endMs - _windowStartMs + SECOND - 1) / SECOND);
        _perSecond.assign(REQ_KINDS, std::vector<uint32_t>(seconds, 0));
        _recoveredShare.assign(seconds, 0.0f);
        _appliances.reserve(config.appliances);
        for (int i = 0; i < config.appliances; ++i) {
            _appliances.emplace_back(_clock, _random, rules);
            Appliance& a = _appliances.back();
            a.tunnelMode = static_cast<int>(_rng() % 100) < config.tunnelPercent;
            int64_t boot;
            if (power) {
                boot = _eventMs + Uniform(0, config.bootSpreadMs);
            } else if (config.bootEvenly) {
                boot = config.warmupMs * i / config.appliances;
            } else {
                boot = Uniform(0, std::max<int64_t>(config.warmupMs, 1));
            }
            Schedule(static_cast<uint32_t>(i), S_BOOT, boot);
        }
        if (scenario.kind == ScenarioKind::OUTAGE) _outageAt = _eventMs;
    }

    Result Run() {
        const auto started = std::chrono::steady_clock::now();
        const int64_t reference = ReferenceMs();
        bool referenceSeen = false;
        size_t sampled = 0;
        int64_t events = 0;
        while (!_queue.empty()) {
            const Event ev = _queue.top();
            if (ev.at >= _endMs) break;
            _queue.pop();
            // Samples of the recovered share for every second passed.
            while (_windowStartMs + static_cast<int64_t>(sampled) * SECOND <= ev.at &&
                   sampled < _recoveredShare.size()) {
                if (_windowStartMs + static_cast<int64_t>(sampled) * SECOND >= 0) {
                    _recoveredShare[sampled] = static_cast<float>(_recoveredCount) / _config.appliances;
                }
                ++sampled;
            }
            if (_outageAt >= 0 && ev.at >= _outageAt) StartOutage();
            if (!referenceSeen && ev.at >= reference) {
                referenceSeen = true;
                _referenceShare = static_cast<double>(_recoveredCount) / _config.appliances;
                _clock.now = reference;
                Thresholds();
            }
            Appliance& a = _appliances[ev.appliance];
            if (ev.generation != a.generation[ev.slot]) continue;
            a.armed[ev.slot] = false;
            _clock.now = ev.at;
            ++events;
            Dispatch(ev.appliance, a, static_cast<Slot>(ev.slot));
            UpdateRecovered(a);
        }
        for (; sampled < _recoveredShare.size(); ++sampled) {
            _recoveredShare[sampled] = static_cast<float>(_recoveredCount) / _config.appliances;
        }
        if (!referenceSeen) _referenceShare = static_cast<double>(_recoveredCount) / _config.appliances;

        Result r;
        r.scenario = _scenario;
        r.rules = _rules;
        r.appliances = _config.appliances;
        r.events = events;
        r.windowStartMs = _windowStartMs;
        r.eventMs = _eventMs;
        r.returnMs = _returnMs;
        r.recoveredAtReference = _referenceShare;
        r.recover50 = _reached[0];
        r.recover99 = _reached[1];
        r.recover100 = _reached[2];
        r.perSecond = std::move(_perSecond);
        r.recoveredShare = std::move(_recoveredShare);
        r.wallSeconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - started).count();
        return r;
    }

private:
    // ---- time and events ------------------------------------------------------

    int64_t Uniform(int64_t lo, int64_t hi) {
        if (hi <= lo) return lo;
        return lo + static_cast<int64_t>(_rng() % static_cast<uint64_t>(hi - lo));
    }

    void Schedule(uint32_t i, Slot slot, int64_t at) {
        Appliance& a = _appliances[i];
        ++a.generation[slot];
        a.armed[slot] = true;
        _queue.push(Event{at, i, static_cast<uint32_t>(slot), a.generation[slot]});
    }
    void After(uint32_t i, Slot slot, int64_t delayMs) {
        Schedule(i, slot, _clock.now + std::max<int64_t>(delayMs, 0));
    }
    void Cancel(Appliance& a, Slot slot) {
        ++a.generation[slot];
        a.armed[slot] = false;
    }

    // What a server sees of a request with that answer.
    bool Reaches(Answer answer) const {
        return !_config.servedOnly || (answer != Answer::REFUSED && answer != Answer::NO_DNS);
    }

    void Count(RequestKind kind) {
        if (_clock.now < _windowStartMs || _clock.now >= _endMs) return;
        ++_perSecond[kind][static_cast<size_t>((_clock.now - _windowStartMs) / SECOND)];
    }

    // ---- the scripted relay ---------------------------------------------------

    bool Between(int64_t from, int64_t to) const { return _clock.now >= from && _clock.now < to; }

    Answer ControlServer(const Appliance& a) const {
        switch (_scenario.kind) {
            case ScenarioKind::OUTAGE:
                if (Between(_eventMs, _returnMs)) return _scenario.hanging ? Answer::HANGS : Answer::REFUSED;
                break;
            case ScenarioKind::DNS_FAILURE:
                if (Between(_eventMs, _returnMs)) return Answer::NO_DNS;
                break;
            case ScenarioKind::SERVER_CHANGED:
                if (_clock.now >= _eventMs && !a.onNewHost) return Answer::MOVED;
                break;
            default:
                break;
        }
        return Answer::OK;
    }

    Answer AliasServer() const {
        if (_scenario.kind == ScenarioKind::ALIAS_DOWN && Between(_eventMs, _returnMs))
            return Answer::REFUSED;
        if (_scenario.kind == ScenarioKind::DNS_FAILURE && Between(_eventMs, _returnMs))
            return Answer::NO_DNS;
        return Answer::OK;
    }

    // The relay's tunnel servers are addressed by IP: only an outage stops them.
    Answer TunnelServer() const {
        if (_scenario.kind == ScenarioKind::OUTAGE && Between(_eventMs, _returnMs)) {
            return _scenario.hanging ? Answer::HANGS : Answer::REFUSED;
        }
        return Answer::OK;
    }

    // When the relay goes down, every tunnel's VPN child notices within its
    // ping time-out (10 s without an answer, the relay's pings 10 s apart) and exits.
    void StartOutage() {
        _outageAt = -1;
        const int64_t now = _clock.now;
        for (uint32_t i = 0; i < _appliances.size(); ++i) {
            if (_appliances[i].tunnelUp)
                Schedule(i, S_TUNNEL_CLOSED, _eventMs + Uniform(10 * SECOND, 20 * SECOND));
        }
        _clock.now = now;
    }

    int64_t AnswerDelay(Answer answer) {
        switch (answer) {
            case Answer::HANGS:
                return REQUEST_TIMEOUT_MS;
            case Answer::REFUSED:
                return Uniform(10, 60);
            case Answer::NO_DNS:
                return Uniform(5, 50);
            default:
                return Uniform(100, 300);
        }
    }

    // ---- the daemon ------------------------------------------------------------

    bool IsRegistered(const Appliance& a) const {
        return a.state == RELAYD_STATE_DIRECT_CONNECT || a.state == RELAYD_STATE_CONNECTED ||
               a.state == RELAYD_STATE_CONNECTED_ALT;
    }

    void SetState(Appliance& a, RELAYD_STATE state) { a.state = state; }

    void Dispatch(uint32_t i, Appliance& a, Slot slot) {
        switch (slot) {
            case S_BOOT:
                Boot(i, a);
                break;
            case S_REG_TIMER:
                RegStart(i, a, false);
                break;
            case S_REG_DONE:
                RegDone(i, a);
                break;
            case S_HEARTBEAT:
                // TunnelCycle's heartbeat: REGISTER_AGAIN.
                RegStart(i, a, IsRegistered(a));
                break;
            case S_ALIAS_TIMER:
                AliasRun(i, a, a.aliasTimerCmd);
                break;
            case S_ALIAS_DONE:
                AliasDone(i, a);
                break;
            case S_TUNNEL_OPEN:
                TunnelOpen(i, a);
                break;
            case S_TUNNEL_DONE:
                TunnelOpened(i, a);
                break;
            case S_TUNNEL_RETRY:
                // TunnelCycle's retry timer: REGISTER_AGAIN.
                RegStart(i, a, IsRegistered(a));
                break;
            case S_TUNNEL_CLOSED:
                // SIGCHLD, then CheckStatusChanged: READY -> CLOSE.
                if (a.tunnelUp) {
                    a.tunnelUp = false;
                    TunnelFailed(i, a, true);
                }
                break;
            default:
                break;
        }
    }

    // RelayDaemon::Start.
    void Boot(uint32_t i, Appliance& a) {
        SetState(a, RELAYD_STATE_STARTING);
        if (_rules.registration.startSpreadMs > 0) {
            After(i, S_REG_TIMER, a.registration.OnStart());
        } else {
            RegStart(i, a, false);
        }
    }

    // RegistrationCycle::Start.
    void RegStart(uint32_t i, Appliance& a, bool keepState) {
        Cancel(a, S_REG_TIMER);
        Cancel(a, S_REG_DONE);
        a.registration.OnAttempt();
        if (!keepState) SetState(a, RELAYD_STATE_LOGIN);
        const Answer answer = ControlServer(a);
        if (Reaches(answer)) Count(REQ_REGISTER);
        switch (answer) {
            case Answer::OK:
                a.regOutcome = RELAYD_SUCCESS;
                break;
            case Answer::MOVED:
                a.regOutcome = RELAYD_ERR_SERVER_CHANGED;
                break;
            case Answer::NO_DNS:
                a.regOutcome = RELAYD_ERR_RESOLV;
                break;
            default:
                a.regOutcome = RELAYD_ERR_NETWORK;
                break;
        }
        After(i, S_REG_DONE, AnswerDelay(answer));
    }

    // RegistrationCycle::OnDone.
    void RegDone(uint32_t i, Appliance& a) {
        const RELAYD_RET err = a.regOutcome;
        if (err == RELAYD_ERR_SERVER_CHANGED) {
            a.onNewHost = true;  // WriteControlServerHost
            const int64_t delay = a.registration.OnServerMoved();
            if (delay == 0) {
                RegStart(i, a, false);
            } else {
                SetState(a, RELAYD_STATE_LOGIN);
                After(i, S_REG_TIMER, delay);
            }
            return;
        }
        if (err != RELAYD_SUCCESS) {
            const int64_t delay = a.registration.OnFailure(err);
            SetState(a, RELAYD_STATE_LOGIN);
            if (delay == RegistrationPolicy::WAIT_FOR_RELOAD) return;
            After(i, S_REG_TIMER, delay);
            return;
        }
        a.registration.OnSuccess();
        // RelayDaemon::OnRegistration, REGISTERED.
        TunnelOnRegistered(i, a);
        if (!a.armed[S_ALIAS_TIMER] && !a.armed[S_ALIAS_DONE]) AliasOnRegistered(i, a);
    }

    // TunnelCycle::OnRegistered, the answer carrying "connect" and "heartbeat".
    void TunnelOnRegistered(uint32_t i, Appliance& a) {
        Cancel(a, S_HEARTBEAT);
        Cancel(a, S_TUNNEL_RETRY);
        if (a.tunnelMode) {
            if (a.tunnelExists && a.tunnelUp) {
                SetState(a, RELAYD_STATE_CONNECTED_ALT);
            } else {
                TunnelTeardown(a);
                a.tunnelExists = true;
                SetState(a, RELAYD_STATE_CONNECTED);
                After(i, S_TUNNEL_OPEN, 0);
            }
        } else {
            TunnelTeardown(a);
            a.tunnelExists = false;
            a.tunnel.Reset();
            SetState(a, RELAYD_STATE_DIRECT_CONNECT);
        }
        After(i, S_HEARTBEAT, static_cast<int64_t>(_config.heartbeatSeconds) * SECOND);
    }

    void TunnelTeardown(Appliance& a) {
        Cancel(a, S_TUNNEL_OPEN);
        Cancel(a, S_TUNNEL_DONE);
        Cancel(a, S_TUNNEL_CLOSED);
        a.tunnelUp = false;
    }

    // TunnelCycle::Open: Tunnel::Create(true), UDP first, then TCP.
    void TunnelOpen(uint32_t i, Appliance& a) {
        if (!a.tunnelExists) return;
        const Answer answer = TunnelServer();
        if (Reaches(answer)) Count(REQ_TUNNEL);
        if (answer == Answer::OK) {
            a.tunnelOk = true;
            After(i, S_TUNNEL_DONE, Uniform(1 * SECOND, 3 * SECOND));
            return;
        }
        // UDP gets no answer; its child gives up after its ping time-out. TCP is
        // then refused at once, or hangs until the daemon's wait ends.
        if (Reaches(answer)) Count(REQ_TUNNEL);
        a.tunnelOk = false;
        After(i, S_TUNNEL_DONE, 10 * SECOND + (answer == Answer::HANGS ? TUNNEL_WAIT_MS : Uniform(10, 60)));
    }

    void TunnelOpened(uint32_t i, Appliance& a) {
        if (!a.tunnelOk) {
            TunnelFailed(i, a);
            return;
        }
        a.tunnel.OnUp();
        a.tunnelUp = true;
        SetState(a, RELAYD_STATE_CONNECTED_ALT);
    }

    // TunnelCycle::Failed.
    void TunnelFailed(uint32_t i, Appliance& a, bool wasUp = false) {
        TunnelTeardown(a);
        const int64_t delay = wasUp ? a.tunnel.OnClosed() : a.tunnel.OnFailure();
        Cancel(a, S_HEARTBEAT);
        SetState(a, RELAYD_STATE_LOGIN);
        After(i, S_TUNNEL_RETRY, delay);
    }

    // AliasCycle::OnRegistered and Follow.
    void AliasOnRegistered(uint32_t i, Appliance& a) {
        if (!a.alias.Halted()) AliasFollow(i, a, a.alias.OnRegistered());
    }

    void AliasFollow(uint32_t i, Appliance& a, const AliasStep& step) {
        Cancel(a, S_ALIAS_TIMER);
        if (!step.run) return;
        a.aliasTimerCmd = step.cmd;
        After(i, S_ALIAS_TIMER, step.delayMs);
    }

    // AliasCycle::Run.
    void AliasRun(uint32_t i, Appliance& a, ALIAS_REQUEST_CMD cmd) {
        if (!IsRegistered(a)) return;
        Cancel(a, S_ALIAS_DONE);
        const Answer answer = AliasServer();
        if (Reaches(answer)) Count(cmd == ALIAS_REQ_MAP ? REQ_ALIAS_MAP : REQ_ALIAS_KEEP_ALIVE);
        a.aliasCmd = cmd;
        a.aliasOutcome = answer == Answer::OK       ? ALIAS_RET_SUCCESS
                         : answer == Answer::NO_DNS ? ALIAS_RET_DNS
                                                    : ALIAS_RET_NETWORK;
        After(i, S_ALIAS_DONE, AnswerDelay(answer));
    }

    // AliasCycle::OnDone.
    void AliasDone(uint32_t i, Appliance& a) {
        const ALIAS_RET ret = a.aliasOutcome;
        a.aliasGood = ret == ALIAS_RET_SUCCESS;
        const int polling = ret == ALIAS_RET_SUCCESS ? _aliasConf.GetPollingTime() : 0;
        AliasFollow(i, a, a.alias.OnOutcome(a.aliasCmd, ret, _aliasConf.GetPollSeconds(), polling));
    }

    // ---- recovery ----------------------------------------------------------------

    int64_t ReferenceMs() const {
        return _scenario.kind == ScenarioKind::POWER_RESTORE || _scenario.kind == ScenarioKind::SERVER_CHANGED
                   ? _eventMs
                   : _returnMs;
    }

    bool Recovered(const Appliance& a) const {
        if (_scenario.kind == ScenarioKind::ALIAS_DOWN) return a.aliasGood;
        const bool connected = a.state == RELAYD_STATE_DIRECT_CONNECT ||
                               a.state == RELAYD_STATE_CONNECTED_ALT ||
                               (a.state == RELAYD_STATE_CONNECTED && !a.tunnelMode);
        if (_scenario.kind == ScenarioKind::SERVER_CHANGED) return connected && a.onNewHost;
        return connected;
    }

    void UpdateRecovered(Appliance& a) {
        const bool now = Recovered(a);
        if (now == a.recovered) return;
        a.recovered = now;
        _recoveredCount += now ? 1 : -1;
        if (now) Thresholds();
    }

    void Thresholds() {
        const int64_t reference = ReferenceMs();
        if (_clock.now < reference) return;
        const double need[3] = {std::ceil(0.5 * _config.appliances), std::ceil(0.99 * _config.appliances),
                                static_cast<double>(_config.appliances)};
        for (int k = 0; k < 3; ++k) {
            if (_reached[k] < 0 && _recoveredCount >= need[k]) {
                _reached[k] = static_cast<double>(_clock.now - reference) / SECOND;
            }
        }
    }

    const FleetConfig& _config;
    const Rules& _rules;
    const Scenario& _scenario;
    SimClock _clock;
    std::mt19937_64 _rng;
    zeparelayd::RandomSource _random;
    AliasConf _aliasConf;
    std::vector<Appliance> _appliances;
    std::priority_queue<Event, std::vector<Event>, std::greater<Event>> _queue;
    int64_t _eventMs = 0, _returnMs = 0, _windowStartMs = 0, _endMs = 0, _outageAt = -1;
    std::vector<std::vector<uint32_t>> _perSecond;
    std::vector<float> _recoveredShare;
    int _recoveredCount = 0;
    double _referenceShare = 0;
    double _reached[3] = {-1, -1, -1};
};

// Per-second counts of a series: a kind, or the alias server's two kinds.
std::vector<uint32_t> SeriesCounts(const Result& r, int series) {
    switch (series) {
        case 0:
            return r.perSecond[REQ_REGISTER];
        case 1:
            return r.perSecond[REQ_ALIAS_MAP];
        case 2:
            return r.perSecond[REQ_ALIAS_KEEP_ALIVE];
        case 3: {
            std::vector<uint32_t> sum(r.perSecond[REQ_ALIAS_MAP]);
            for (size_t s = 0; s < sum.size(); ++s) sum[s] += r.perSecond[REQ_ALIAS_KEEP_ALIVE][s];
            return sum;
        }
        default:
            return r.perSecond[REQ_TUNNEL];
    }
}

SeriesFigures Figures(const Result& r, int series, const Result* steadyFrom) {
    SeriesFigures f;
    f.name = SERIES[series];
    const std::vector<uint32_t> c = SeriesCounts(r, series);
    const size_t n = c.size();
    std::vector<double> prefix(n + 1, 0);
    for (size_t s = 0; s < n; ++s) prefix[s + 1] = prefix[s] + c[s];
    const size_t event = static_cast<size_t>((r.eventMs - r.windowStartMs) / SECOND);
    const size_t back = static_cast<size_t>((r.returnMs - r.windowStartMs) / SECOND);
    if (steadyFrom) {
        f.steady = steadyFrom->Series(f.name).steady;
    } else if (event > 0) {
        f.steady = prefix[event] / static_cast<double>(event);
    }
    for (size_t s = event; s + 60 <= n; ++s) {
        const double mean = (prefix[s + 60] - prefix[s]) / 60.0;
        f.peak = std::max(f.peak, mean);
        if (s >= back) f.peakAfterReturn = std::max(f.peakAfterReturn, mean);
    }
    for (size_t s = 30; s + 30 <= n; ++s) {
        const double mean = (prefix[s + 30] - prefix[s - 30]) / 60.0;
        if (mean <= 0) continue;
        if (mean >= BUSY_FLOOR) f.busiestRatio = std::max(f.busiestRatio, c[s] / mean);
        // Chance is judged at the busier half-minute's rate: where a stream of
        // requests starts or ends (the relay's return, the last appliance
        // back) the minute's mean is half the rate the second is drawn at.
        const double before = (prefix[s] - prefix[s - 30]) / 30.0;
        const double after = (prefix[s + 30] - prefix[s + 1]) / 29.0;
        const double local = std::max(before, after);
        if (c[s] > 3 * mean && c[s] > local + 6 * std::sqrt(local) + 3) f.lockStep = true;
    }
    return f;
}

std::string Seconds(double s) {
    if (s < 0) return "never";
    char buf[32];
    snprintf(buf, sizeof buf, "%.0f s", s);
    return buf;
}

std::string Ratio(double peak, double steady) {
    // Below one request in 20 s the steady rate is too thin to divide by.
    if (steady < 0.05) return "-";
    char buf[32];
    snprintf(buf, sizeof buf, "%.2f", peak / steady);
    return buf;
}

}  // namespace

const char* KindName(int kind) {
    static const char* const names[] = {"register", "alias_map", "alias_keep_alive", "tunnel"};
    return kind >= 0 && kind < REQ_KINDS ? names[kind] : "?";
}

std::vector<Scenario> DefaultScenarios() {
    std::vector<Scenario> out;
    out.push_back({"steady", ScenarioKind::STEADY, 0, false});
    for (const auto& len : {std::make_pair("1m", MINUTE), std::make_pair("5m", 5 * MINUTE),
                            std::make_pair("1h", HOUR), std::make_pair("6h", 6 * HOUR)}) {
        out.push_back(
            {std::string("outage-") + len.first + "-refused", ScenarioKind::OUTAGE, len.second, false});
        out.push_back(
            {std::string("outage-") + len.first + "-hanging", ScenarioKind::OUTAGE, len.second, true});
    }
    out.push_back({"power-restore", ScenarioKind::POWER_RESTORE, 0, false});
    out.push_back({"dns-30m", ScenarioKind::DNS_FAILURE, 30 * MINUTE, false});
    out.push_back({"server-changed", ScenarioKind::SERVER_CHANGED, 0, false});
    out.push_back({"alias-down-1h", ScenarioKind::ALIAS_DOWN, HOUR, false});
    return out;
}

bool FindScenario(const std::string& name, Scenario& out) {
    for (const Scenario& s : DefaultScenarios()) {
        if (s.name == name) {
            out = s;
            return true;
        }
    }
    // Any other outage: "outage-<number><s|m|h>-<refused|hanging>", up to a day.
    long long length = 0;
    char unit = 0;
    char how[16] = {};
    int used = 0;
    if (sscanf(name.c_str(), "outage-%9lld%c-%15[a-z]%n", &length, &unit, how, &used) != 3 ||
        used != static_cast<int>(name.size()) || length <= 0) {
        return false;
    }
    const int64_t scale = unit == 's' ? SECOND : unit == 'm' ? MINUTE : unit == 'h' ? HOUR : 0;
    const std::string kind = how;
    if (scale == 0 || (kind != "refused" && kind != "hanging") || length * scale > 24 * HOUR) return false;
    out = {name, ScenarioKind::OUTAGE, length * scale, kind == "hanging"};
    return true;
}

std::vector<Rules> RuleVariants() {
    using zeparelayd::BackoffRule;
    std::vector<Rules> out;
    // The rules before the fleet was measured: 30 s doubling to 30 min plus up
    // to a quarter, 10 s after a failed lookup, a tunnel retried after 2 s.
    Rules before;
    before.name = "before";
    before.registration.failure = {30 * SECOND, 30 * MINUTE, JitterKind::ADDED, 25};
    before.registration.resolveBacksOff = false;
    before.registration.fromAttemptStart = false;
    before.registration.startSpreadMs = 0;
    before.tunnel.failure = {2 * SECOND, 5 * MINUTE, JitterKind::ADDED, 25};
    before.tunnel.closedMs = 2 * SECOND;  // a closed tunnel alike: its first failure
    before.tunnel.closedSpreadMs = 500;
    out.push_back(before);
    auto backoff = [&](const char* name, BackoffRule rule, bool fromAttemptStart = false) {
        Rules r = before;
        r.name = name;
        r.registration.failure = rule;
        r.registration.fromAttemptStart = fromAttemptStart;
        out.push_back(r);
        return r;
    };
    // The registration's back-off alone.
    backoff("cap-4m", {30 * SECOND, 4 * MINUTE, JitterKind::ADDED, 25});
    backoff("full-30s-5m", {30 * SECOND, 5 * MINUTE, JitterKind::FULL, 0});
    backoff("decorr-30s-5m", {30 * SECOND, 5 * MINUTE, JitterKind::DECORRELATED, 0});
    backoff("equal-2m-4m", {2 * MINUTE, 4 * MINUTE, JitterKind::EQUAL, 0});
    backoff("equal-4m", {4 * MINUTE, 4 * MINUTE, JitterKind::EQUAL, 0});
    backoff("equal-5m", {5 * MINUTE, 5 * MINUTE, JitterKind::EQUAL, 0});
    backoff("150s+40%", {150 * SECOND, 150 * SECOND, JitterKind::ADDED, 40});
    const Rules base = backoff("cadence-285-300s", {285 * SECOND, 285 * SECOND, JitterKind::ADDED, 5}, true);
    // Each further rule on top of it.
    auto plus = [&](const char* name, const std::function<void(Rules&)>& change) {
        Rules r = base;
        r.name = name;
        change(r);
        out.push_back(r);
    };
    // Every tunnel retry spread, a closed tunnel's and a failed start's alike.
    plus("+tunnel-full-2m", [](Rules& r) {
        r.tunnel.failure = {2 * MINUTE, 5 * MINUTE, JitterKind::FULL, 0};
        r.tunnel.closedMs = 0;
        r.tunnel.closedSpreadMs = 2 * MINUTE;
    });
    plus("+tunnel-equal-2m", [](Rules& r) {
        r.tunnel.failure = {2 * MINUTE, 5 * MINUTE, JitterKind::EQUAL, 0};
        r.tunnel.closedMs = MINUTE;
        r.tunnel.closedSpreadMs = MINUTE;
    });
    plus("+dns-jitter-20s", [](Rules& r) { r.registration.resolveJitterMs = 20 * SECOND; });
    plus("+dns-backs-off", [](Rules& r) { r.registration.resolveBacksOff = true; });
    plus("+start-spread-2m", [](Rules& r) { r.registration.startSpreadMs = 2 * MINUTE; });
    plus("+start-spread-3m", [](Rules& r) { r.registration.startSpreadMs = 3 * MINUTE; });
    plus("+move-spread-2m", [](Rules& r) { r.registration.moveSpreadMs = 2 * MINUTE; });
    // The daemon's defaults.
    out.push_back(Rules());
    // The defaults with other tunnel rules: the first retry of a tunnel that
    // was up and closed after closedMs plus up to spreadMs; a failed start
    // after failure.
    auto tunnel = [&](const char* name, int64_t closedMs, int64_t spreadMs,
                      BackoffRule failure = Rules().tunnel.failure) {
        Rules r;
        r.name = name;
        r.tunnel.failure = failure;
        r.tunnel.closedMs = closedMs;
        r.tunnel.closedSpreadMs = spreadMs;
        out.push_back(r);
    };
    // As before the tunnel rule was measured: 2 s plus up to a quarter.
    tunnel("tunnel-2s", 2 * SECOND, 500);
    tunnel("tunnel-all-full-2m", 0, 2 * MINUTE, {2 * MINUTE, 5 * MINUTE, JitterKind::FULL, 0});
    tunnel("tunnel-closed-0-5m", 0, 5 * MINUTE);
    tunnel("tunnel-closed-0-4m", 0, 4 * MINUTE);
    tunnel("tunnel-closed-0-3m", 0, 3 * MINUTE);
    tunnel("tunnel-closed-0-2m", 0, 2 * MINUTE);
    tunnel("tunnel-closed-2s+2m", 2 * SECOND, 2 * MINUTE);
    tunnel("tunnel-closed-0-90s", 0, 90 * SECOND);
    tunnel("tunnel-closed-2s+90s", 2 * SECOND, 90 * SECOND);
    tunnel("tunnel-closed-0-75s", 0, 75 * SECOND);
    tunnel("tunnel-closed-0-60s", 0, 60 * SECOND);
    tunnel("tunnel-closed-2s+60s", 2 * SECOND, 60 * SECOND);
    tunnel("tunnel-closed-0-45s", 0, 45 * SECOND);
    tunnel("tunnel-closed-0-30s", 0, 30 * SECOND);
    return out;
}

bool FindRules(const std::string& name, Rules& out) {
    for (const Rules& r : RuleVariants()) {
        if (r.name == name) {
            out = r;
            return true;
        }
    }
    return false;
}

const SeriesFigures& Result::Series(const std::string& name) const {
    for (const SeriesFigures& f : series) {
        if (f.name == name) return f;
    }
    static const SeriesFigures none;
    return none;
}

Result RunScenario(const FleetConfig& config, const Rules& rules, const Scenario& scenario,
                   const Result* steadyFrom) {
    Fleet fleet(config, rules, scenario);
    Result r = fleet.Run();
    const Result* reference = scenario.kind == ScenarioKind::POWER_RESTORE ? steadyFrom : nullptr;
    for (int s = 0; s < 5; ++s) r.series.push_back(Figures(r, s, reference));
    return r;
}

bool ReadRecordedRun(const std::string& path, RecordedRun& out, std::string& error) {
    std::ifstream in(path);
    if (!in) {
        error = path + ": cannot be read";
        return false;
    }
    out = RecordedRun();
    std::string line;
    bool header = false, columns = false;
    int lineNo = 0;
    while (std::getline(in, line)) {
        ++lineNo;
        if (line.rfind("# real fleet:", 0) == 0) {
            char rest[64] = "";
            header = sscanf(line.c_str(),
                            "# real fleet: appliances %d heartbeat %d boot_spread %lf steady %lf outage %lf "
                            "after %lf%63s",
                            &out.appliances, &out.heartbeatSeconds, &out.bootSpreadSeconds,
                            &out.steadySeconds, &out.outageSeconds, &out.afterSeconds, rest) == 6;
            continue;
        }
        if (line.rfind("#", 0) == 0) {
            out.notes.push_back(line.substr(line.find_first_not_of("# ")));
            continue;
        }
        if (!columns) {
            columns = line == "seconds_from_event,kind,appliance,ok";
            if (!columns) break;
            continue;
        }
        std::istringstream fields(line);
        std::string t, kind, appliance, ok;
        if (!std::getline(fields, t, ',') || !std::getline(fields, kind, ',') ||
            !std::getline(fields, appliance, ',') || !std::getline(fields, ok)) {
            error = path + ":" + std::to_string(lineNo) + ": not time,kind,appliance,ok";
            return false;
        }
        RecordedRequest r;
        char* end = nullptr;
        r.secondsFromEvent = strtod(t.c_str(), &end);
        const bool timeOk = end != t.c_str() && *end == '\0';
        r.kind = -1;
        for (int k = 0; k < REQ_KINDS; ++k) {
            if (kind == KindName(k)) r.kind = k;
        }
        r.appliance = atoi(appliance.c_str());
        r.ok = ok == "1";
        if (!timeOk || r.kind < 0 || r.appliance < 0 || r.appliance >= out.appliances) {
            error = path + ":" + std::to_string(lineNo) + ": bad request line '" + line + "'";
            return false;
        }
        out.requests.push_back(r);
    }
    if (!header || !columns || out.appliances < 1 || out.heartbeatSeconds < 1 || out.steadySeconds <= 0 ||
        out.outageSeconds <= 0 || out.afterSeconds <= 0) {
        error = path + ": not a record of real_fleet.py (header or column line missing or wrong)";
        return false;
    }
    return true;
}

Result ResultFromRecords(const RecordedRun& run) {
    Result r;
    r.scenario = MatchingScenario(run);
    r.rules.name = "real daemons";
    r.appliances = run.appliances;
    const int64_t boot = static_cast<int64_t>(run.bootSpreadSeconds * SECOND);
    r.windowStartMs = boot;
    r.eventMs = boot + static_cast<int64_t>(run.steadySeconds * SECOND);
    r.returnMs = r.eventMs + static_cast<int64_t>(run.outageSeconds * SECOND);
    const int64_t endMs = r.returnMs + static_cast<int64_t>(run.afterSeconds * SECOND);
    const size_t seconds = static_cast<size_t>((endMs - r.windowStartMs + SECOND - 1) / SECOND);
    r.perSecond.assign(REQ_KINDS, std::vector<uint32_t>(seconds, 0));
    r.recoveredShare.assign(seconds, 0.0f);
    std::vector<std::vector<int64_t>> successes(run.appliances);
    for (const RecordedRequest& q : run.requests) {
        const int64_t at = r.eventMs + static_cast<int64_t>(std::llround(q.secondsFromEvent * SECOND));
        ++r.events;
        if (at >= r.windowStartMs && at < endMs) {
            ++r.perSecond[q.kind][static_cast<size_t>((at - r.windowStartMs) / SECOND)];
        }
        if (q.kind == REQ_REGISTER && q.ok) successes[q.appliance].push_back(at);
    }
    // Connected from each success until the heartbeat after it did not come
    // (a refused attempt), or for good when the next success came in time.
    const int64_t beat = static_cast<int64_t>(run.heartbeatSeconds) * SECOND;
    const int64_t grace = 10 * SECOND;
    std::vector<std::pair<int64_t, int>> changes;
    for (std::vector<int64_t>& s : successes) {
        std::sort(s.begin(), s.end());
        for (size_t k = 0; k < s.size(); ++k) {
            const bool inTime = k + 1 < s.size() && s[k + 1] <= s[k] + beat + grace;
            if (k == 0 || s[k] > s[k - 1] + beat + grace) changes.emplace_back(s[k], +1);
            if (!inTime && s[k] + beat < endMs) {
                // Gone from the missed heartbeat, unless that is past the end.
                if (k + 1 < s.size() || s[k] + beat + grace < endMs) changes.emplace_back(s[k] + beat, -1);
            }
        }
    }
    std::sort(changes.begin(), changes.end());
    int count = 0;
    size_t next = 0;
    const double need[3] = {std::ceil(0.5 * run.appliances), std::ceil(0.99 * run.appliances),
                            static_cast<double>(run.appliances)};
    double reached[3] = {-1, -1, -1};
    bool referenceSeen = false;
    auto thresholds = [&](int64_t at) {
        if (at < r.returnMs) return;
        for (int k = 0; k < 3; ++k) {
            if (reached[k] < 0 && count >= need[k])
                reached[k] = static_cast<double>(at - r.returnMs) / SECOND;
        }
    };
    for (size_t sec = 0; sec < seconds; ++sec) {
        const int64_t until = r.windowStartMs + static_cast<int64_t>(sec + 1) * SECOND;
        while (next < changes.size() && changes[next].first < until) {
            if (!referenceSeen && changes[next].first >= r.returnMs) {
                referenceSeen = true;
                r.recoveredAtReference = static_cast<double>(count) / run.appliances;
                thresholds(r.returnMs);
            }
            count += changes[next].second;
            thresholds(changes[next].first);
            ++next;
        }
        if (!referenceSeen && until > r.returnMs) {
            referenceSeen = true;
            r.recoveredAtReference = static_cast<double>(count) / run.appliances;
            thresholds(r.returnMs);
        }
        r.recoveredShare[sec] = static_cast<float>(count) / run.appliances;
    }
    r.recover50 = reached[0];
    r.recover99 = reached[1];
    r.recover100 = reached[2];
    for (int s = 0; s < 5; ++s) r.series.push_back(Figures(r, s, nullptr));
    return r;
}

FleetConfig MatchingConfig(const RecordedRun& run, uint64_t seed) {
    FleetConfig c;
    c.appliances = run.appliances;
    c.seed = seed;
    c.heartbeatSeconds = run.heartbeatSeconds;
    c.tunnelPercent = 0;
    c.warmupMs = static_cast<int64_t>(run.bootSpreadSeconds * SECOND);
    c.steadyWindowMs = static_cast<int64_t>(run.steadySeconds * SECOND);
    c.afterMs = static_cast<int64_t>(run.afterSeconds * SECOND);
    c.bootEvenly = true;
    c.servedOnly = true;
    return c;
}

Rules MatchingRules() {
    Rules r;
    r.name = "shipped, no start-up spread";
    r.registration.startSpreadMs = 0;
    return r;
}

Scenario MatchingScenario(const RecordedRun& run) {
    char name[64];
    snprintf(name, sizeof name, "outage-%.0fs-refused", run.outageSeconds);
    return {name, ScenarioKind::OUTAGE, static_cast<int64_t>(run.outageSeconds * SECOND), false};
}

std::vector<std::string> CheckGoals(const Result& r) {
    std::vector<std::string> failed;
    char buf[256];
    const bool outage = r.scenario.kind == ScenarioKind::OUTAGE;
    const bool power = r.scenario.kind == ScenarioKind::POWER_RESTORE;
    if (outage || power) {
        const double limit = power ? 3.0 : 2.0;
        // Tunnels stay up and aliases stay mapped: those series have no
        // steady rate to hold a peak against; the control server has.
        for (const char* name : {"register"}) {
            const SeriesFigures& f = r.Series(name);
            if (f.steady > 0 && f.peak > limit * f.steady) {
                snprintf(buf, sizeof buf, "%s: %s peak %.1f/s is %.2f x steady (goal <= %.0f x)",
                         r.scenario.name.c_str(), name, f.peak, f.peak / f.steady, limit);
                failed.push_back(buf);
            }
        }
        if (r.recover99 < 0 || r.recover99 > 300) {
            snprintf(buf, sizeof buf, "%s: 99 %% reconnected after %s (goal <= 300 s)",
                     r.scenario.name.c_str(), Seconds(r.recover99).c_str());
            failed.push_back(buf);
        }
    }
    for (const SeriesFigures& f : r.series) {
        if (f.lockStep || f.busiestRatio > 3.0) {
            snprintf(buf, sizeof buf,
                     "%s: %s in lock-step (a second above 3 x its minute's mean; busiest %.2f x)",
                     r.scenario.name.c_str(), f.name.c_str(), f.busiestRatio);
            failed.push_back(buf);
        }
    }
    return failed;
}

std::string FormatResult(const Result& r) {
    std::ostringstream out;
    char line[256];
    snprintf(line, sizeof line, "== %s (rules %s, N = %d, %lld events, %.1f s)\n", r.scenario.name.c_str(),
             r.rules.name.c_str(), r.appliances, static_cast<long long>(r.events), r.wallSeconds);
    out << line;
    snprintf(line, sizeof line, "  %-17s %10s %10s %8s %12s %9s\n", "requests/s", "steady", "peak", "peak/st",
             "after return", "busiest/m");
    out << line;
    for (const SeriesFigures& f : r.series) {
        char busy[32];
        if (f.busiestRatio > 0) {
            snprintf(busy, sizeof busy, "%.2f%s", f.busiestRatio, f.lockStep ? "!" : "");
        } else {
            snprintf(busy, sizeof busy, "%s", f.lockStep ? "lock-step" : "-");
        }
        snprintf(line, sizeof line, "  %-17s %10.2f %10.2f %8s %12.2f %9s\n", f.name.c_str(), f.steady,
                 f.peak, Ratio(f.peak, f.steady).c_str(), f.peakAfterReturn, busy);
        out << line;
    }
    const char* what = r.scenario.kind == ScenarioKind::ALIAS_DOWN       ? "alias good again"
                       : r.scenario.kind == ScenarioKind::SERVER_CHANGED ? "registered on the new host"
                       : r.scenario.kind == ScenarioKind::POWER_RESTORE  ? "connected after boot"
                                                                         : "connected again after the return";
    snprintf(line, sizeof line, "  %s: 50 %% %s, 99 %% %s, 100 %% %s (%.1f %% at the start)\n", what,
             Seconds(r.recover50).c_str(), Seconds(r.recover99).c_str(), Seconds(r.recover100).c_str(),
             100.0 * r.recoveredAtReference);
    out << line;
    return out.str();
}

bool WriteSeriesCsv(const Result& r, const std::string& path) {
    std::ofstream out(path);
    if (!out) return false;
    out << "second,register,alias_map,alias_keep_alive,tunnel,recovered\n";
    const size_t n = r.recoveredShare.size();
    for (size_t s = 0; s < n; ++s) {
        const long long t = (r.windowStartMs - r.eventMs) / SECOND + static_cast<long long>(s);
        out << t << ',' << r.perSecond[REQ_REGISTER][s] << ',' << r.perSecond[REQ_ALIAS_MAP][s] << ','
            << r.perSecond[REQ_ALIAS_KEEP_ALIVE][s] << ',' << r.perSecond[REQ_TUNNEL][s] << ','
            << r.recoveredShare[s] << '\n';
    }
    out << "# event at 0 s, return at " << (r.returnMs - r.eventMs) / SECOND << " s\n";
    return static_cast<bool>(out);
}

}  // namespace fleet
