// The process-wide publish/subscribe bus of named events. Publishing calls every
// subscriber's notify in registration order on the publisher's thread.
#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "events/IEventSubscriber.h"

namespace kesu {

class EventPublisher {
public:
    static EventPublisher& instance();

    void addObserver(std::shared_ptr<IEventSubscriber> observer);
    void notifySubscribers(const std::string& eventName);
    // Drops every subscriber (tests, orderly stop).
    void clearObservers();
    std::vector<std::shared_ptr<IEventSubscriber>> observers() const;

private:
    mutable std::mutex mutex_;
    std::vector<std::shared_ptr<IEventSubscriber>> m_observer;
};

}  // namespace kesu
