#include "clock.h"

#include <time.h>

namespace zeparelayd {

int64_t MonotonicClock::NowMs() const {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<int64_t>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

}  // namespace zeparelayd
