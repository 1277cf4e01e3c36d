// A bus subscriber for tests: records the name of every published event on the publisher's
// thread, in order, so that a test can take them or wait for one.
#pragma once

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "events/EventPublisher.h"

namespace kesu::test {

class EventRecorder : public IEventSubscriber {
public:
    using Events = std::vector<std::string>;

    EventRecorder() : IEventSubscriber(EventSet{}) {}

    void notify(ServiceEvent event) override {
        std::lock_guard<std::mutex> l(m_);
        events_.push_back(eventName(event));
        cv_.notify_all();
    }
    void eventNotify(ServiceEvent) override {}

    // The events since the last take().
    Events events() {
        std::lock_guard<std::mutex> l(m_);
        return events_;
    }
    Events take() {
        std::lock_guard<std::mutex> l(m_);
        return std::exchange(events_, {});
    }
    int count(const std::string& name) {
        std::lock_guard<std::mutex> l(m_);
        return static_cast<int>(std::count(events_.begin(), events_.end(), name));
    }
    // Waits until `name` was recorded `n` times since the last take(); false at the time-out.
    bool waitFor(const std::string& name, int n = 1, std::chrono::milliseconds timeout = std::chrono::seconds(30)) {
        std::unique_lock<std::mutex> l(m_);
        return cv_.wait_for(l, timeout, [&] { return std::count(events_.begin(), events_.end(), name) >= n; });
    }

private:
    std::mutex m_;
    std::condition_variable cv_;
    Events events_;
};

}  // namespace kesu::test
