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
#include "systemd_notify.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

RelayDaemon::RelayDaemon(const std::string& confPath, EventLoop& loop, const Clock& clock)
    : _loop(loop),
      _clock(clock),
      _conf(new RelaydConf(confPath.c_str())),
      _state(RELAYD_STATE_STARTING),
      _error(RELAYD_SUCCESS),
      _registration(*_conf, loop, clock,
                    RegistrationCycle::Hooks{[this](RELAYD_STATE s, RELAYD_RET e) { SetState(s, e); },
                                             [this](const Json::Value& answer) { OnRegistered(answer); },
                                             [this] {
                                                 _alias.Stop();
                                                 _tunnel.Stop(false);
                                             }}),
      _alias(*_conf, loop, clock,
             AliasCycle::Hooks{[this] { return IsRegistered(); }, [this] { WriteStatus(); }}),
      _tunnel(loop, clock,
              TunnelCycle::Hooks{[this](RELAYD_STATE s, RELAYD_RET e) { SetState(s, e); },
                                 [this] { _registration.Start(IsRegistered()); }},
              [] { return random(); }) {}

bool RelayDaemon::IsRegistered() const {
    return _state == RELAYD_STATE_DIRECT_CONNECT || _state == RELAYD_STATE_CONNECTED ||
           _state == RELAYD_STATE_CONNECTED_ALT;
}

void RelayDaemon::OnRegistered(const Json::Value& answer) {
    _tunnel.OnRegistered(answer);
    // A heartbeat leaves a scheduled or running alias exchange alone.
    if (!_alias.Pending()) _alias.OnRegistered();
}

int ReopenLogSignal() { return SIGRTMIN + 2; }

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
    NotifyReady(ServiceStatusLine(GetStateStr(_state), GetErrorStr(_error), _alias.Word()));
    return true;
}

void RelayDaemon::HandleSignal(int sig) {
    if (sig == SIGRTMIN + 1) {
        _alias.OnRequested();
        return;
    }
    if (sig == ReopenLogSignal()) {
        // Same file and level as now: SetLogFile reopens it (appending).
        RLOG(LOG_INFO, "reopening the log file");
        Daemon::SetLogFile(Daemon::_strLogFile, Daemon::_logLevel);
        RLOG(LOG_INFO, "log file reopened");
        return;
    }
    switch (sig) {
        case SIGTERM:
        case SIGINT:
        case SIGQUIT:
            RLOG(LOG_NOTICE, "signal %d: stopping", sig);
            _loop.Stop();
            break;
        case SIGHUP:
            Reload();
            break;
        case SIGCHLD:
            // The tunnel reaps its own children first: it needs their end.
            _tunnel.OnChildExited();
            ReapChildren();
            break;
        case SIGUSR2:
            _tunnel.OnUpSignal();
            break;
        default:
            // SIGUSR1 comes this way only before the dump handler took it over
            // (debug_dump.h); that query then sees no answer and may ask again.
            // SIGPIPE, SIGALRM, SIGRTMIN+5: their handlers only have to exist;
            // nothing to do here.
            RLOG(LOG_DEBUG, "signal %d ignored", sig);
            break;
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
    if (!_conf->Reload()) {
        // The old configuration stays in force; the library said why.
        _configError = Daemon::GetConfPath() + ": not a valid relay configuration";
        SetState(_state, RELAYD_ERR_CONFIG);
        return;
    }
    _configError.clear();
    ApplyLogSettings();
    if (!_conf->enable) _alias.DeleteOnDisable();
    _alias.Reset();
    // A new configuration may name other servers: the tunnel starts afresh.
    // Its child ends in the background; the next start waits for it.
    _tunnel.Stop(false);
    _registration.Restart();
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
    SetState(RELAYD_STATE_STOPED, _error);
    RLOG(LOG_NOTICE, "stopped");
}

}  // namespace zeparelayd
