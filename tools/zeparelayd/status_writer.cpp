// The files the daemon publishes for other processes: the status file,
// rewritten on every change, and the debug dump, rendered after every event
// and written by the SIGUSR1 handler (debug_dump.h).
#define ZEPA_LOG_SOURCE "status_writer"

#include <unistd.h>

#include <cstdio>
#include <ctime>
#include <sstream>

#include <json/reader.h>
#include <json/writer.h>

#include <zeparelayd/daemon.h>
#include <zeparelayd/errors.h>

#include "common/log.h"
#include "common/paths.h"
#include "debug_dump.h"
#include "relay_daemon.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

namespace {

// Request bodies carry the device's credentials; the dump shows them masked.
std::string MaskBody(const std::string& body) {
    Json::Value json;
    if (!body.empty() && body[0] == '{') {
        Json::CharReaderBuilder builder;
        std::istringstream in(body);
        std::string errors;
        if (!Json::parseFromStream(builder, in, &json, &errors) || !json.isObject()) return "(unreadable)";
        Json::Value& id = json["identity"];
        for (const std::string& k : id.getMemberNames()) {
            if (IsSecretKey(k)) id[k] = "***";
        }
        if (id.empty()) json.removeMember("identity");
        Json::StreamWriterBuilder writer;
        writer["indentation"] = "";
        return Json::writeString(writer, json);
    }
    std::stringstream in(body);
    std::string piece, out;
    while (std::getline(in, piece, '&')) {
        const size_t eq = piece.find('=');
        if (eq != std::string::npos && IsSecretKey(piece.substr(0, eq)))
            piece = piece.substr(0, eq + 1) + "***";
        out += (out.empty() ? "" : "&") + piece;
    }
    return out;
}

}  // namespace

void RelayDaemon::SetState(RELAYD_STATE state, RELAYD_RET error) {
    if (state != _state) {
        ZLOG(ZEPA_LOG_INFO, "state %s -> %s (%s)", GetStateStr(_state).c_str(), GetStateStr(state).c_str(),
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
    Json::Value& services = status["service"];
    services = Json::Value(Json::arrayValue);
    for (const ServiceConf& s : _conf->services) {
        Json::Value one;
        s.Write(one, true);
        services.append(one);
    }
    status["alias"] = _conf->alias.GetAliasName();
    status["alias_status"] = _aliasWord;
    const Json::Value connection = _tunnel.Status();
    status["connect"] = connection["connect"];
    if (connection.isMember("tunnel")) status["tunnel"] = connection["tunnel"];
    if (status == _lastStatus) return;
    if (RelaydConf::WriteJsonFile(Paths::Resolve(Paths::STATUS_FILE), status)) _lastStatus = status;
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

    Json::Value& reg = dump["registration"];
    reg["failures"] = _regFailures;
    reg["halted"] = _regHalted;
    reg["retry_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining("register"));

    Json::Value& alias = dump["alias"];
    alias["name"] = _conf->alias.GetAliasName();
    alias["status"] = _aliasWord;
    alias["extra"] = _aliasExtra;
    alias["retry_class"] = _aliasRetryClass;
    alias["failures"] = _aliasFailures;
    alias["halted"] = _aliasHalted;
    alias["mapped"] = _aliasMapped;
    alias["next"] = _aliasNextCmd;
    alias["next_in_ms"] = static_cast<Json::Int64>(_loop.TimerRemaining("alias"));

    _tunnel.Dump(dump["connection"]);

    Json::Value& requests = dump["requests"];
    requests = Json::Value(Json::arrayValue);
    const int64_t now = NowMs();
    for (const EventLoop::Job& job : _loop.Jobs()) {
        Json::Value one;
        job.request->Write(one);
        one["data"] = MaskBody(one["data"].asString());
        one["tag"] = job.tag;
        one["running_ms"] = static_cast<Json::Int64>(now - job.startedMs);
        requests.append(one);
    }
    return dump;
}

void RelayDaemon::RenderDebugDump() {
    Json::StreamWriterBuilder writer;
    writer["indentation"] = "   ";
    PublishDebugDump(Json::writeString(writer, DebugDump()) + "\n");
}

}  // namespace zeparelayd
