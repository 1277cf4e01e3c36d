// The clock of durations: time-outs, expiry, throttles and periods are measured on it, never
// on the wall clock (which steps with NTP, suspend or a user's change). Tests hand a
// ManualClock to what they need to move through time.
#pragma once

#include <atomic>
#include <chrono>

namespace kesu {

class SteadyClock {
public:
    using time_point = std::chrono::steady_clock::time_point;
    using duration = std::chrono::steady_clock::duration;

    virtual ~SteadyClock() = default;
    virtual time_point now() const { return std::chrono::steady_clock::now(); }

    // The real monotonic clock.
    static const SteadyClock& system() {
        static const SteadyClock clock;
        return clock;
    }
};

// A clock that moves only when told to.
class ManualClock : public SteadyClock {
public:
    time_point now() const override { return time_point(duration(ticks_.load())); }
    void advance(duration by) { ticks_.fetch_add(by.count()); }

private:
    std::atomic<duration::rep> ticks_{duration(std::chrono::hours(24)).count()};
};

}  // namespace kesu
