// A subscriber of the event bus. Each accepted event is handled on a fresh detached thread;
// an event that arrives while the subscriber is still handling the previous one is dropped
// for this subscriber, never queued.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace kesu {

class IEventSubscriber : public std::enable_shared_from_this<IEventSubscriber> {
public:
    explicit IEventSubscriber(std::vector<std::string> eventNames = {});
    virtual ~IEventSubscriber() = default;

    // Called by the bus for every published event.
    virtual void notify(const std::string& eventName);
    // Handles one event on the subscriber's thread; false when it does not take the name.
    virtual bool eventNotify(const std::string& eventName) = 0;

    bool getIsNotify() const { return m_isNotify.load(); }
    void setIsNotify(bool isNotify) { m_isNotify.store(isNotify); }
    const std::vector<std::string>& names() const { return eventNames; }
    bool handles(const std::string& eventName) const;

    // Waits until no handler thread of this subscriber runs (tests, orderly stop).
    bool waitIdle(std::chrono::milliseconds timeout);

protected:
    // Starts eventNotify on a detached thread unless a handler already runs; the subscriber
    // is kept alive by the thread. Returns whether the event was taken.
    bool dispatchDetached(const std::string& eventName);

    std::atomic<bool> m_isNotify{false};
    std::mutex lock;  // serialises the handling
    const std::vector<std::string> eventNames;

private:
    std::mutex runningMutex_;
    std::condition_variable runningCv_;
    int running_ = 0;
};

}  // namespace kesu
