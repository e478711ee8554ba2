// The relay daemon proper: it holds the configuration, wires the cycles that
// talk to the relay's servers, owns the state they report and publishes it
// (status file, debug dump). All of it runs in one EventLoop.
//
// The cycles:
//   - RegistrationCycle: the control server learns our identity and services;
//   - AliasCycle: the public alias stays registered once we are;
//   - a tunnel cycle joins here the same way: wired in the constructor, told
//     about registration and reload, and given its part of the debug dump.
#ifndef ZEPARELAYD_TOOL_RELAY_DAEMON_H
#define ZEPARELAYD_TOOL_RELAY_DAEMON_H

#include <json/value.h>

#include <memory>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/errors.h>

#include "alias_cycle.h"
#include "clock.h"
#include "event_loop.h"
#include "registration_cycle.h"

namespace zeparelayd {

// The signal that makes the daemon reopen its log file (after rotation) and
// nothing else: SIGRTMIN+2 (SIGUSR2 belongs to the tunnel).
int ReopenLogSignal();

// "log_level" and "log_file" of a configuration through Daemon::SetLogFile;
// the file is an appliance path, taken below the system root.
void ApplyLogSettings(const ZEPA::Relay::RelaydConf& conf);

// State words as the status readers show them:
//   2 "starting"   configuration loaded, nothing sent yet
//   3 "login"      registering with the control server, or waiting to retry
//                  ("error" tells why the last attempt failed)
//   5 "connected"  registered: the control server knows the services and
//                  gave the server id
//   7 "logout"     the relay is switched off ("runrelayd" is not "yes"); the
//                  daemon idles until the next reload
//   8 "stoped"     the daemon has stopped (written last, on the way out)
// 4 "direct_connect" and 6 (the tunnel's "connected") are not used yet: this
// daemon does not open a tunnel.
class RelayDaemon {
public:
    RelayDaemon(const std::string& confPath, EventLoop& loop, const Clock& clock);

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
    void Reload();
    void ReapChildren();

    // ---- published files (status_writer.cpp) ---------------------------------
    void SetState(ZEPA::Relay::RELAYD_STATE state, ZEPA::Relay::RELAYD_RET error);
    void WriteStatus();
    void RenderDebugDump();
    Json::Value DebugDump() const;

    EventLoop& _loop;
    const Clock& _clock;
    std::unique_ptr<ZEPA::Relay::RelaydConf> _conf;
    ZEPA::Relay::RELAYD_STATE _state;
    ZEPA::Relay::RELAYD_RET _error;
    Json::Value _lastStatus;
    // Why the last reload was refused ("FILE:LINE:COLUMN: ..."); empty after a
    // good one. Shown in the status file as "config_error".
    std::string _configError;
    RegistrationCycle _registration;
    AliasCycle _alias;
};

}  // namespace zeparelayd

#endif
