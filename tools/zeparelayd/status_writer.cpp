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
#include "systemd_notify.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

void RelayDaemon::SetState(RELAYD_STATE state, RELAYD_RET error) {
    if (state != _state) {
        RLOG(LOG_INFO, "state %s -> %s (%s)", GetStateStr(_state).c_str(), GetStateStr(state).c_str(),
             GetErrorStr(error).c_str());
    }
    _state = state;
    _error = error;
    WriteStatus();
}

void RelayDaemon::WriteStatus() {
    Json::Value status(Json::objectValue);
    status["pid"] = static_cast<int>(getpid());
    status["state"] = static_cast<int>(_state);
    status["error"] = static_cast<int>(_error);
    status["serverID"] = _conf->serverID;
    _conf->WriteServices(status["service"], true);
    status["alias"] = _conf->alias.GetAliasName();
    status["alias_status"] = _alias.Word();
    if (!_configError.empty()) status["config_error"] = _configError;
    const Json::Value connection = _tunnel.Status();
    status["connect"] = connection["connect"];
    if (connection.isMember("tunnel")) status["tunnel"] = connection["tunnel"];
    if (status == _lastStatus) return;
    if (RelaydConf::WriteJsonFile(Daemon::GetStatusPath(), status)) _lastStatus = status;
    NotifyStatus(ServiceStatusLine(GetStateStr(_state), GetErrorStr(_error), _alias.Word()));
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

void RelayDaemon::RenderDebugDump() {
    Json::StreamWriterBuilder writer;
    writer["indentation"] = "   ";
    PublishDebugDump(Json::writeString(writer, DebugDump()) + "\n");
}

}  // namespace zeparelayd
