// The daemon's single event loop: libdaemon's signal pipe, a few named
// timers and a curl multi handle, all waited for in one poll(). Nothing in
// here ever blocks on the network.
#ifndef ZEPARELAYD_TOOL_EVENT_LOOP_H
#define ZEPARELAYD_TOOL_EVENT_LOOP_H

#include <curl/curl.h>

#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <string>

#include <zeparelayd/request.h>

#include "clock.h"

namespace zeparelayd {

class EventLoop {
public:
    using SignalHandler = std::function<void(int sig)>;
    using TimerHandler = std::function<void()>;
    using RequestHandler = std::function<void(boost::shared_ptr<ZEPA::Relay::Request>)>;

    explicit EventLoop(const Clock& clock);
    ~EventLoop();
    EventLoop(const EventLoop&) = delete;
    EventLoop& operator=(const EventLoop&) = delete;

    bool IsReady() const { return _multi != nullptr; }

    void OnSignal(SignalHandler handler) { _onSignal = std::move(handler); }
    // Runs after every round of events, before the loop waits again.
    void OnIdle(TimerHandler handler) { _onIdle = std::move(handler); }
    // Runs when the wall clock was set (a jump, e.g. the first time sync of
    // a box without a clock battery).
    void OnClockSet(TimerHandler handler) { _onClockSet = std::move(handler); }

    // One-shot timers by name; setting a name again replaces its deadline.
    void SetTimer(const std::string& name, int64_t delayMs, TimerHandler handler);
    void CancelTimer(const std::string& name);
    // Milliseconds until the timer fires, -1 when it is not set.
    int64_t TimerRemaining(const std::string& name) const;

    // Starts an asynchronous transfer; the handler runs once it finished
    // (also on failure). False when the transfer could not be started.
    bool StartRequest(const std::string& tag, boost::shared_ptr<ZEPA::Relay::Request> request,
                      RequestHandler handler);
    // Drops every transfer with this tag without calling its handler.
    void CancelRequests(const std::string& tag);
    bool HasRequest(const std::string& tag) const;

    struct Job {
        std::string tag;
        boost::shared_ptr<ZEPA::Relay::Request> request;
        RequestHandler handler;
        int64_t startedMs;
    };
    const std::list<Job>& Jobs() const { return _jobs; }

    // Runs until Stop(); false when the loop could not wait.
    bool Run();
    // One round of events, waiting at most maxWaitMs for the first (tests
    // that move a clock by hand step the loop with it); false as Run().
    bool RunOnce(int maxWaitMs);
    void Stop() { _running = false; }
    bool Running() const { return _running; }

private:
    struct Timer {
        int64_t dueMs;
        TimerHandler handler;
    };

    static int SocketCallback(CURL* easy, curl_socket_t fd, int what, void* userp, void* socketp);
    static int TimerCallback(CURLM* multi, long timeoutMs, void* userp);

    int PollTimeout() const;
    bool Round(int maxWaitMs);
    void DrainSignals();
    void WatchClock();
    void DrainClock();
    void SocketAction(curl_socket_t fd, int mask);
    void CollectFinished();
    void RunDueTimers();

    const Clock& _clock;
    CURLM* _multi;
    std::map<curl_socket_t, int> _sockets;  // fd -> CURL_POLL_* wish
    int64_t _curlDueMs;                     // -1: curl wants no timeout
    std::map<std::string, Timer> _timers;
    std::list<Job> _jobs;
    int _clockFd;  // -1 when the clock cannot be watched
    SignalHandler _onSignal;
    TimerHandler _onIdle;
    TimerHandler _onClockSet;
    bool _running;
};

}  // namespace zeparelayd

#endif
