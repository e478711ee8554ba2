#define RLOG_SOURCE "alias_cycle"

#include "alias_cycle.h"

#include <zeparelayd/config_alias.h>

#include <cstdlib>

#include "log.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

const char TAG[] = "alias";
const char DELETE_TAG[] = "alias_delete";

const char* CommandWord(ALIAS_REQUEST_CMD cmd) {
    return cmd == ALIAS_REQ_MAP ? "map" : cmd == ALIAS_REQ_KEEP_ALIVE ? "keep_alive" : "other";
}

// The word shown for an outcome: the server's own word when it answered with
// one ("good", "badauth", ...), else the status word of the result.
std::string OutcomeWord(bool answered, ALIAS_RET ret, const Request& req) {
    if (answered) {
        std::string text = req.GetResponse();
        AliasRequest::Trim(text);
        return text.substr(0, text.find(':'));
    }
    std::string word;
    if (!AliasRequest::ResponseToString(ret, word)) word = "error_unknown";
    return word;
}

}  // namespace

AliasCycle::AliasCycle(RelaydConf& conf, EventLoop& loop, const Clock& clock, OutcomeHandler onOutcome,
                       RandomSource random)
    : _conf(conf),
      _loop(loop),
      _policy(clock, std::move(random)),
      _onOutcome(std::move(onOutcome)),
      _registered(false) {}

void AliasCycle::Follow(const AliasStep& step, const char* why) {
    _loop.CancelTimer(TAG);
    _next.clear();
    if (!step.run) {
        RLOG(LOG_WARNING, "alias refused (%s): waiting for a reload", _word.c_str());
        return;
    }
    if (step.cleanDns) Request::CleanDnsCache();
    const ALIAS_REQUEST_CMD cmd = step.cmd;
    _next = CommandWord(cmd);
    RLOG(LOG_DEBUG, "alias %s in %lld ms (%s)", _next.c_str(), static_cast<long long>(step.delayMs), why);
    _loop.SetTimer(TAG, step.delayMs, [this, cmd] { Run(cmd); });
}

void AliasCycle::OnRegistered() {
    if (!_policy.Halted()) Follow(_policy.OnRegistered(), "registered");
}

void AliasCycle::OnRequested() {
    RLOG(LOG_INFO, "alias update requested");
    Follow(_policy.OnRequested(), "requested");
}

void AliasCycle::Stop() {
    _loop.CancelTimer(TAG);
    _loop.CancelRequests(TAG);
    _next.clear();
}

void AliasCycle::Reset() {
    Stop();
    _policy.Reset();
}

void AliasCycle::Run(ALIAS_REQUEST_CMD cmd) {
    _next.clear();
    if (!_registered) {
        RLOG(LOG_INFO, "alias %s skipped: not registered", CommandWord(cmd));
        return;
    }
    if (!_conf.alias.IsAliasEnabled()) {
        RLOG(LOG_DEBUG, "no alias configured");
        return;
    }
    _loop.CancelRequests(TAG);
    Json::Value data;
    _conf.DumpDataForAliasReq(data);
    AliasRequest builder;
    std::string body, url;
    if (!builder.SetRequest(cmd, data) || !builder.GetRequest(body, url)) {
        _policy.OnIncompleteData();
        Record("error_bad_param", "incomplete alias data");
        Deliver(cmd, ALIAS_RET_BAD_PARAM);
        return;
    }
    boost::shared_ptr<Request> req(new Request(url.c_str(), body.c_str(), true));
    RLOG(LOG_INFO, "alias %s [%s]", CommandWord(cmd), _conf.alias.GetAliasName().c_str());
    if (!_loop.StartRequest(TAG, req, [this, cmd](boost::shared_ptr<Request> r) { OnDone(cmd, r); })) {
        Record("error_unknown", "request not started");
        Follow(_policy.OnNotStarted(cmd, _conf.alias.GetPollSeconds()), "not started");
        Deliver(cmd, ALIAS_RET_UNKNOWN);
    }
}

void AliasCycle::OnDone(ALIAS_REQUEST_CMD cmd, boost::shared_ptr<Request> req) {
    ALIAS_RET ret = ALIAS_RET_UNKNOWN;
    std::string detail;
    const bool answered = AliasRequest::GetResponseForDaemon(req, ret, detail);
    Record(OutcomeWord(answered, ret, *req), detail);
    const int polling = ret == ALIAS_RET_SUCCESS ? _conf.alias.GetPollingTime() : 0;
    Follow(_policy.OnOutcome(cmd, ret, _conf.alias.GetPollSeconds(), polling),
           ret == ALIAS_RET_SUCCESS ? "success" : "failure");
    Deliver(cmd, ret);
}

bool AliasCycle::Pending() const { return _loop.TimerRemaining(TAG) >= 0 || _loop.HasRequest(TAG); }

void AliasCycle::DeleteOnDisable() {
    if (!_policy.Mapped() || !_conf.alias.IsAliasEnabled()) return;
    Json::Value data;
    _conf.DumpDataForAliasReq(data);
    AliasRequest builder;
    std::string body, url;
    if (!builder.SetRequest(ALIAS_REQ_DELETE, data) || !builder.GetRequest(body, url)) return;
    boost::shared_ptr<Request> req(new Request(url.c_str(), body.c_str(), true));
    RLOG(LOG_INFO, "relay switched off: deleting alias [%s]", _conf.alias.GetAliasName().c_str());
    _loop.StartRequest(DELETE_TAG, req, [this](boost::shared_ptr<Request> r) {
        ALIAS_RET ret = ALIAS_RET_UNKNOWN;
        std::string detail;
        AliasRequest::GetResponseForDaemon(r, ret, detail);
        Record(ret == ALIAS_RET_SUCCESS ? "deleted" : "error_delete", detail);
        Deliver(ALIAS_REQ_DELETE, ret);
    });
}

void AliasCycle::Record(const std::string& word, const std::string& extra) {
    _word = word;
    _extra = extra;
    AliasStatus status;
    status.SetStatus(_conf.alias.GetAliasName(), word, extra, true);
}

// Once the next step is planned, so that the outcome tells it.
void AliasCycle::Deliver(ALIAS_REQUEST_CMD cmd, ALIAS_RET ret) {
    if (!_onOutcome) return;
    AliasOutcome outcome;
    outcome.cmd = cmd;
    outcome.ret = ret;
    outcome.word = _word;
    outcome.extra = _extra;
    outcome.halted = _policy.Halted();
    outcome.nextMs = _loop.TimerRemaining(TAG);
    _onOutcome(outcome);
}

void AliasCycle::Dump(Json::Value& out) const {
    out["name"] = _conf.alias.GetAliasName();
    out["status"] = _word;
    out["extra"] = _extra;
    out["next"] = _next;
    _policy.Dump(out);
    out["next_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(TAG));
}

}  // namespace zeparelayd
