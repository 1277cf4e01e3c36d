// The hand-over of the user's answer in the allow window of a phone-initiated connection:
// the control API signals it (any thread), the waiting connection handler takes it in a
// coroutine on its event loop, which no thread is held for while it waits.
#pragma once

#include <asio/awaitable.hpp>

#include <chrono>
#include <list>
#include <memory>
#include <mutex>

namespace kesu {

class AllowWindowAnswers {
public:
    // Signalled once per answer (QtAgree / QtRefuse): wakes the longest waiting coroutine,
    // or is kept for the next wait when none waits.
    void signal();
    // Wakes every waiting coroutine at once (as unanswered), and until reopen() every wait
    // ends at once unanswered. For the stop of the phone server.
    void close();
    void reopen();
    // Forgets the answers kept so far (left over from an earlier window).
    void drain();
    // Takes one kept answer; false when there is none.
    bool take();
    // On the loop: true when an answer was taken (kept or arriving), false when `timeout`
    // passed or close() ended the wait first.
    asio::awaitable<bool> wait(std::chrono::milliseconds timeout);

private:
    struct Waiter;

    std::mutex mutex_;
    int kept_ = 0;
    bool closed_ = false;
    std::list<std::shared_ptr<Waiter>> waiters_;  // oldest first
};

// The process-wide hand-over between the control API and the connection handlers.
AllowWindowAnswers& allowWindowAnswers();

}  // namespace kesu
