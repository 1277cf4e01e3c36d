#include "connect/AllowWindow.h"

#include <asio/post.hpp>
#include <asio/redirect_error.hpp>
#include <asio/steady_timer.hpp>
#include <asio/this_coro.hpp>
#include <asio/use_awaitable.hpp>

#include <algorithm>

namespace kesu {

// One waiting coroutine: its timer is the wake-up (cancelled early by an answer or wakeAll,
// else it expires at the time-out). Touched on the waiter's loop, except `answered`, which
// is guarded by the hand-over's mutex.
struct AllowWindowAnswers::Waiter {
    explicit Waiter(const asio::any_io_executor& executor) : timer(executor) {}
    asio::steady_timer timer;
    bool answered = false;
    bool woken = false;
};

namespace {

void wake(const std::shared_ptr<asio::steady_timer>& timer) {
    asio::post(timer->get_executor(), [timer] { timer->cancel(); });
}

}  // namespace

void AllowWindowAnswers::signal() {
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& waiter : waiters_) {
        if (waiter->woken) continue;
        waiter->woken = true;
        waiter->answered = true;
        wake(std::shared_ptr<asio::steady_timer>(waiter, &waiter->timer));
        return;
    }
    ++kept_;
}

void AllowWindowAnswers::reopen() {
    std::lock_guard<std::mutex> lock(mutex_);
    closed_ = false;
}

void AllowWindowAnswers::close() {
    std::lock_guard<std::mutex> lock(mutex_);
    closed_ = true;
    for (const auto& waiter : waiters_) {
        if (waiter->woken) continue;
        waiter->woken = true;
        wake(std::shared_ptr<asio::steady_timer>(waiter, &waiter->timer));
    }
}

void AllowWindowAnswers::drain() {
    std::lock_guard<std::mutex> lock(mutex_);
    kept_ = 0;
}

bool AllowWindowAnswers::take() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (kept_ == 0) return false;
    --kept_;
    return true;
}

asio::awaitable<bool> AllowWindowAnswers::wait(std::chrono::milliseconds timeout) {
    auto waiter = std::make_shared<Waiter>(co_await asio::this_coro::executor);
    waiter->timer.expires_after(timeout);
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (closed_) co_return false;
        if (kept_ > 0) {
            --kept_;
            co_return true;
        }
        waiters_.push_back(waiter);
    }
    // Unregisters however the wait ends, also when the loop ends and drops this frame.
    struct Registration {
        AllowWindowAnswers& self;
        std::shared_ptr<Waiter> waiter;
        ~Registration() {
            std::lock_guard<std::mutex> lock(self.mutex_);
            self.waiters_.remove(waiter);
        }
    } registration{*this, waiter};
    std::error_code ignored;
    co_await waiter->timer.async_wait(asio::redirect_error(asio::use_awaitable, ignored));
    bool answered = false;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        answered = waiter->answered;
    }
    co_return answered;
}

AllowWindowAnswers& allowWindowAnswers() {
    static auto* answers = new AllowWindowAnswers();
    return *answers;
}

}  // namespace kesu
