#define RLOG_SOURCE "loop"

#include "event_loop.h"

#include <libdaemon/dsignal.h>
#include <poll.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <vector>

#include "log.h"

using ZEPA::Relay::Request;

namespace zeparelayd {

EventLoop::EventLoop(const Clock& clock)
    : _clock(clock),
      _multi(curl_multi_init()),
      _curlDueMs(-1),
      _clockFd(timerfd_create(CLOCK_REALTIME, TFD_NONBLOCK | TFD_CLOEXEC)),
      _running(false) {
    WatchClock();
    if (_multi == nullptr) return;
    curl_multi_setopt(_multi, CURLMOPT_SOCKETFUNCTION, &EventLoop::SocketCallback);
    curl_multi_setopt(_multi, CURLMOPT_SOCKETDATA, this);
    curl_multi_setopt(_multi, CURLMOPT_TIMERFUNCTION, &EventLoop::TimerCallback);
    curl_multi_setopt(_multi, CURLMOPT_TIMERDATA, this);
}

EventLoop::~EventLoop() {
    for (Job& job : _jobs) job.request->JobRemove(_multi);
    _jobs.clear();
    if (_multi != nullptr) curl_multi_cleanup(_multi);
    if (_clockFd >= 0) close(_clockFd);
}

// A timer far in the future that the kernel cancels when the wall clock is
// set: the only notice of a clock step.
void EventLoop::WatchClock() {
    if (_clockFd < 0) return;
    struct itimerspec far = {};
    far.it_value.tv_sec = INT_MAX;
    if (timerfd_settime(_clockFd, TFD_TIMER_ABSTIME | TFD_TIMER_CANCEL_ON_SET, &far, nullptr) != 0) {
        close(_clockFd);
        _clockFd = -1;
    }
}

void EventLoop::DrainClock() {
    uint64_t expirations;
    if (read(_clockFd, &expirations, sizeof(expirations)) >= 0 || errno != ECANCELED) return;
    WatchClock();
    RLOG(LOG_INFO, "the wall clock was set");
    if (_onClockSet) _onClockSet();
}

int EventLoop::SocketCallback(CURL*, curl_socket_t fd, int what, void* userp, void*) {
    auto* self = static_cast<EventLoop*>(userp);
    if (what == CURL_POLL_REMOVE) {
        self->_sockets.erase(fd);
    } else {
        self->_sockets[fd] = what;
    }
    return 0;
}

int EventLoop::TimerCallback(CURLM*, long timeoutMs, void* userp) {
    auto* self = static_cast<EventLoop*>(userp);
    self->_curlDueMs = timeoutMs < 0 ? -1 : self->_clock.NowMs() + timeoutMs;
    return 0;
}

void EventLoop::SetTimer(const std::string& name, int64_t delayMs, TimerHandler handler) {
    _timers[name] = Timer{_clock.NowMs() + std::max<int64_t>(delayMs, 0), std::move(handler)};
}

void EventLoop::CancelTimer(const std::string& name) { _timers.erase(name); }

int64_t EventLoop::TimerRemaining(const std::string& name) const {
    auto it = _timers.find(name);
    if (it == _timers.end()) return -1;
    return std::max<int64_t>(it->second.dueMs - _clock.NowMs(), 0);
}

bool EventLoop::StartRequest(const std::string& tag, boost::shared_ptr<Request> request,
                             RequestHandler handler) {
    if (!request || !request->JobAdd(_multi)) return false;
    _jobs.push_back(Job{tag, request, std::move(handler), _clock.NowMs()});
    // JobAdd kicked the transfer; it may already have finished (refused at once).
    CollectFinished();
    return true;
}

void EventLoop::CancelRequests(const std::string& tag) {
    for (auto it = _jobs.begin(); it != _jobs.end();) {
        if (it->tag == tag) {
            it->request->JobRemove(_multi);
            it = _jobs.erase(it);
        } else {
            ++it;
        }
    }
}

bool EventLoop::HasRequest(const std::string& tag) const {
    return std::any_of(_jobs.begin(), _jobs.end(), [&](const Job& j) { return j.tag == tag; });
}

int EventLoop::PollTimeout() const {
    int64_t due = _curlDueMs;
    for (const auto& t : _timers) {
        if (due < 0 || t.second.dueMs < due) due = t.second.dueMs;
    }
    if (due < 0) return -1;
    int64_t wait = due - _clock.NowMs();
    if (wait <= 0) return 0;
    return static_cast<int>(std::min<int64_t>(wait, INT_MAX));
}

bool EventLoop::Run() {
    _running = true;
    while (_running) {
        if (!Round(-1)) return false;
    }
    return true;
}

bool EventLoop::RunOnce(int maxWaitMs) {
    _running = true;
    const bool ok = Round(std::max(maxWaitMs, 0));
    _running = false;
    return ok;
}

// maxWaitMs < 0: as long as the timers and curl allow.
bool EventLoop::Round(int maxWaitMs) {
    if (_onIdle) _onIdle();
    std::vector<pollfd> fds;
    fds.push_back(pollfd{daemon_signal_fd(), POLLIN, 0});
    for (const auto& s : _sockets) {
        short events = 0;
        if (s.second & CURL_POLL_IN) events |= POLLIN;
        if (s.second & CURL_POLL_OUT) events |= POLLOUT;
        fds.push_back(pollfd{s.first, events, 0});
    }
    const size_t sockets = fds.size();
    if (_clockFd >= 0) fds.push_back(pollfd{_clockFd, POLLIN, 0});
    int timeout = PollTimeout();
    if (maxWaitMs >= 0 && (timeout < 0 || timeout > maxWaitMs)) timeout = maxWaitMs;
    int n = poll(fds.data(), fds.size(), timeout);
    if (n < 0 && errno != EINTR) {
        RLOG(LOG_ERR, "poll failed (%d)", errno);
        return false;
    }
    if (n > 0 && (fds[0].revents & POLLIN)) DrainSignals();
    if (n > 0 && sockets < fds.size() && fds[sockets].revents != 0) DrainClock();
    for (size_t i = 1; n > 0 && _running && i < sockets; ++i) {
        if (fds[i].revents == 0) continue;
        int mask = 0;
        if (fds[i].revents & POLLIN) mask |= CURL_CSELECT_IN;
        if (fds[i].revents & POLLOUT) mask |= CURL_CSELECT_OUT;
        if (fds[i].revents & (POLLERR | POLLHUP | POLLNVAL)) mask |= CURL_CSELECT_ERR;
        SocketAction(fds[i].fd, mask);
    }
    if (_running && _curlDueMs >= 0 && _curlDueMs <= _clock.NowMs()) {
        _curlDueMs = -1;
        SocketAction(CURL_SOCKET_TIMEOUT, 0);
    }
    if (_running) RunDueTimers();
    return true;
}

void EventLoop::DrainSignals() {
    int sig;
    while (_running && (sig = daemon_signal_next()) > 0) {
        if (_onSignal) _onSignal(sig);
    }
}

void EventLoop::SocketAction(curl_socket_t fd, int mask) {
    int running = 0;
    curl_multi_socket_action(_multi, fd, mask, &running);
    CollectFinished();
}

void EventLoop::CollectFinished() {
    int left = 0;
    CURLMsg* msg;
    while ((msg = curl_multi_info_read(_multi, &left)) != nullptr) {
        if (msg->msg != CURLMSG_DONE) continue;
        auto it = std::find_if(_jobs.begin(), _jobs.end(),
                               [&](const Job& j) { return *j.request == msg->easy_handle; });
        if (it == _jobs.end()) continue;
        Job job = *it;
        _jobs.erase(it);
        job.request->JobDone(msg->data.result);
        job.request->JobRemove(_multi);
        // The handler may start new transfers, which is safe: the message
        // queue of the multi handle survives additions.
        if (job.handler) job.handler(job.request);
    }
}

void EventLoop::RunDueTimers() {
    int64_t now = _clock.NowMs();
    std::vector<std::string> due;
    for (const auto& t : _timers) {
        if (t.second.dueMs <= now) due.push_back(t.first);
    }
    for (const std::string& name : due) {
        auto it = _timers.find(name);
        if (it == _timers.end() || it->second.dueMs > now) continue;
        TimerHandler handler = std::move(it->second.handler);
        _timers.erase(it);
        if (handler) handler();
    }
}

}  // namespace zeparelayd
