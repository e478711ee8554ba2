// When the daemon tries again. Each cycle owns one policy: it reports what an
// exchange gave and gets back what to do next and after how long; the policy
// keeps the counts and knows nothing of the network nor of timers. The cycle
// arms one loop timer per wait, and that timer alone says when it runs out.
#ifndef ZEPARELAYD_TOOL_RETRY_POLICY_H
#define ZEPARELAYD_TOOL_RETRY_POLICY_H

#include <json/value.h>

#include <cstdint>
#include <functional>

#include <zeparelayd/errors.h>
#include <zeparelayd/request_alias.h>

#include "clock.h"

namespace zeparelayd {

// Source of jitter: random() in the daemon, chosen values in tests.
using RandomSource = std::function<long()>;
// The daemon's source: random().
RandomSource SystemRandom();

// How a wait after repeated failures is spread, d being the doubled wait:
//   ADDED: d plus up to addedPercent of d;   FULL: anywhere in [0, d];
//   EQUAL: d/2 plus up to d/2;               DECORRELATED: anywhere between
//   the first wait and three times the previous one, at most the cap.
enum class JitterKind { ADDED, FULL, EQUAL, DECORRELATED };

// A back-off: first wait, doubled per consecutive failure up to cap, spread
// by jitter.
struct BackoffRule {
    int64_t firstMs;
    int64_t capMs;
    JitterKind jitter;
    int addedPercent;  // ADDED only

    // The wait for the n-th consecutive failure (n >= 1); previousMs is the
    // last wait (DECORRELATED only; 0 before the first).
    int64_t WaitMs(int n, int64_t previousMs, const RandomSource& random) const;
};

// The registration's rules; the daemon runs on the defaults, the fleet
// simulator (bench/fleet) also on variants of them. The defaults are sized
// for a control server that asks for a heartbeat every 5 minutes: a failing
// appliance asks about as often as a registered one does.
struct RegistrationRules {
    BackoffRule failure{285000, 285000, JitterKind::ADDED, 5};
    int64_t resolveMs = 10000;    // after a failed name lookup ...
    int64_t resolveJitterMs = 0;  // ... plus up to this much;
    bool resolveBacksOff = true;  // or: a failed lookup counts as a failure
    // A failure's wait counts from the start of the failed attempt, not from
    // its end: an attempt that hung until its time-out does not delay the next.
    bool fromAttemptStart = true;
    int64_t moveSpreadMs = 0;        // first move: up to this much (0: at once)
    int64_t startSpreadMs = 180000;  // first registration after start: up to this much
};

// The tunnel's rules. openvpn rides out link losses shorter than its ping
// time-out by itself, so a tunnel that was up closes when its relay has been
// out of reach for a while, and a relay outage closes a whole fleet's tunnels
// within seconds: their first retry is spread over closedSpreadMs. Spread over
// the registration's 5-minute cadence, they take random places in it, as the
// other appliances do; a shorter spread keeps them bunched for hours, and a
// relay that returns near the end of the bunch gets their tunnels in a burst.
// A start that failed (never up) is an appliance's own affair and keeps the
// quick back-off.
struct TunnelRules {
    BackoffRule failure{2000, 300000, JitterKind::ADDED, 25};  // a start that failed
    int64_t closedMs = 0;                                      // a tunnel that was up closed: this ...
    int64_t closedSpreadMs = 300000;                           // ... plus up to this much
};

// Registration with the control server:
//   - a failure is tried again 285 to 300 s after the failed attempt started,
//     however long it hung and however long the relay has been away: about
//     one attempt per heartbeat period, so an outage costs the relay no more
//     than its steady load, every appliance is back within 5 minutes of the
//     relay's return, and the jitter keeps appliances that failed together
//     from staying in step;
//   - a failed name lookup counts as such a failure (the cycle also empties
//     the DNS cache): a resolver outage must not make the fleet ask more often;
//   - failures that only a changed configuration or account can cure (auth,
//     not supported, expired key, bad configuration) wait for a reload;
//   - the first registration after start waits a random 0 to 3 minutes
//     (OnStart), so that a fleet powered on together is spread out;
//   - "server changed" with a new host: the first move is followed at once;
//     a run of moves without a success backs off like failures do, so a
//     server that keeps sending the daemon elsewhere cannot make it loop.
class RegistrationPolicy {
public:
    // Returned instead of a delay when only a reload helps.
    static constexpr int64_t WAIT_FOR_RELOAD = -1;

    RegistrationPolicy(const Clock& clock, RandomSource random,
                       RegistrationRules rules = RegistrationRules());

    // The wait before the first registration after the daemon starts.
    int64_t OnStart();

    // An attempt starts now (a failure's wait counts from here).
    void OnAttempt();
    // After a failed attempt: the wait before the next one, or WAIT_FOR_RELOAD.
    int64_t OnFailure(ZEPA::Relay::RELAYD_RET err);
    // The control server named a new host: the wait before registering there.
    int64_t OnServerMoved();
    void OnSuccess();
    // A reload: everything starts afresh.
    void Reset();

