// A repeating job on the event loop: `tick` runs once per period (the period is read anew
// before every wait, so a changed configuration takes effect at the next round) until stop.
// Start, stop and runNow may be called from any thread; tick always runs on the loop.
#pragma once

#include <asio/io_context.hpp>
#include <asio/steady_timer.hpp>

#include <chrono>
#include <functional>
#include <memory>

namespace kesu {

class PeriodicTimer {
public:
    using Period = std::function<std::chrono::milliseconds()>;

    PeriodicTimer(asio::io_context& io, Period period, std::function<void()> tick);
    PeriodicTimer(asio::io_context& io, std::chrono::milliseconds period, std::function<void()> tick);
    ~PeriodicTimer();  // stop()
    PeriodicTimer(const PeriodicTimer&) = delete;
    PeriodicTimer& operator=(const PeriodicTimer&) = delete;

    // The first tick comes after `firstDelay`, then one per period.
    void start(std::chrono::milliseconds firstDelay);
    void start() { start(std::chrono::milliseconds(-1)); }  // first tick after one period
    // No tick starts after this returns on the loop; from another thread, a tick already
    // running on the loop may still finish.
    void stop();
    // Ticks as soon as the loop can, and counts the next period from then.
    void runNow();

private:
    struct State;
    std::shared_ptr<State> state_;
};

}  // namespace kesu
