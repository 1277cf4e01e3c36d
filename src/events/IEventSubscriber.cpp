#include "events/IEventSubscriber.h"

#include <algorithm>
#include <exception>
#include <string>

#include "core/EventLoop.h"
#include "core/Log.h"

namespace kesu {

IEventSubscriber::IEventSubscriber(EventLoop& loop, EventSet events) : loop_(&loop), events_(events) {}

IEventSubscriber::IEventSubscriber(EventSet events) : loop_(nullptr), events_(events) {}

void IEventSubscriber::notify(ServiceEvent event) {
    if (!handles(event) || !loop_) return;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (stopped_) return;
        std::erase(pending_, event);
        pending_.push_back(event);
        if (running_) return;  // the run under way takes it
        running_ = true;
    }
    loop_->offload([self = shared_from_this()] { self->runNext(); });
}

// Ends the run when nothing is left; the caller holds the lock.
bool IEventSubscriber::finishedLocked() {
    if (!pending_.empty() && !stopped_) return false;
    pending_.clear();
    running_ = false;
    idle_.notify_all();
    return true;
}

void IEventSubscriber::runNext() {
    ServiceEvent event{};
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (finishedLocked()) return;
        event = pending_.front();
        pending_.erase(pending_.begin());
    }
    try {
        eventNotify(event);
    } catch (const std::exception& e) {
        Log::mPrintlog(std::string("[IEventSubscriber] handling ") + eventName(event) + " failed: " + e.what());
    }
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (finishedLocked()) return;
    }
    // One event per pool task, so that other work queued on the pool gets its turn.
    loop_->offload([self = shared_from_this()] { self->runNext(); });
}

bool IEventSubscriber::waitIdle(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    return idle_.wait_for(lock, timeout, [this] { return !running_ && pending_.empty(); });
}

bool IEventSubscriber::stop(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(mutex_);
    stopped_ = true;
    pending_.clear();
    return idle_.wait_for(lock, timeout, [this] { return !running_; });
}

}  // namespace kesu
