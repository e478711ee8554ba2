// Keeping the alias registered. Schedule:
//   - after each (re)registration the alias is mapped at once; after a
//     success the next keep-alive goes out after AliasConf::GetPollingTime()
//     (poll seconds plus a random share of them);
//   - retry class "normal" (server busy, network, unknown answers...): back
//     off 60 s doubling per failure, at most the poll period, plus up to half
//     of it again as jitter, so that many appliances do not retry in step;
//     "alias not found" maps again instead of keeping alive;
//   - retry class "resolve": forget the DNS cache and retry after 20-30 s;
//   - retry class "stop" (bad auth, bad IP, alias in use): no automatic retry
//     until the configuration is reloaded; an explicit update request still
//     runs, since someone asked for it.
// The outcome is recorded in the alias status file after every exchange.
#define ZEPA_LOG_SOURCE "alias_cycle"

#include <zeparelayd/config_alias.h>

#include <algorithm>
#include <cstdlib>

#include "common/log.h"
#include "relay_daemon.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

const char* CommandWord(ALIAS_REQUEST_CMD cmd) {
    return cmd == ALIAS_REQ_MAP ? "map" : cmd == ALIAS_REQ_KEEP_ALIVE ? "keep_alive" : "other";
}

int64_t NormalBackoffMs(int failures, int pollSeconds) {
    int64_t cap = static_cast<int64_t>(std::max(pollSeconds, 60)) * 1000;
    int64_t delay = 60000;
    for (int i = 1; i < failures && delay < cap; ++i) delay *= 2;
    delay = std::min(delay, cap);
    return delay + random() % (delay / 2 + 1);
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

void RelayDaemon::ScheduleAlias(ALIAS_REQUEST_CMD cmd, int64_t delayMs, const char* why) {
    _aliasNextCmd = CommandWord(cmd);
    ZLOG(ZEPA_LOG_DEBUG, "alias %s in %lld ms (%s)", _aliasNextCmd.c_str(), static_cast<long long>(delayMs),
         why);
    _loop.SetTimer("alias", delayMs, [this, cmd] { RunAlias(cmd); });
}

void RelayDaemon::StopAliasCycle() {
    _loop.CancelTimer("alias");
    _loop.CancelRequests("alias");
    _aliasNextCmd.clear();
}

void RelayDaemon::RunAlias(ALIAS_REQUEST_CMD cmd) {
    _aliasNextCmd.clear();
    if (!IsRegistered()) {
        ZLOG(ZEPA_LOG_INFO, "alias %s skipped: not registered", CommandWord(cmd));
        return;
    }
    if (!_conf->alias.IsAliasEnabled()) {
        ZLOG(ZEPA_LOG_DEBUG, "no alias configured");
        return;
    }
    _loop.CancelRequests("alias");
    Json::Value data;
    _conf->DumpDataForAliasReq(data);
    AliasRequest builder;
    std::string body, url;
    if (!builder.SetRequest(cmd, data) || !builder.GetRequest(body, url)) {
        // Missing identity or alias data: nothing a retry would change.
        _aliasHalted = true;
        RecordAliasStatus("error_bad_param", "incomplete alias data");
        return;
    }
    boost::shared_ptr<Request> req(new Request(url.c_str(), body.c_str(), true));
    ZLOG(ZEPA_LOG_INFO, "alias %s [%s]", CommandWord(cmd), _conf->alias.GetAliasName().c_str());
    if (!_loop.StartRequest("alias", req,
                            [this, cmd](boost::shared_ptr<Request> r) { OnAliasDone(cmd, r); })) {
        RecordAliasStatus("error_unknown", "request not started");
        ++_aliasFailures;
        ScheduleAlias(cmd, NormalBackoffMs(_aliasFailures, _conf->alias.GetPollSeconds()), "not started");
    }
}

void RelayDaemon::OnAliasDone(ALIAS_REQUEST_CMD cmd, boost::shared_ptr<Request> req) {
    ALIAS_RET ret = ALIAS_RET_UNKNOWN;
    std::string detail;
    const bool answered = AliasRequest::GetResponseForDaemon(req, ret, detail);
    RecordAliasStatus(OutcomeWord(answered, ret, *req), detail);
    ALIAS_RETRY_TYPE type = ALIAS_RETRY_NORMAL;
    AliasRequest::GetRetryType(ret, type);
    _aliasRetryClass = type;
    const int poll = _conf->alias.GetPollSeconds();

    if (ret == ALIAS_RET_SUCCESS) {
        _aliasFailures = 0;
        _aliasMapped = true;
        ScheduleAlias(ALIAS_REQ_KEEP_ALIVE, static_cast<int64_t>(_conf->alias.GetPollingTime()) * 1000,
                      "success");
        return;
    }
    ++_aliasFailures;
    switch (type) {
        case ALIAS_RETRY_STOP:
            _aliasHalted = true;
            _loop.CancelTimer("alias");
            ZLOG(ZEPA_LOG_WARNING, "alias %s refused (%s): waiting for a reload", CommandWord(cmd),
                 _aliasWord.c_str());
            break;
        case ALIAS_RETRY_RESOLVE:
            Request::CleanDnsCache();
            ScheduleAlias(cmd, 20000 + random() % 10000, "resolve failure");
            break;
        default:
            if (ret == ALIAS_RET_NOT_FOUND) {
                _aliasMapped = false;
                cmd = ALIAS_REQ_MAP;
            }
            ScheduleAlias(cmd, NormalBackoffMs(_aliasFailures, poll), "failure");
            break;
    }
}

void RelayDaemon::RecordAliasStatus(const std::string& word, const std::string& extra) {
    _aliasWord = word;
    _aliasExtra = extra;
    AliasStatus status;
    status.SetStatus(_conf->alias.GetAliasName(), word, extra, true);
    WriteStatus();
}

}  // namespace zeparelayd

namespace zeparelayd {

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
        RecordAliasStatus(ret == ALIAS_RET_SUCCESS ? "deleted" : "error_delete", detail);
    });
}

}  // namespace zeparelayd
