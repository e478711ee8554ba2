#include "retry_policy.h"

#include <stdlib.h>

#include <algorithm>

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

// A random share of span: 0 to span inclusive; a source may give any long.
int64_t Jitter(const RandomSource& random, int64_t span) {
    if (span <= 0) return 0;
    const long r = random();
    const int64_t value = r < 0 ? -(static_cast<int64_t>(r) + 1) : r;
    return value % (span + 1);
}

// first, doubled per step after the first, never above cap.
int64_t Doubling(int64_t first, int n, int64_t cap) {
    int64_t delay = first;
    for (int i = 1; i < n && delay < cap; ++i) delay *= 2;
    return std::min(delay, cap);
}

}  // namespace

int64_t BackoffRule::WaitMs(int n, int64_t previousMs, const RandomSource& random) const {
    const int64_t cap = std::max(capMs, firstMs);
    if (jitter == JitterKind::DECORRELATED) {
        const int64_t upper = std::max(firstMs, std::min(cap, 3 * std::max(previousMs, firstMs)));
        return firstMs + Jitter(random, upper - firstMs);
    }
    const int64_t delay = Doubling(firstMs, n, cap);
    switch (jitter) {
        case JitterKind::FULL:
            return Jitter(random, delay);
        case JitterKind::EQUAL:
            return delay - delay / 2 + Jitter(random, delay / 2);
        default:
            return delay + Jitter(random, delay * addedPercent / 100);
    }
}

// ---- registration ------------------------------------------------------------

RandomSource SystemRandom() {
    return [] { return random(); };
}

RegistrationPolicy::RegistrationPolicy(const Clock& clock, RandomSource random, RegistrationRules rules)
    : _clock(clock),
      _random(std::move(random)),
      _rules(rules),
      _attemptMs(-1),
      _failures(0),
      _moves(0),
      _halted(false),
      _lastBackoffMs(0) {}

void RegistrationPolicy::OnAttempt() { _attemptMs = _clock.NowMs(); }

int64_t RegistrationPolicy::OnStart() { return Jitter(_random, _rules.startSpreadMs); }

bool RegistrationPolicy::NeedsReload(RELAYD_RET err) {
    return err == RELAYD_ERR_AUTH || err == RELAYD_ERR_NOT_SUPPORT || err == RELAYD_ERR_API_KEY_EXPIRED ||
           err == RELAYD_ERR_CONFIG;
}

int64_t RegistrationPolicy::BackoffMs(int n) const {
    return _rules.failure.WaitMs(n, n > 1 ? _lastBackoffMs : 0, _random);
}

int64_t RegistrationPolicy::OnFailure(RELAYD_RET err) {
    if (NeedsReload(err)) {
        _halted = true;
        return WAIT_FOR_RELOAD;
    }
    if (err == RELAYD_ERR_RESOLV && !_rules.resolveBacksOff) {
        return _rules.resolveMs + Jitter(_random, _rules.resolveJitterMs);
    }
    ++_failures;
    _lastBackoffMs = BackoffMs(_failures);
    if (_rules.fromAttemptStart && _attemptMs >= 0) {
        return std::max<int64_t>(_attemptMs + _lastBackoffMs - _clock.NowMs(), 0);
    }
    return _lastBackoffMs;
}

int64_t RegistrationPolicy::OnServerMoved() {
    ++_moves;
    if (_moves == 1) return Jitter(_random, _rules.moveSpreadMs);
    _lastBackoffMs = BackoffMs(_moves - 1);
    return _lastBackoffMs;
}

void RegistrationPolicy::OnSuccess() {
    _failures = 0;
    _moves = 0;
    _lastBackoffMs = 0;
}

void RegistrationPolicy::Reset() {
    OnSuccess();
    _halted = false;
}

void RegistrationPolicy::Dump(Json::Value& out) const {
    out["failures"] = _failures;
    out["moves"] = _moves;
    out["halted"] = _halted;
}

// ---- alias -------------------------------------------------------------------

