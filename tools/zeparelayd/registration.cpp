// Registration with the relay's control server. The exchange is one JSON POST
// to the control server's page:
//   {"command": "register", "serverID": "<known id or empty>",
//    "identity": {"serial", "mac", "model", "token", "key", "timezone"},
//    "services": [{"id", "name", "port", "ext_port"}, ...]}
// answered by {"errno": <RELAYSERVER_ERR>, "serverID": "<id>"}; with errno 13
// (server changed) the answer may name the new "control_host".
#define ZEPA_LOG_SOURCE "registration"

#include <cstdlib>

#include "common/log.h"
#include "relay_daemon.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

// Retry waits: 30 s doubling up to 30 min, plus up to a quarter of jitter.
int64_t RegistrationBackoffMs(int failures) {
    int64_t delay = 30000;
    for (int i = 1; i < failures && delay < 1800000; ++i) delay *= 2;
    if (delay > 1800000) delay = 1800000;
    return delay + random() % (delay / 4 + 1);
}

// Results that a retry cannot cure: the configuration or the account must change first.
bool NeedsReload(RELAYD_RET err) {
    return err == RELAYD_ERR_AUTH || err == RELAYD_ERR_NOT_SUPPORT || err == RELAYD_ERR_API_KEY_EXPIRED ||
           err == RELAYD_ERR_CONFIG;
}

}  // namespace

Json::Value RelayDaemon::RegistrationBody() {
    AuthConf& auth = _conf->auth;
    if (auth.serial.empty() || auth.token.empty()) auth.ReadConf();
    Json::Value body(Json::objectValue);
    body["command"] = "register";
    body["serverID"] = _conf->serverID;
    Json::Value& id = body["identity"];
    id["serial"] = auth.serial;
    id["mac"] = auth.mac;
    id["model"] = auth.model;
    id["token"] = auth.token;
    id["key"] = auth.key;
    id["timezone"] = auth.timezone;
    Json::Value& services = body["services"];
    services = Json::Value(Json::arrayValue);
    for (const ServiceConf& s : _conf->services) {
        Json::Value one;
        s.Write(one, true);
        services.append(one);
    }
    return body;
}

void RelayDaemon::StartRegistration() {
    _loop.CancelTimer("register");
    _loop.CancelRequests("register");
    if (!_conf->enable) {
        ZLOG(ZEPA_LOG_NOTICE, "relay is disabled, idle until reload");
        StopAliasCycle();
        _tunnel.Stop(true);
        SetState(RELAYD_STATE_LOGOUT, RELAYD_SUCCESS);
        return;
    }
    const std::string url = _conf->serverControl.GetUrl(nullptr);
    boost::shared_ptr<Request> req(new Request(url, RegistrationBody(), true));
    // A heartbeat keeps the state it has: the connection stays as it is.
    if (!IsRegistered()) SetState(RELAYD_STATE_LOGIN, _error);
    if (url.empty() || !_loop.StartRequest("register", req,
                                           [this](boost::shared_ptr<Request> r) { OnRegistrationDone(r); })) {
        ZLOG(ZEPA_LOG_ERR, "cannot send registration to [%s]", url.c_str());
        _regHalted = true;
        SetState(RELAYD_STATE_LOGIN, RELAYD_ERR_CONFIG);
    }
}

void RelayDaemon::OnRegistrationDone(boost::shared_ptr<Request> req) {
    RELAYD_RET err = req->GetError();
    Json::Value answer;
    if (err == RELAYD_SUCCESS) {
        req->GetResponse(answer);
        RELAYSERVER_ERR serr = ParseServerError(answer);
        err = RespErrMap(serr);
        if (serr != RELAYSERVER_ERR_SUCCESS) {
            ZLOG(ZEPA_LOG_WARNING, "registration refused: %s", GetServerErrorStr(serr).c_str());
        }
    }
    if (err == RELAYD_ERR_SERVER_CHANGED && answer.isObject() && answer["control_host"].isString()) {
        ZLOG(ZEPA_LOG_NOTICE, "control server moved to [%s]", answer["control_host"].asCString());
        _conf->WriteControlServerHost("", answer["control_host"].asString());
        _error = err;
        StartRegistration();
        return;
    }
    if (err != RELAYD_SUCCESS) {
        _regHalted = NeedsReload(err);
        SetState(RELAYD_STATE_LOGIN, err);
        if (err == RELAYD_ERR_RESOLV) {
            // A stale resolver answer is the likely cause: forget it and try again soon.
            Request::CleanDnsCache();
            _loop.SetTimer("register", 10000, [this] { StartRegistration(); });
        } else if (!_regHalted) {
            ScheduleRegistrationRetry();
        }
        return;
    }
    _regFailures = 0;
    if (answer["serverID"].isString()) StoreServerId(answer["serverID"].asString());
    ZLOG(ZEPA_LOG_NOTICE, "registered, server id [%s]", _conf->serverID.c_str());
    _tunnel.OnRegistered(answer);
    // A heartbeat leaves a scheduled or running alias exchange alone.
    const bool aliasPending = _loop.TimerRemaining("alias") >= 0 || _loop.HasRequest("alias");
    if (!_aliasHalted && !aliasPending) {
        ScheduleAlias(_aliasMapped ? ALIAS_REQ_KEEP_ALIVE : ALIAS_REQ_MAP, 0, "registered");
    }
}

bool RelayDaemon::StoreServerId(const std::string& id) {
    if (id.empty() || id == _conf->serverID) return false;
    ZLOG(ZEPA_LOG_NOTICE, "server id changed [%s] -> [%s]", _conf->serverID.c_str(), id.c_str());
    _conf->serverID = id;
    // The flag makes the write below send the administrators' notice once.
    _conf->serverIdChanged = true;
    return _conf->WriteServerId("");
}

void RelayDaemon::ScheduleRegistrationRetry() {
    ++_regFailures;
    const int64_t delay = RegistrationBackoffMs(_regFailures);
    ZLOG(ZEPA_LOG_INFO, "registration retry %d in %lld ms", _regFailures, static_cast<long long>(delay));
    _loop.SetTimer("register", delay, [this] { StartRegistration(); });
}

}  // namespace zeparelayd
