#include "platform/clock.h"

namespace {

class SystemClock : public oxClock {
public:
    std::time_t Now() const override { return std::time(nullptr); }
    std::int64_t MonotonicSeconds() const override {
        timespec now{};
        clock_gettime(CLOCK_MONOTONIC, &now);
        return static_cast<std::int64_t>(now.tv_sec);
    }
};

}  // namespace

const oxClock& oxClock::System() {
    // Not destroyed: threads may ask for the time while the process exits.
    static const SystemClock* const clock = new SystemClock;
    return *clock;
}
