// Registration with the relay's control server: one JSON POST,
//   {"command": "register", "serverID": "<known id or empty>",
//    "identity": {"serial", "mac", "model", "token", "key", "timezone"},
//    "services": [{"id", "name", "port", "ext_port"}, ...]}
// answered by {"errno": <RELAYSERVER_ERR>, "serverID": "<id>"}; with errno 13
// (server changed) the answer may name the new "control_host". Retries follow
// RegistrationPolicy.
#ifndef ZEPARELAYD_TOOL_REGISTRATION_CYCLE_H
#define ZEPARELAYD_TOOL_REGISTRATION_CYCLE_H

#include <json/value.h>

#include <boost/shared_ptr.hpp>
#include <functional>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/errors.h>
#include <zeparelayd/request.h>

#include "event_loop.h"
#include "retry_policy.h"

namespace zeparelayd {

class RegistrationCycle {
public:
    struct Hooks {
        // The daemon's state changed: write it out.
        std::function<void(ZEPA::Relay::RELAYD_STATE, ZEPA::Relay::RELAYD_RET)> setState;
        // Registered: the answer says how the appliance is reached ("connect",
        // "tunnel", "heartbeat"); the hook sets the state (4, 5 or 6) and the
        // alias may follow. Without a hook the state is 5.
        std::function<void(const Json::Value& answer)> registered;
        // The relay is switched off: everything else stops too.
        std::function<void()> disabled;
    };

    RegistrationCycle(ZEPA::Relay::RelaydConf& conf, EventLoop& loop, const Clock& clock, Hooks hooks,
                      RandomSource random = SystemRandom());

    // Registers now (or idles when the relay is switched off). keepState: a
    // heartbeat while registered, the state stays as it is meanwhile.
    void Start(bool keepState = false);
    // Drops the running exchange and the retry timer.
    void Stop();
    // After a reload: counts and halts start afresh, then Start().
    void Restart();
    ZEPA::Relay::RELAYD_RET LastError() const { return _error; }
    // This cycle's part of the debug dump.
    void Dump(Json::Value& out) const;

private:
    Json::Value Body();
    void OnDone(boost::shared_ptr<ZEPA::Relay::Request> req);
    void StoreServerId(const std::string& id);
    void RetryIn(int64_t delayMs);
    void SetState(ZEPA::Relay::RELAYD_STATE state, ZEPA::Relay::RELAYD_RET error);

    ZEPA::Relay::RelaydConf& _conf;
    EventLoop& _loop;
    RegistrationPolicy _policy;
    Hooks _hooks;
    ZEPA::Relay::RELAYD_RET _error;
};

}  // namespace zeparelayd

#endif
