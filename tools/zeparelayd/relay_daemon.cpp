#define RLOG_SOURCE "zeparelayd"

#include "relay_daemon.h"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>

#include <zeparelayd/daemon.h>

#include "config_check.h"
#include "debug_dump.h"
#include "log.h"
#include "relayd_protocol.h"
#include "systemd_notify.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

RelayDaemon::RelayDaemon(const std::string& confPath, EventLoop& loop, const Clock& clock,
                         RandomSource random)
    : _loop(loop),
      _clock(clock),
      _conf(new RelaydConf(confPath.c_str())),
      _state(RELAYD_STATE_STARTING),
      _error(RELAYD_SUCCESS),
      _registration(
          *_conf, loop, clock, [this](const RegistrationOutcome& o) { OnRegistration(o); }, random),
      _alias(
          *_conf, loop, clock, [this](const AliasOutcome& o) { OnAlias(o); }, random),
      _tunnel(
          loop, clock, [this](const TunnelOutcome& o) { OnTunnel(o); }, random) {}

bool RelayDaemon::IsRegistered() const {
    return _state == RELAYD_STATE_DIRECT_CONNECT || _state == RELAYD_STATE_CONNECTED ||
           _state == RELAYD_STATE_CONNECTED_ALT;
}

void RelayDaemon::OnRegistration(const RegistrationOutcome& outcome) {
    switch (outcome.kind) {
        case RegistrationOutcome::OFF:
            // The relay is switched off: everything else stops too.
            _alias.Stop();
            _tunnel.Stop(false);
            SetState(RELAYD_STATE_LOGOUT, RELAYD_SUCCESS);
            break;
        case RegistrationOutcome::SENDING:
            // A heartbeat keeps the state as it is meanwhile.
            if (!outcome.heartbeat) SetState(RELAYD_STATE_LOGIN, outcome.error);
            break;
        case RegistrationOutcome::FAILED:
            SetState(RELAYD_STATE_LOGIN, outcome.error);
            break;
        case RegistrationOutcome::REGISTERED:
            // The tunnel's outcome gives the state (4, 5 or 6).
            _tunnel.OnRegistered(outcome.answer);
            // A heartbeat leaves a scheduled or running alias exchange alone.
            if (!_alias.Pending()) _alias.OnRegistered();
            break;
    }
}

void RelayDaemon::OnTunnel(const TunnelOutcome& outcome) {
    switch (outcome.kind) {
        case TunnelOutcome::DIRECT:
            SetState(RELAYD_STATE_DIRECT_CONNECT, RELAYD_SUCCESS);
            break;
        case TunnelOutcome::REGISTERED:
            SetState(RELAYD_STATE_CONNECTED, RELAYD_SUCCESS);
            break;
        case TunnelOutcome::UP:
            SetState(RELAYD_STATE_CONNECTED_ALT, RELAYD_SUCCESS);
            break;
        case TunnelOutcome::LINK_LOST:
            // Registered, but nothing gets through until openvpn is back.
            SetState(RELAYD_STATE_CONNECTED, outcome.error);
            break;
        case TunnelOutcome::FAILED:
            SetState(RELAYD_STATE_LOGIN, outcome.error);
            break;
        case TunnelOutcome::REGISTER_AGAIN:
            // A heartbeat while registered keeps the state.
            _registration.Start(IsRegistered());
            break;
    }
}

void RelayDaemon::OnAlias(const AliasOutcome& outcome) { _aliasWord = outcome.word; }

// What the registration depends on: the relay switch, the servers, the
// identity and the services. The log settings and the alias are not part of it.
Json::Value RegistrationInputs(RelaydConf& conf) {
    Json::Value inputs(Json::objectValue);
    conf.Write(inputs["config"], false);
    inputs["config"].removeMember("log_level");
    inputs["config"].removeMember("log_file");
    inputs["config"].removeMember("server_alias");
    inputs["enable"] = conf.enable;
    conf.auth.Write(inputs["identity"], true);
    conf.WriteServices(inputs["services"], true);
    return inputs;
}

Json::Value AliasInputs(RelaydConf& conf) {
    Json::Value inputs(Json::objectValue);
    conf.alias.Write(inputs, true);
    return inputs;
}

void ApplyLogSettings(const RelaydConf& conf) {
    const std::string file = Daemon::ResolvePath(conf.logFile);
    Daemon::SetLogFile(file, conf.logLevel);
    RLOG(LOG_DEBUG, "log level %d, log file [%s]", conf.logLevel, file.c_str());
}

void RelayDaemon::ApplyLogSettings() { zeparelayd::ApplyLogSettings(*_conf); }

bool RelayDaemon::Start() {
    if (!InstallDebugDump(Daemon::GetDebugPath(static_cast<int>(getpid())))) {
        RLOG(LOG_ERR, "cannot handle SIGUSR1");
        return false;
    }
    RenderDebugDump();
    RLOG(LOG_NOTICE, "started, pid %d, relay %s", static_cast<int>(getpid()),
         _conf->enable ? "enabled" : "disabled");
    SetState(RELAYD_STATE_STARTING, RELAYD_SUCCESS);
    _registration.Start();
    NotifyReady(ServiceStatusLine(GetStateStr(_state), GetErrorStr(_error), _aliasWord));
    return true;
}

