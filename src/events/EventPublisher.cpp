#include "events/EventPublisher.h"

#include <string>

#include "core/Log.h"

namespace kesu {

EventPublisher& EventPublisher::instance() {
    static EventPublisher* publisher = new EventPublisher();
    return *publisher;
}

void EventPublisher::addObserver(std::shared_ptr<IEventSubscriber> observer) {
    if (!observer) return;
    std::lock_guard<std::mutex> lock(mutex_);
    m_observer.push_back(std::move(observer));
}

void EventPublisher::notifySubscribers(ServiceEvent event) {
    Log::mPrintlog(std::string("[EventPublisher::notifySubscribers] notifySubscribers event is: ") +
                     eventName(event));
    for (const auto& observer : observers()) observer->notify(event);
}

void EventPublisher::clearObservers() {
    std::lock_guard<std::mutex> lock(mutex_);
    m_observer.clear();
}

std::vector<std::shared_ptr<IEventSubscriber>> EventPublisher::observers() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return m_observer;
}

}  // namespace kesu
