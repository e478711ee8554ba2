#define RLOG_SOURCE "registration"

#include "registration_cycle.h"

#include <cstdlib>

#include "log.h"
#include "server_answer.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

const char TAG[] = "register";

}  // namespace

RegistrationCycle::RegistrationCycle(RelaydConf& conf, EventLoop& loop, const Clock& clock,
                                     OutcomeHandler onOutcome, RandomSource random)
    : _conf(conf),
      _loop(loop),
      _policy(clock, std::move(random)),
      _onOutcome(std::move(onOutcome)),
      _error(RELAYD_SUCCESS) {}

Json::Value RegistrationCycle::Body() {
    AuthConf& auth = _conf.auth;
    if (auth.serial.empty() || auth.token.empty()) auth.ReadConf();
    Json::Value body(Json::objectValue);
    body["command"] = "register";
    body["serverID"] = _conf.serverID;
    auth.Write(body["identity"], true);
    _conf.WriteServices(body["services"], true);
    return body;
}

void RegistrationCycle::Deliver(RegistrationOutcome outcome) {
    if (_onOutcome) _onOutcome(outcome);
}

void RegistrationCycle::Stop() {
    _loop.CancelTimer(TAG);
    _loop.CancelRequests(TAG);
}

void RegistrationCycle::Restart() {
    Stop();
    _policy.Reset();
    Start();
}

void RegistrationCycle::Start(bool heartbeat) {
    Stop();
    if (!_conf.enable) {
        RLOG(LOG_NOTICE, "relay is disabled, idle until reload");
        _error = RELAYD_SUCCESS;
        RegistrationOutcome off;
        off.kind = RegistrationOutcome::OFF;
        Deliver(off);
        return;
    }
    _policy.OnAttempt();
    const std::string url = _conf.serverControl.GetUrl(nullptr);
    boost::shared_ptr<Request> req(new Request(url, Body(), true));
    // Out before the request starts: a refused connection finishes at once.
    RegistrationOutcome sending;
    sending.kind = RegistrationOutcome::SENDING;
    sending.error = _error;
    sending.heartbeat = heartbeat;
    Deliver(sending);
    if (url.empty() || !_loop.StartRequest(TAG, req, [this](boost::shared_ptr<Request> r) { OnDone(r); })) {
        RLOG(LOG_ERR, "cannot send registration to [%s]", url.c_str());
        Failed(RELAYD_ERR_CONFIG, _policy.OnFailure(RELAYD_ERR_CONFIG));
    }
}

void RegistrationCycle::Failed(RELAYD_RET error, int64_t retryMs) {
    _error = error;
    if (retryMs != RegistrationPolicy::WAIT_FOR_RELOAD) {
        RLOG(LOG_INFO, "registration retry in %lld ms (failures %d, moves %d)",
             static_cast<long long>(retryMs), _policy.Failures(), _policy.Moves());
        _loop.SetTimer(TAG, retryMs, [this] { Start(); });
    }
    RegistrationOutcome failed;
    failed.kind = RegistrationOutcome::FAILED;
    failed.error = error;
    failed.retryMs = retryMs;
    Deliver(failed);
}

void RegistrationCycle::OnDone(boost::shared_ptr<Request> req) {
    RELAYD_RET err = req->GetError();
    Json::Value answer;
    if (err == RELAYD_SUCCESS) {
        req->GetResponse(answer);
        RELAYSERVER_ERR serr = ParseServerError(answer);
        err = RespErrMap(serr);
        if (serr != RELAYSERVER_ERR_SUCCESS) {
            RLOG(LOG_WARNING, "registration refused: %s", GetServerErrorStr(serr).c_str());
        }
    }
    std::string host;
    if (err == RELAYD_ERR_SERVER_CHANGED && AnswerString(answer, "control_host", host)) {
        RLOG(LOG_NOTICE, "control server moved to [%s]", host.c_str());
        _conf.WriteControlServerHost("", host);
        const int64_t delay = _policy.OnServerMoved();
        if (delay != 0) {
            Failed(err, delay);
            return;
        }
        // The first move is followed at once.
        _error = err;
        RegistrationOutcome moved;
        moved.kind = RegistrationOutcome::FAILED;
        moved.error = err;
        moved.retryMs = 0;
        Deliver(moved);
        Start();
        return;
    }
    if (err != RELAYD_SUCCESS) {
        const int64_t delay = _policy.OnFailure(err);
        if (delay == RegistrationPolicy::WAIT_FOR_RELOAD) {
            RLOG(LOG_WARNING, "registration failed (%s): waiting for a reload", GetErrorStr(err).c_str());
        } else if (err == RELAYD_ERR_RESOLV) {
            // A stale resolver answer is the likely cause of a resolve failure.
            Request::CleanDnsCache();
        }
        Failed(err, delay);
        return;
    }
    _policy.OnSuccess();
    std::string id;
    if (AnswerString(answer, "serverID", id)) StoreServerId(id);
    RLOG(LOG_NOTICE, "registered, server id [%s]", _conf.serverID.c_str());
    _error = RELAYD_SUCCESS;
    RegistrationOutcome registered;
    registered.kind = RegistrationOutcome::REGISTERED;
    registered.answer = answer;
    Deliver(registered);
}

void RegistrationCycle::StoreServerId(const std::string& id) {
    if (id.empty() || id == _conf.serverID) return;
    RLOG(LOG_NOTICE, "server id changed [%s] -> [%s]", _conf.serverID.c_str(), id.c_str());
    _conf.serverID = id;
    // The flag makes the write below send the administrators' notice once.
    _conf.serverIdChanged = true;
    _conf.WriteServerId("");
}

void RegistrationCycle::Dump(Json::Value& out) const {
    _policy.Dump(out);
    out["retry_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining(TAG));
}

}  // namespace zeparelayd