void RelayDaemon::HandleSignal(int sig) {
    switch (zepatools::MeaningOf(sig)) {
        case zepatools::DaemonSignal::UPDATE_ALIAS:
            _alias.OnRequested();
            break;
        case zepatools::DaemonSignal::REOPEN_LOG:
            // Same file and level as now: SetLogFile reopens it (appending).
            RLOG(LOG_INFO, "reopening the log file");
            Daemon::SetLogFile(Daemon::_strLogFile, Daemon::_logLevel);
            RLOG(LOG_INFO, "log file reopened");
            break;
        case zepatools::DaemonSignal::STOP:
            RLOG(LOG_NOTICE, "signal %d: stopping", sig);
            _loop.Stop();
            break;
        case zepatools::DaemonSignal::RELOAD:
            Reload();
            break;
        case zepatools::DaemonSignal::CHILD_EXITED:
            // The tunnel reaps its own children first: it needs their end.
            _tunnel.OnChildExited();
            ReapChildren();
            break;
        case zepatools::DaemonSignal::TUNNEL_UP:
            _tunnel.OnUpSignal();
            break;
        case zepatools::DaemonSignal::DEBUG_DUMP:
            // Comes this way only before the dump handler took it over
            // (debug_dump.h); that query then sees no answer and may ask again.
        case zepatools::DaemonSignal::OTHER:
            // SIGPIPE, SIGALRM, SIGRTMIN+5: their handlers only have to exist;
            // nothing to do here.
            RLOG(LOG_DEBUG, "signal %d ignored", sig);
            break;
    }
}

// Published once per round of events, when every cycle has done its part:
// the dump first, so that what the status file says is in the dump already.
void RelayDaemon::Idle() {
    RenderDebugDump();
    WriteStatus();
    // A dump nobody collects would stay in /tmp for good.
    if (TakeDumpWritten()) _loop.SetTimer("debug_dump_cleanup", 2000, [this] { RemoveGivenUpDump(); });
}

void RelayDaemon::RemoveGivenUpDump() {
    const std::string path = Daemon::GetDebugPath(static_cast<int>(getpid()));
    if (zeparelayd::RemoveGivenUpDump(path, 1000) == 1) {
        _loop.SetTimer("debug_dump_cleanup", 1000, [this] { RemoveGivenUpDump(); });
    }
}

void RelayDaemon::Reload() {
    RLOG(LOG_NOTICE, "reloading configuration");
    // The library would set a broken file aside as ".bad" and go on with a
    // configuration that has lost the operator's settings: a broken file is
    // refused here, and the last good configuration stays in force.
    const zepatools::ConfigCheck check = zepatools::CheckConfigFile(Daemon::GetConfPath());
    if (!check.ok()) {
        for (const std::string& e : check.errors) RLOG(LOG_ERR, "reload refused: %s", e.c_str());
        _configError = check.first();
        SetState(_state, RELAYD_ERR_CONFIG);
        return;
    }
    const Json::Value registrationBefore = RegistrationInputs(*_conf);
    const Json::Value aliasBefore = AliasInputs(*_conf);
    if (!_conf->Reload()) {
        // The old configuration stays in force; the library said why.
        _configError = Daemon::GetConfPath() + ": not a valid relay configuration";
        SetState(_state, RELAYD_ERR_CONFIG);
        return;
    }
    // A good file ends the error of a refused one.
    const bool wasRefused = !_configError.empty() && _error == RELAYD_ERR_CONFIG;
    _configError.clear();
    ApplyLogSettings();
    const Json::Value registrationAfter = RegistrationInputs(*_conf);
    const Json::Value aliasAfter = AliasInputs(*_conf);
    const bool registrationChanged = registrationAfter != registrationBefore;
    const bool aliasChanged = aliasAfter != aliasBefore;
    if (!_conf->enable) {
        _alias.DeleteOnDisable();
        _alias.Reset();
        _tunnel.Stop(false);
        _registration.Restart();
        return;
    }
    if (registrationChanged || !IsRegistered()) {
        // The answer decides about the tunnel: the same tunnel answer keeps
        // it (TunnelCycle::OnRegistered).
        RLOG(LOG_INFO, "reload: %s: registering again",
             registrationChanged ? "servers, identity or services changed" : "not registered");
        if (aliasChanged || _alias.Halted()) _alias.Reset();
        _registration.Restart();
        return;
    }
    if (wasRefused) SetState(_state, RELAYD_SUCCESS);
    if (aliasChanged || _alias.Halted()) {
        RLOG(LOG_INFO, "reload: alias settings changed: mapping it again");
        _alias.Reset();
        _alias.OnRegistered();
        return;
    }
    RLOG(LOG_INFO, "reload: nothing changed for the relay: registration, alias and tunnel kept");
}

void RelayDaemon::ReapChildren() {
    int status = 0;
    pid_t pid;
    while ((pid = waitpid(-1, &status, WNOHANG)) > 0) {
        RLOG(LOG_DEBUG, "child %d ended (0x%x)", static_cast<int>(pid), status);
    }
}

void RelayDaemon::Shutdown() {
    NotifyStopping();
    _registration.Stop();
    _alias.Stop();
    _tunnel.Stop(true);
    RemoveDebugDump();
    zeparelayd::RemoveGivenUpDump(Daemon::GetDebugPath(static_cast<int>(getpid())), 0);
    SetState(RELAYD_STATE_STOPED, _error);
    RLOG(LOG_NOTICE, "stopped");
}

}  // namespace zeparelayd
