// The files the daemon publishes for other processes: the status file,
// rewritten on every change, and the debug dump, rendered after every event
// and written by the SIGUSR1 handler (debug_dump.h).
#define RLOG_SOURCE "status_writer"

#include <unistd.h>

#include <cstdio>
#include <ctime>

#include <json/writer.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>

#include "debug_dump.h"
#include "log.h"
#include "relay_daemon.h"
#include "relayd_protocol.h"
#include "systemd_notify.h"

using namespace ZEPA::Relay;
namespace key = zepatools::status_key;

namespace zeparelayd {

void RelayDaemon::SetState(RELAYD_STATE state, RELAYD_RET error) {
    if (state != _state) {
        RLOG(LOG_INFO, "state %s -> %s (%s)", GetStateStr(_state).c_str(), GetStateStr(state).c_str(),
             GetErrorStr(error).c_str());
    }
    _state = state;
    _error = error;
    // An alias exchange that falls due while not registered is skipped.
    _alias.SetRegistered(IsRegistered());
    // Written after the round (Idle), or at once when the loop has ended.
    if (!_loop.Running()) WriteStatus();
}

namespace {

// Seconds since the epoch of a wait that runs out in ms; null when none runs.
Json::Value DueAt(const Json::Value& remainingMs) {
    if (!remainingMs.isIntegral() || remainingMs.asInt64() < 0) return Json::Value();
    return static_cast<Json::Int64>(time(nullptr) + (remainingMs.asInt64() + 999) / 1000);
}

// The time of a result: kept from the last file while the result is the same.
Json::Value Since(const Json::Value& last, const char* key, bool same) {
    if (same && last.isObject() && last[key].isIntegral()) return last[key];
    return static_cast<Json::Int64>(time(nullptr));
}

}  // namespace

// When the registration and the alias results came (unix seconds) and when
// the next attempt of each is due (null: none planned), for "doctor".
void RelayDaemon::AddTimes(Json::Value& status) const {
    const Json::Value& last = _lastStatus;
    const bool sameRegistration = last.isObject() && last[key::kState] == status[key::kState] &&
                                  last[key::kError] == status[key::kError];
    status[key::kRegistrationAt] = Since(last, key::kRegistrationAt, sameRegistration);
    const bool sameAlias = last.isObject() && last[key::kAliasStatus] == status[key::kAliasStatus];
    status[key::kAliasAt] = Since(last, key::kAliasAt, sameAlias);
    Json::Value registration, alias;
    _registration.Dump(registration);
    _alias.Dump(alias);
    status[key::kRegistrationRetryAt] = DueAt(registration["retry_in_ms"]);
    status[key::kAliasRetryAt] = DueAt(alias["next_in_ms"]);
}

void RelayDaemon::WriteStatus() {
    Json::Value status(Json::objectValue);
    status[key::kPid] = static_cast<int>(getpid());
    status[key::kState] = static_cast<int>(_state);
    status[key::kError] = static_cast<int>(_error);
    status[key::kServerId] = _conf->serverID;
    _conf->WriteServices(status[key::kService], true);
    status[key::kAlias] = _conf->alias.GetAliasName();
    status[key::kAliasStatus] = _aliasWord;
    if (!_configError.empty()) status[key::kConfigError] = _configError;
    const Json::Value connection = _tunnel.Status();
    status[key::kConnect] = connection[key::kConnect];
    if (connection.isMember(key::kTunnel)) status[key::kTunnel] = connection[key::kTunnel];
    AddTimes(status);
    if (status == _lastStatus) return;
    if (RelaydConf::WriteJsonFile(Daemon::GetStatusPath(), status)) _lastStatus = status;
    NotifyStatus(ServiceStatusLine(GetStateStr(_state), GetErrorStr(_error), _aliasWord));
}

Json::Value RelayDaemon::DebugDump() const {
    Json::Value dump(Json::objectValue);
    dump["pid"] = static_cast<int>(getpid());
    // Rendered after each event, not at the moment of the query.
    dump["rendered_at"] = static_cast<Json::Int64>(time(nullptr));
    dump["state"] = GetStateStr(_state);
    dump["error"] = GetErrorStr(_error);
    dump["log_level"] = Daemon::_logLevel;
    dump["log_file"] = Daemon::_strLogFile;
    _conf->Write(dump["config"], true);

    _registration.Dump(dump["registration"]);
    _alias.Dump(dump["alias"]);
    _tunnel.Dump(dump["connection"]);

    Json::Value& requests = dump["requests"];
    requests = Json::Value(Json::arrayValue);
    const int64_t now = _clock.NowMs();
    for (const EventLoop::Job& job : _loop.Jobs()) {
        Json::Value one;
        job.request->Write(one);
        one["tag"] = job.tag;
        one["running_ms"] = static_cast<Json::Int64>(now - job.startedMs);
        requests.append(one);
    }
    // Request descriptions come masked already; the rest of the dump (the
    // configuration's full form) goes through the same credential list.
    return MaskSecrets(dump);
}

// The status file follows in Idle, after every round too, so a retry planned
// after the last write shows up there as well.
void RelayDaemon::RenderDebugDump() {
    Json::StreamWriterBuilder writer;
    writer["indentation"] = "   ";
    PublishDebugDump(Json::writeString(writer, DebugDump()) + "\n");
}

}  // namespace zeparelayd
