// Time as the daemon's timers and retry policies see it: milliseconds of a
// clock that never jumps. The daemon runs on the monotonic clock; tests drive
// the policies with a clock they advance by hand.
#ifndef ZEPARELAYD_TOOL_CLOCK_H
#define ZEPARELAYD_TOOL_CLOCK_H

#include <cstdint>

namespace zeparelayd {

class Clock {
public:
    virtual ~Clock() = default;
    virtual int64_t NowMs() const = 0;
};

class MonotonicClock : public Clock {
public:
    int64_t NowMs() const override;
};

}  // namespace zeparelayd

#endif