    bool Halted() const { return _halted; }
    int Failures() const { return _failures; }
    int Moves() const { return _moves; }
    // "failures", "moves", "halted"; the cycle adds when the next attempt is due.
    void Dump(Json::Value& out) const;

    static bool NeedsReload(ZEPA::Relay::RELAYD_RET err);
    // The wait for the n-th consecutive failure (n >= 1), with jitter,
    // counted from when the failed attempt started.
    int64_t BackoffMs(int n) const;

private:
    const Clock& _clock;
    RandomSource _random;
    RegistrationRules _rules;
    int64_t _attemptMs;  // when the last attempt started, -1 before any
    int _failures;
    int _moves;
    bool _halted;
    int64_t _lastBackoffMs;  // the last failure's wait, for decorrelated jitter
};

// What the alias cycle does next.
struct AliasStep {
    bool run;  // false: no automatic exchange until a reload
    ZEPA::Relay::ALIAS_REQUEST_CMD cmd;
    int64_t delayMs;
    bool cleanDns;  // forget cached name lookups first
};

// Keeping the alias registered, by the retry class of each answer:
//   - success: keep alive after the polling time the alias section gives;
//   - "normal" (busy, network, unknown answers...): 60 s doubling per
//     failure, at most the poll period, plus up to half again as jitter;
//     "alias not found" maps the alias again instead of keeping it alive;
//   - "resolve": forget the DNS cache and retry after 20 to 30 s;
//   - "stop" (bad auth, bad IP, alias in use): no automatic retry until a
//     reload; an explicit update request still runs.
class AliasPolicy {
public:
    static constexpr int64_t FIRST_DELAY_MS = 60000;
    static constexpr int64_t RESOLVE_DELAY_MS = 20000;
    static constexpr int64_t RESOLVE_JITTER_MS = 10000;

    // Every alias wait counts from the moment it is decided: the clock is
    // not consulted (the parameter keeps the policies' constructors alike).
    AliasPolicy(const Clock& clock, RandomSource random);

    // After a (re)registration: map, or keep alive what is mapped already.
    AliasStep OnRegistered();
    // An explicit request: now, whatever the state.
    AliasStep OnRequested();
    // After an exchange that gave ret; pollSeconds is the configured poll
    // period, pollingSeconds the next keep-alive wait after a success.
    AliasStep OnOutcome(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, ZEPA::Relay::ALIAS_RET ret, int pollSeconds,
                        int pollingSeconds);
    // The request could not even be started: a normal failure.
    AliasStep OnNotStarted(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, int pollSeconds);
    // The alias data is incomplete: nothing a retry would change.
    void OnIncompleteData() { Halt(); }
    // A reload: everything starts afresh.
    void Reset();

    bool Halted() const { return _halted; }
    bool Mapped() const { return _mapped; }
    int Failures() const { return _failures; }
    int RetryClass() const { return _retryClass; }
    // "retry_class", "failures", "halted", "mapped"; the cycle adds when the
    // next exchange is due.
    void Dump(Json::Value& out) const;

    // The wait after the n-th consecutive normal failure (n >= 1), with jitter.
    int64_t NormalBackoffMs(int n, int pollSeconds) const;

private:
    AliasStep Run(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, int64_t delayMs, bool cleanDns = false);
    AliasStep Halt();

    RandomSource _random;
    int _failures;
    bool _halted;
    bool _mapped;  // mapped since the last (re)registration
    int _retryClass;
};

// Reconnecting a tunnel by registering again (which also fetches fresh
// credentials):
//   - a tunnel that was up and closed (openvpn exited): after a random 0 to
//     5 minutes, so that the tunnels a relay outage closes together do not
//     come back together; it counts as the first failure;
//   - a start that failed: after 2 s doubling per consecutive failure up to
//     5 min, plus up to a quarter of the wait as jitter.
// A tunnel that comes up, or an answer without a tunnel, starts the count
// afresh.
class TunnelPolicy {
public:
    // Like AliasPolicy, the clock is not consulted today.
    TunnelPolicy(const Clock& clock, RandomSource random, TunnelRules rules = TunnelRules());

    // A start failed: the wait before registering again.
    int64_t OnFailure();
    // A tunnel that was up closed: the wait before registering again.
    int64_t OnClosed();
    void OnUp();
    void Reset();

    int Failures() const { return _failures; }
    // "failures"; the cycle adds when the next registration is due.
    void Dump(Json::Value& out) const;

    // The wait for the n-th consecutive failure (n >= 1), with jitter.
    int64_t BackoffMs(int n) const;

private:
    RandomSource _random;
    TunnelRules _rules;
    int _failures;
    int64_t _lastBackoffMs;
};

}  // namespace zeparelayd

#endif
