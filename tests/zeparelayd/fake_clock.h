// A clock and a jitter source the daemon's policy tests set by hand.
#ifndef ZEPARELAYD_TEST_FAKE_CLOCK_H
#define ZEPARELAYD_TEST_FAKE_CLOCK_H

#include <cstdint>

#include "clock.h"
#include "retry_policy.h"

namespace zepatest {

class FakeClock : public zeparelayd::Clock {
public:
    int64_t NowMs() const override { return _now; }
    void Advance(int64_t ms) { _now += ms; }

private:
    int64_t _now = 5000000;
};

// A jitter source that gives the value the test sets.
struct FixedRandom {
    long value = 0;
    zeparelayd::RandomSource Source() {
        return [this] { return value; };
    }
};

}  // namespace zepatest

#endif
