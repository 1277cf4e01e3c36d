#include "core/PeriodicTimer.h"

#include <asio/post.hpp>

#include <atomic>
#include <exception>
#include <string>

#include "core/Log.h"

namespace kesu {

struct PeriodicTimer::State : std::enable_shared_from_this<State> {
    State(asio::io_context& io, Period p, std::function<void()> t)
        : timer(io), period(std::move(p)), tick(std::move(t)) {}

    // Loop only: waits `delay`, ticks, waits again. The generation ends an older chain when
    // the timer is restarted.
    void arm(std::chrono::milliseconds delay) {
        const unsigned generation = ++armed;
        timer.expires_after(delay);
        timer.async_wait([self = shared_from_this(), generation](const std::error_code& error) {
            if (error || !self->running.load() || generation != self->armed) return;
            self->fire();
        });
    }
    void fire() {
        try {
            tick();
        } catch (const std::exception& e) {
            Log::mPrintlog(std::string("[PeriodicTimer] tick failed: ") + e.what());
        }
        if (running.load()) arm(period());
    }

    asio::steady_timer timer;
    const Period period;
    const std::function<void()> tick;
    std::atomic<bool> running{false};
    unsigned armed = 0;  // loop only
};

PeriodicTimer::PeriodicTimer(asio::io_context& io, Period period, std::function<void()> tick)
    : state_(std::make_shared<State>(io, std::move(period), std::move(tick))) {}

PeriodicTimer::PeriodicTimer(asio::io_context& io, std::chrono::milliseconds period, std::function<void()> tick)
    : PeriodicTimer(io, Period([period] { return period; }), std::move(tick)) {}

PeriodicTimer::~PeriodicTimer() { stop(); }

void PeriodicTimer::start(std::chrono::milliseconds firstDelay) {
    state_->running.store(true);
    asio::post(state_->timer.get_executor(), [self = state_, firstDelay] {
        if (self->running.load()) self->arm(firstDelay.count() < 0 ? self->period() : firstDelay);
    });
}

void PeriodicTimer::stop() {
    if (!state_->running.exchange(false)) return;
    asio::post(state_->timer.get_executor(), [self = state_] {
        ++self->armed;
        self->timer.cancel();
    });
}

void PeriodicTimer::runNow() {
    asio::post(state_->timer.get_executor(), [self = state_] {
        if (!self->running.load()) return;
        ++self->armed;  // the pending wait no longer ticks
        self->timer.cancel();
        self->fire();
    });
}

}  // namespace kesu
