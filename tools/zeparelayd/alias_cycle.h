// Keeping the alias registered with the alias server: map after each
// (re)registration, keep alive after every success, retry by AliasPolicy,
// each wait one loop timer. The outcome of every exchange goes into the alias
// status file and, as an AliasOutcome, to the daemon, which publishes it.
#ifndef ZEPARELAYD_TOOL_ALIAS_CYCLE_H
#define ZEPARELAYD_TOOL_ALIAS_CYCLE_H

#include <json/value.h>

#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <functional>
#include <string>

#include <zeparelayd/config.h>
#include <zeparelayd/request.h>
#include <zeparelayd/request_alias.h>

#include "event_loop.h"
#include "retry_policy.h"

namespace zeparelayd {

// What an exchange with the alias server gave.
struct AliasOutcome {
    // The command sent (ALIAS_REQ_DELETE: the delete on switch-off).
    ZEPA::Relay::ALIAS_REQUEST_CMD cmd = ZEPA::Relay::ALIAS_REQ_MAP;
    ZEPA::Relay::ALIAS_RET ret = ZEPA::Relay::ALIAS_RET_UNKNOWN;
    // As the status shows it: the server's own word ("good", "badauth"...)
    // or the word of the result; extra: the server's detail.
    std::string word;
    std::string extra;
    // No automatic exchange until a reload (stop-class answer, incomplete data).
    bool halted = false;
    // When the next exchange is due, -1 when none is planned.
    int64_t nextMs = -1;
};

class AliasCycle {
public:
    using OutcomeHandler = std::function<void(const AliasOutcome&)>;

    AliasCycle(ZEPA::Relay::RelaydConf& conf, EventLoop& loop, const Clock& clock, OutcomeHandler onOutcome,
               RandomSource random = SystemRandom());

    // Whether the control server knows us now (the daemon says so on every
    // change); an exchange that falls due while it does not is skipped.
    void SetRegistered(bool registered) { _registered = registered; }
    // After a (re)registration: map, or keep alive what is mapped already.
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

    // This cycle's part of the debug dump: the last outcome, the policy's
    // counts and "next_in_ms", the timer's time left (-1: none).
    void Dump(Json::Value& out) const;

private:
    void Follow(const AliasStep& step, const char* why);
    void Run(ZEPA::Relay::ALIAS_REQUEST_CMD cmd);
    void OnDone(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, boost::shared_ptr<ZEPA::Relay::Request> req);
    void Record(const std::string& word, const std::string& extra);
    void Deliver(ZEPA::Relay::ALIAS_REQUEST_CMD cmd, ZEPA::Relay::ALIAS_RET ret);

    ZEPA::Relay::RelaydConf& _conf;
    EventLoop& _loop;
    AliasPolicy _policy;
    OutcomeHandler _onOutcome;
    bool _registered;
    std::string _word;
    std::string _extra;
    std::string _next;  // the command the timer will send, empty when none
};

}  // namespace zeparelayd

#endif
