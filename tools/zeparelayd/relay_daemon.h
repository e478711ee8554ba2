// The relay daemon proper: it holds the configuration, wires the cycles that
// talk to the relay's servers, decides the state from the outcomes they
// report and publishes it (status file, debug dump). All of it runs in one
// EventLoop, which also holds every timer.
//
// The cycles:
//   - RegistrationCycle: the control server learns our identity and services;
//   - AliasCycle: the public alias stays registered once we are;
//   - TunnelCycle: how the appliance is reached after each registration
//     (directly, or through a VPN tunnel to the relay).
// No cycle sets the state or calls another: each hands its outcomes to the
// daemon (OnRegistration, OnAlias, OnTunnel), which sets the state and tells
// the other cycles what follows.
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
#include "tunnel_cycle.h"

namespace zeparelayd {

// "log_level" and "log_file" of a configuration through Daemon::SetLogFile;
// the file is an appliance path, taken below the system root.
void ApplyLogSettings(const ZEPA::Relay::RelaydConf& conf);

// What a reload compares to decide what must start afresh: the registration's
// inputs (relay switch, servers, identity, services) and the alias settings.
Json::Value RegistrationInputs(ZEPA::Relay::RelaydConf& conf);
Json::Value AliasInputs(ZEPA::Relay::RelaydConf& conf);

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
    // random: the jitter of every cycle's retries.
    RelayDaemon(const std::string& confPath, EventLoop& loop, const Clock& clock,
                RandomSource random = SystemRandom());

    // Log settings of the configuration; called at start and on every reload.
    void ApplyLogSettings();
    // Status file with state "starting", the debug dump handler, then the
    // first registration.
    bool Start();
    // What each signal asks of the daemon (relayd_protocol.h); stop signals
    // end the loop.
    void HandleSignal(int sig);
    // After every round of events: the status file (written when it changed)
    // and what SIGUSR1 will write.
    void Idle();
    // Final status ("stoped"); the caller removes the PID file.
    void Shutdown();

private:
    void Reload();
    void RemoveGivenUpDump();
    void ReapChildren();
    // States 4, 5 and 6: registered, however the appliance is reached.
    bool IsRegistered() const;
    void OnRegistration(const RegistrationOutcome& outcome);
    void OnAlias(const AliasOutcome& outcome);
    void OnTunnel(const TunnelOutcome& outcome);

    // ---- published files (status_writer.cpp) ---------------------------------
    void SetState(ZEPA::Relay::RELAYD_STATE state, ZEPA::Relay::RELAYD_RET error);
    void WriteStatus();
    void AddTimes(Json::Value& status) const;
    void RenderDebugDump();
    Json::Value DebugDump() const;

    EventLoop& _loop;
    const Clock& _clock;
    std::unique_ptr<ZEPA::Relay::RelaydConf> _conf;
    ZEPA::Relay::RELAYD_STATE _state;
    ZEPA::Relay::RELAYD_RET _error;
    // The alias word of the last exchange, as the status shows it.
    std::string _aliasWord;
    Json::Value _lastStatus;
    // Why the last reload was refused ("FILE:LINE:COLUMN: ..."); empty after a
    // good one. Shown in the status file as "config_error".
    std::string _configError;
    RegistrationCycle _registration;
    AliasCycle _alias;
    TunnelCycle _tunnel;
};

}  // namespace zeparelayd

#endif
