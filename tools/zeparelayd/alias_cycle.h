// Keeping the alias registered with the alias server: map after each
// (re)registration, keep alive after every success, retry by AliasPolicy. The
// outcome of every exchange goes into the alias status file.
#ifndef ZEPARELAYD_TOOL_ALIAS_CYCLE_H
#define ZEPARELAYD_TOOL_ALIAS_CYCLE_H

#include <json/value.h>

#include <boost/shared_ptr.hpp>
#include <functional>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/request.h>
#include <zeparelayd/request_alias.h>

#include "event_loop.h"
#include "retry_policy.h"

namespace zeparelayd {

class AliasCycle {
public:
    struct Hooks {
        // Whether the control server knows us now; the alias waits until it does.
        std::function<bool()> registered;
        // The alias word changed: the status file shows it.
        std::function<void()> changed;
    };

    AliasCycle(ZEPA::Relay::RelaydConf& conf, EventLoop& loop, const Clock& clock, Hooks hooks,
               RandomSource random = SystemRandom());

    void OnRegistered();
    // Someone asked for an update now; runs even after a stop-class answer.
    void OnRequested();
    // Drops the running exchange and the timer.
    void Stop();
    // After a reload: counts and halts start afresh; waits for the next registration.
    void Reset();
    // The relay was switched off: a mapped alias is deleted, so that it stops
    // pointing at an appliance nobody relays. Runs under its own tag, which
    // Stop() leaves alone.
    void DeleteOnDisable();
    // An exchange is running or scheduled (a heartbeat leaves it alone).
    bool Pending() const;
    // A stop-class answer halted the automatic exchanges until a reload.
    bool Halted() const { return _policy.Halted(); }

    // The word of the last outcome, as the status shows it.
    const std::string& Word() const { return _word; }
    // This cycle's part of the debug dump.
    void Dump(Json::Value& out) const;

private:
    void Follow(const AliasStep& step, const char* why);
    void Run(ZEPA::Relay::ALIAS_REQUEST_CMD cmd);
    void OnDone(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, boost::shared_ptr<ZEPA::Relay::Request> req);
    void Record(const std::string& word, const std::string& extra);

    ZEPA::Relay::RelaydConf& _conf;
    EventLoop& _loop;
    AliasPolicy _policy;
    Hooks _hooks;
    std::string _word;
    std::string _extra;
    std::string _next;  // the command the timer will send, empty when none
};

}  // namespace zeparelayd

#endif
