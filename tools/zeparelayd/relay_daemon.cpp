#define ZEPA_LOG_SOURCE "zeparelayd"

#include "relay_daemon.h"

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>

#include "common/log.h"
#include "common/paths.h"
#include "debug_dump.h"

using namespace ZEPA::Relay;

namespace zeparelayd {

RelayDaemon::RelayDaemon(const std::string& confPath, EventLoop& loop)
    : _confPath(confPath),
      _loop(loop),
      _conf(new RelaydConf(confPath.c_str())),
      _state(RELAYD_STATE_STARTING),
      _error(RELAYD_SUCCESS),
      _regFailures(0),
      _regHalted(false),
      _aliasFailures(0),
      _aliasHalted(false),
      _aliasMapped(false),
      _aliasRetryClass(-1),
      _tunnel(loop,
              TunnelCycle::Hooks{[this](RELAYD_STATE state, RELAYD_RET error) { SetState(state, error); },
                                 [this] { StartRegistration(); }}) {}

bool RelayDaemon::IsRegistered() const {
    return _state == RELAYD_STATE_DIRECT_CONNECT || _state == RELAYD_STATE_CONNECTED ||
           _state == RELAYD_STATE_CONNECTED_ALT;
}

void ApplyLogSettings(const RelaydConf& conf) {
    const std::string file = conf.logFile.empty() ? std::string() : Paths::Resolve(conf.logFile);
    Daemon::SetLogFile(file, conf.logLevel);
    ZLOG(ZEPA_LOG_DEBUG, "log level %d, log file [%s]", conf.logLevel, file.c_str());
}

void RelayDaemon::ApplyLogSettings() { zeparelayd::ApplyLogSettings(*_conf); }

bool RelayDaemon::Start() {
    char name[1024];
    snprintf(name, sizeof(name), Paths::DEBUG_FILE_FORMAT, static_cast<int>(getpid()));
    if (!InstallDebugDump(Paths::Resolve(name))) {
        ZLOG(ZEPA_LOG_ERR, "cannot handle SIGUSR1");
        return false;
    }
    RenderDebugDump();
    ZLOG(ZEPA_LOG_NOTICE, "started, pid %d, relay %s", static_cast<int>(getpid()),
         _conf->enable ? "enabled" : "disabled");
    SetState(RELAYD_STATE_STARTING, RELAYD_SUCCESS);
    StartRegistration();
    return true;
}

void RelayDaemon::HandleSignal(int sig) {
    if (sig == SIGRTMIN + 1) {
        ZLOG(ZEPA_LOG_INFO, "alias update requested");
        ScheduleAlias(ALIAS_REQ_MAP, 0, "requested");
        return;
    }
    switch (sig) {
        case SIGTERM:
        case SIGINT:
        case SIGQUIT:
            ZLOG(ZEPA_LOG_NOTICE, "signal %d: stopping", sig);
            _loop.Stop();
            break;
        case SIGHUP:
            Reload();
            break;
        case SIGCHLD:
            ReapChildren();
            _tunnel.OnChildExited();
            break;
        default:
            // SIGUSR1 never comes this way (debug_dump.h).
            // SIGPIPE, SIGALRM, SIGUSR2, SIGRTMIN+5: their handlers only have to
            // exist (the tunnel's wait relies on them); nothing to do here.
            ZLOG(ZEPA_LOG_DEBUG, "signal %d ignored", sig);
            break;
    }
}

void RelayDaemon::Reload() {
    ZLOG(ZEPA_LOG_NOTICE, "reloading configuration");
    if (!_conf->Reload()) {
        // The old configuration stays in force; the library said why.
        return;
    }
    ApplyLogSettings();
    _loop.CancelRequests("register");
    _loop.CancelTimer("register");
    StopAliasCycle();
    if (!_conf->enable) DeleteAliasOnDisable();
    // A new configuration may name other servers: the tunnel starts afresh.
    _tunnel.Stop(true);
    _regFailures = 0;
    _regHalted = false;
    _aliasFailures = 0;
    _aliasHalted = false;
    _aliasMapped = false;
    StartRegistration();
}

void RelayDaemon::ReapChildren() {
    int status = 0;
    pid_t pid;
    while ((pid = waitpid(-1, &status, WNOHANG)) > 0) {
        ZLOG(ZEPA_LOG_DEBUG, "child %d ended (0x%x)", static_cast<int>(pid), status);
    }
}

void RelayDaemon::Shutdown() {
    _loop.CancelRequests("register");
    StopAliasCycle();
    _tunnel.Stop(true);
    RemoveDebugDump();
    SetState(RELAYD_STATE_STOPED, _error);
    ZLOG(ZEPA_LOG_NOTICE, "stopped");
}

}  // namespace zeparelayd