AliasPolicy::AliasPolicy(const Clock&, RandomSource random)
    : _random(std::move(random)), _failures(0), _halted(false), _mapped(false), _retryClass(-1) {}

int64_t AliasPolicy::NormalBackoffMs(int n, int pollSeconds) const {
    const int64_t cap = static_cast<int64_t>(std::max(pollSeconds, 60)) * 1000;
    const int64_t delay = Doubling(FIRST_DELAY_MS, n, cap);
    return delay + Jitter(_random, delay / 2);
}

AliasStep AliasPolicy::Run(ALIAS_REQUEST_CMD cmd, int64_t delayMs, bool cleanDns) {
    return AliasStep{true, cmd, delayMs, cleanDns};
}

AliasStep AliasPolicy::Halt() {
    _halted = true;
    return AliasStep{false, ALIAS_REQ_MAP, -1, false};
}

AliasStep AliasPolicy::OnRegistered() {
    if (_halted) return AliasStep{false, ALIAS_REQ_MAP, -1, false};
    return Run(_mapped ? ALIAS_REQ_KEEP_ALIVE : ALIAS_REQ_MAP, 0);
}

AliasStep AliasPolicy::OnRequested() { return Run(ALIAS_REQ_MAP, 0); }

AliasStep AliasPolicy::OnOutcome(ALIAS_REQUEST_CMD cmd, ALIAS_RET ret, int pollSeconds, int pollingSeconds) {
    ALIAS_RETRY_TYPE type = ALIAS_RETRY_NORMAL;
    AliasRequest::GetRetryType(ret, type);
    _retryClass = type;
    if (ret == ALIAS_RET_SUCCESS) {
        _failures = 0;
        _mapped = true;
        return Run(ALIAS_REQ_KEEP_ALIVE, static_cast<int64_t>(pollingSeconds) * 1000);
    }
    ++_failures;
    switch (type) {
        case ALIAS_RETRY_STOP:
            return Halt();
        case ALIAS_RETRY_RESOLVE:
            return Run(cmd, RESOLVE_DELAY_MS + Jitter(_random, RESOLVE_JITTER_MS - 1), true);
        default:
            if (ret == ALIAS_RET_NOT_FOUND) {
                _mapped = false;
                cmd = ALIAS_REQ_MAP;
            }
            return Run(cmd, NormalBackoffMs(_failures, pollSeconds));
    }
}

AliasStep AliasPolicy::OnNotStarted(ALIAS_REQUEST_CMD cmd, int pollSeconds) {
    ++_failures;
    return Run(cmd, NormalBackoffMs(_failures, pollSeconds));
}

void AliasPolicy::Reset() {
    _failures = 0;
    _halted = false;
    _mapped = false;
}

void AliasPolicy::Dump(Json::Value& out) const {
    out["retry_class"] = _retryClass;
    out["failures"] = _failures;
    out["halted"] = _halted;
    out["mapped"] = _mapped;
}

// ---- tunnel ------------------------------------------------------------------

TunnelPolicy::TunnelPolicy(const Clock&, RandomSource random, TunnelRules rules)
    : _random(std::move(random)), _rules(rules), _failures(0), _lastBackoffMs(0) {}

int64_t TunnelPolicy::BackoffMs(int n) const {
    return _rules.failure.WaitMs(n, n > 1 ? _lastBackoffMs : 0, _random);
}

int64_t TunnelPolicy::OnFailure() {
    ++_failures;
    _lastBackoffMs = BackoffMs(_failures);
    return _lastBackoffMs;
}

int64_t TunnelPolicy::OnClosed() {
    ++_failures;
    _lastBackoffMs = std::max<int64_t>(_rules.closedMs, 0) + Jitter(_random, _rules.closedSpreadMs);
    return _lastBackoffMs;
}

void TunnelPolicy::OnUp() {
    _failures = 0;
    _lastBackoffMs = 0;
}

void TunnelPolicy::Reset() { OnUp(); }

void TunnelPolicy::Dump(Json::Value& out) const { out["failures"] = _failures; }

}  // namespace zeparelayd
