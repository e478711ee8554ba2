// When the daemon tries again. Each cycle owns one policy: it reports what an
// exchange gave and gets back what to do next and after how long; the policy
// keeps the counts and the deadline, and knows nothing of the network.
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

// A wait that was decided, and when it runs out.
class Deadline {
public:
    explicit Deadline(const Clock& clock) : _clock(clock), _dueMs(-1) {}
    void Arm(int64_t delayMs) { _dueMs = _clock.NowMs() + delayMs; }
    void Clear() { _dueMs = -1; }
    // -1 when nothing is due, else the milliseconds left (0 once passed).
    int64_t RemainingMs() const;

private:
    const Clock& _clock;
    int64_t _dueMs;
};

// Registration with the control server:
//   - a failure waits 30 s, doubling per consecutive failure up to 30 min,
//     plus up to a quarter of the wait as jitter, so that many appliances do
//     not retry in step;
//   - a name-resolution failure retries after 10 s (with a fresh DNS cache);
//   - failures that only a changed configuration or account can cure (auth,
//     not supported, expired key, bad configuration) wait for a reload;
//   - "server changed" with a new host: the first move is followed at once;
//     a run of moves without a success backs off like failures do, so a
//     server that keeps sending the daemon elsewhere cannot make it loop.
class RegistrationPolicy {
public:
    static constexpr int64_t FIRST_DELAY_MS = 30000;
    static constexpr int64_t MAX_DELAY_MS = 1800000;
    static constexpr int64_t RESOLVE_DELAY_MS = 10000;
    // Returned instead of a delay when only a reload helps.
    static constexpr int64_t WAIT_FOR_RELOAD = -1;

    RegistrationPolicy(const Clock& clock, RandomSource random);

    // An attempt starts now: nothing is due any more.
    void OnAttempt() { _due.Clear(); }
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
    int64_t RemainingMs() const { return _due.RemainingMs(); }
    void Dump(Json::Value& out) const;

    static bool NeedsReload(ZEPA::Relay::RELAYD_RET err);
    // The doubling wait for the n-th consecutive failure (n >= 1), with jitter.
    int64_t BackoffMs(int n) const;

private:
    int64_t Arm(int64_t delayMs);

    RandomSource _random;
    Deadline _due;
    int _failures;
    int _moves;
    bool _halted;
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
    // An exchange starts now, or the cycle stops: nothing is due any more.
    void OnAttempt() { _due.Clear(); }
    // A reload: everything starts afresh.
    void Reset();

    bool Halted() const { return _halted; }
    bool Mapped() const { return _mapped; }
    int Failures() const { return _failures; }
    int RetryClass() const { return _retryClass; }
    int64_t RemainingMs() const { return _due.RemainingMs(); }
    void Dump(Json::Value& out) const;

    // The wait after the n-th consecutive normal failure (n >= 1), with jitter.
    int64_t NormalBackoffMs(int n, int pollSeconds) const;

private:
    AliasStep Run(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, int64_t delayMs, bool cleanDns = false);
    AliasStep Halt();

    RandomSource _random;
    Deadline _due;
    int _failures;
    bool _halted;
    bool _mapped;  // mapped since the last (re)registration
    int _retryClass;
};

// Reconnecting a tunnel that failed to open or closed later: register again
// (which also fetches fresh credentials) after 2 s doubling per consecutive
// failure up to 5 min, plus up to a quarter of the wait as jitter. A tunnel
// that comes up, or an answer without a tunnel, starts the count afresh.
class TunnelPolicy {
public:
    static constexpr int64_t FIRST_DELAY_MS = 2000;
    static constexpr int64_t MAX_DELAY_MS = 300000;

    TunnelPolicy(const Clock& clock, RandomSource random);

    // The tunnel failed: the wait before registering again.
    int64_t OnFailure();
    void OnUp();
    // Registering again now, or the cycle stops: nothing is due any more.
    void OnAttempt() { _due.Clear(); }
    void Reset();

    int Failures() const { return _failures; }
    int64_t RemainingMs() const { return _due.RemainingMs(); }
    void Dump(Json::Value& out) const;

    // The wait for the n-th consecutive failure (n >= 1), with jitter.
    int64_t BackoffMs(int n) const;

private:
    RandomSource _random;
    Deadline _due;
    int _failures;
};

}  // namespace zeparelayd

#endif
