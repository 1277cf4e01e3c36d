#include "events/IEventSubscriber.h"

#include <algorithm>
#include <thread>

namespace kesu {

IEventSubscriber::IEventSubscriber(std::vector<std::string> names) : eventNames(std::move(names)) {}

void IEventSubscriber::notify(const std::string& eventName) {
    if (handles(eventName)) dispatchDetached(eventName);
}

bool IEventSubscriber::handles(const std::string& eventName) const {
    return std::find(eventNames.begin(), eventNames.end(), eventName) != eventNames.end();
}

bool IEventSubscriber::dispatchDetached(const std::string& eventName) {
    bool idle = false;
    if (!m_isNotify.compare_exchange_strong(idle, true)) return false;  // busy: dropped
    {
        std::lock_guard<std::mutex> guard(runningMutex_);
        ++running_;
    }
    std::shared_ptr<IEventSubscriber> self = shared_from_this();
    std::thread([self, eventName] {
        self->eventNotify(eventName);
        self->setIsNotify(false);
        std::lock_guard<std::mutex> guard(self->runningMutex_);
        --self->running_;
        self->runningCv_.notify_all();
    }).detach();
    return true;
}

bool IEventSubscriber::waitIdle(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> guard(runningMutex_);
    return runningCv_.wait_for(guard, timeout, [this] { return running_ == 0; });
}

}  // namespace kesu
