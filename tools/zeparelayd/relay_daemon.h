// The relay daemon proper: configuration, registration with the control
// server, the alias cycle and the files it publishes, all driven by one
// EventLoop.
#ifndef ZEPARELAYD_TOOL_RELAY_DAEMON_H
#define ZEPARELAYD_TOOL_RELAY_DAEMON_H

#include <json/value.h>

#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <memory>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request.h>
#include <zeparelayd/request_alias.h>

#include "event_loop.h"
#include "tunnel_cycle.h"

namespace zeparelayd {

// "log_level" and "log_file" of a configuration through Daemon::SetLogFile;
// the file is an appliance path, taken below the system root.
void ApplyLogSettings(const ZEPA::Relay::RelaydConf& conf);

// State words as the status readers show them:
//   2 "starting"   configuration loaded, nothing sent yet
//   3 "login"      registering with the control server, or waiting to retry
//                  ("error" tells why the last attempt failed)
//   4 "direct_connect"  registered; the control server reaches the appliance
//                  directly, no tunnel
//   5 "connected"  registered: the control server knows the services and
//                  gave the server id (no connection word in its answer, or
//                  a tunnel being opened)
//   6 "connected"  registered and the VPN tunnel to the relay is up
//   7 "logout"     the relay is switched off ("runrelayd" is not "yes"); the
//                  daemon idles until the next reload
//   8 "stoped"     the daemon has stopped (written last, on the way out)
class RelayDaemon {
public:
    RelayDaemon(const std::string& confPath, EventLoop& loop);

    // Log settings of the configuration; called at start and on every reload.
    void ApplyLogSettings();
    // Status file with state "starting", the debug dump handler, then the
    // first registration.
    bool Start();
    // What each signal asks of the daemon; stop signals end the loop.
    void HandleSignal(int sig);
    // After every round of events: refresh what SIGUSR1 will write.
    void Idle() { RenderDebugDump(); }
    // Final status ("stoped"); the caller removes the PID file.
    void Shutdown();

private:
    // ---- registration (registration.cpp) -------------------------------------
    void StartRegistration();
    void OnRegistrationDone(boost::shared_ptr<ZEPA::Relay::Request> req);
    Json::Value RegistrationBody();
    bool StoreServerId(const std::string& id);
    void ScheduleRegistrationRetry();

    // ---- alias cycle (alias_cycle.cpp) ---------------------------------------
    void ScheduleAlias(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, int64_t delayMs, const char* why);
    void RunAlias(ZEPA::Relay::ALIAS_REQUEST_CMD cmd);
    void OnAliasDone(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, boost::shared_ptr<ZEPA::Relay::Request> req);
    void RecordAliasStatus(const std::string& word, const std::string& extra);
    void StopAliasCycle();

    // States 4, 5 and 6: registered, however the appliance is reached.
    bool IsRegistered() const;
    // Switched off: the alias stops pointing at an appliance nobody relays.
    void DeleteAliasOnDisable();

    // ---- published files (status_writer.cpp) ---------------------------------
    void SetState(ZEPA::Relay::RELAYD_STATE state, ZEPA::Relay::RELAYD_RET error);
    void WriteStatus();
    void RenderDebugDump();
    Json::Value DebugDump() const;

    // ---- signals (relay_daemon.cpp) -----------------------------------------
    void Reload();
    void ReapChildren();

    std::string _confPath;
    EventLoop& _loop;
    std::unique_ptr<ZEPA::Relay::RelaydConf> _conf;
    ZEPA::Relay::RELAYD_STATE _state;
    ZEPA::Relay::RELAYD_RET _error;
    Json::Value _lastStatus;

    // Registration bookkeeping.
    int _regFailures;
    bool _regHalted;  // a failure that only a reload can cure

    // Alias bookkeeping.
    int _aliasFailures;
    bool _aliasHalted;  // stop-class answer: automatic retries wait for a reload
    bool _aliasMapped;  // the alias was mapped since the last (re)registration
    std::string _aliasWord;
    std::string _aliasExtra;
    int _aliasRetryClass;
    std::string _aliasNextCmd;

    // Direct connection or tunnel, after each registration.
    TunnelCycle _tunnel;
};

}  // namespace zeparelayd

#endif
