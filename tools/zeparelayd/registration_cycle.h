// Registration with the relay's control server: one JSON POST,
//   {"command": "register", "serverID": "<known id or empty>",
//    "identity": {"serial", "mac", "model", "token", "key", "timezone"},
//    "services": [{"id", "name", "port", "ext_port"}, ...]}
// answered by {"errno": <RELAYSERVER_ERR>, "serverID": "<id>"}; with errno 13
// (server changed) the answer may name the new "control_host". Retries follow
// RegistrationPolicy, each wait one loop timer.
//
// The cycle does not decide the daemon's state: every step ends in a
// RegistrationOutcome handed to the daemon, which makes the state of it.
#ifndef ZEPARELAYD_TOOL_REGISTRATION_CYCLE_H
#define ZEPARELAYD_TOOL_REGISTRATION_CYCLE_H

#include <json/value.h>

#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <functional>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request.h>

#include "event_loop.h"
#include "retry_policy.h"

namespace zeparelayd {

// What a step of the registration gave.
struct RegistrationOutcome {
    enum Kind {
        // The relay is switched off: nothing is sent until a reload.
        OFF,
        // An attempt is on its way; error is the last attempt's.
        SENDING,
        // The attempt failed with error (RELAYD_ERR_SERVER_CHANGED: the
        // control server named a new host); the next attempt is due in
        // retryMs, or never before a reload (RegistrationPolicy::WAIT_FOR_RELOAD).
        FAILED,
        // Registered: answer says how the appliance is reached ("connect",
        // "tunnel", "heartbeat").
        REGISTERED,
    };
    Kind kind = SENDING;
    ZEPA::Relay::RELAYD_RET error = ZEPA::Relay::RELAYD_SUCCESS;
    // SENDING: a heartbeat asked for while registered.
    bool heartbeat = false;
    int64_t retryMs = RegistrationPolicy::WAIT_FOR_RELOAD;
    Json::Value answer;
};

class RegistrationCycle {
public:
    using OutcomeHandler = std::function<void(const RegistrationOutcome&)>;

    RegistrationCycle(ZEPA::Relay::RelaydConf& conf, EventLoop& loop, const Clock& clock,
                      OutcomeHandler onOutcome, RandomSource random = SystemRandom());

    // Registers now (or reports OFF when the relay is switched off).
    // heartbeat: asked for while registered (the outcome says so).
    void Start(bool heartbeat = false);
    // Drops the running exchange and the retry timer.
    void Stop();
    // After a reload: counts and halts start afresh, then Start().
    void Restart();
    // This cycle's part of the debug dump: the policy's counts and
    // "retry_in_ms", the retry timer's time left (-1: none).
    void Dump(Json::Value& out) const;

private:
    Json::Value Body();
    void OnDone(boost::shared_ptr<ZEPA::Relay::Request> req);
    void StoreServerId(const std::string& id);
    void Failed(ZEPA::Relay::RELAYD_RET error, int64_t retryMs);
    void Deliver(RegistrationOutcome outcome);

    ZEPA::Relay::RelaydConf& _conf;
    EventLoop& _loop;
    RegistrationPolicy _policy;
    OutcomeHandler _onOutcome;
    ZEPA::Relay::RELAYD_RET _error;  // of the last finished attempt
};

}  // namespace zeparelayd

#endif
