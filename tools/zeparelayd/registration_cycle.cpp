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

RegistrationCycle::RegistrationCycle(RelaydConf& conf, EventLoop& loop, const Clock& clock, Hooks hooks,
                                     RandomSource random)
    : _conf(conf),
      _loop(loop),
      _policy(clock, std::move(random)),
      _hooks(std::move(hooks)),
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

void RegistrationCycle::SetState(RELAYD_STATE state, RELAYD_RET error) {
    _error = error;
    if (_hooks.setState) _hooks.setState(state, error);
}

void RegistrationCycle::Stop() {
    _loop.CancelTimer(TAG);
    _loop.CancelRequests(TAG);
    _policy.OnAttempt();
}

void RegistrationCycle::Restart() {
    Stop();
    _policy.Reset();
    Start();
}

void RegistrationCycle::Start(bool keepState) {
    Stop();
    if (!_conf.enable) {
        RLOG(LOG_NOTICE, "relay is disabled, idle until reload");
        if (_hooks.disabled) _hooks.disabled();
        SetState(RELAYD_STATE_LOGOUT, RELAYD_SUCCESS);
        return;
    }
    const std::string url = _conf.serverControl.GetUrl(nullptr);
    boost::shared_ptr<Request> req(new Request(url, Body(), true));
    if (!keepState) SetState(RELAYD_STATE_LOGIN, _error);
    if (url.empty() || !_loop.StartRequest(TAG, req, [this](boost::shared_ptr<Request> r) { OnDone(r); })) {
        RLOG(LOG_ERR, "cannot send registration to [%s]", url.c_str());
        _policy.OnFailure(RELAYD_ERR_CONFIG);
        SetState(RELAYD_STATE_LOGIN, RELAYD_ERR_CONFIG);
    }
}

void RegistrationCycle::RetryIn(int64_t delayMs) {
    RLOG(LOG_INFO, "registration retry in %lld ms (failures %d, moves %d)", static_cast<long long>(delayMs),
         _policy.Failures(), _policy.Moves());
    _loop.SetTimer(TAG, delayMs, [this] { Start(); });
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
        _error = err;
        const int64_t delay = _policy.OnServerMoved();
        if (delay == 0) {
            Start();
        } else {
            SetState(RELAYD_STATE_LOGIN, err);
            RetryIn(delay);
        }
        return;
    }
    if (err != RELAYD_SUCCESS) {
        const int64_t delay = _policy.OnFailure(err);
        SetState(RELAYD_STATE_LOGIN, err);
        if (delay == RegistrationPolicy::WAIT_FOR_RELOAD) {
            RLOG(LOG_WARNING, "registration failed (%s): waiting for a reload", GetErrorStr(err).c_str());
            return;
        }
        // A stale resolver answer is the likely cause of a resolve failure.
        if (err == RELAYD_ERR_RESOLV) Request::CleanDnsCache();
        RetryIn(delay);
        return;
    }
    _policy.OnSuccess();
    std::string id;
    if (AnswerString(answer, "serverID", id)) StoreServerId(id);
    RLOG(LOG_NOTICE, "registered, server id [%s]", _conf.serverID.c_str());
    _error = RELAYD_SUCCESS;
    if (_hooks.registered) {
        _hooks.registered(answer);
    } else {
        SetState(RELAYD_STATE_CONNECTED, RELAYD_SUCCESS);
    }
}

void RegistrationCycle::StoreServerId(const std::string& id) {
    if (id.empty() || id == _conf.serverID) return;
    RLOG(LOG_NOTICE, "server id changed [%s] -> [%s]", _conf.serverID.c_str(), id.c_str());
    _conf.serverID = id;
    // The flag makes the write below send the administrators' notice once.
    _conf.serverIdChanged = true;
    _conf.WriteServerId("");
}

void RegistrationCycle::Dump(Json::Value& out) const { _policy.Dump(out); }

}  // namespace zeparelayd
