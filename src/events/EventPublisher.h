// The process-wide publish/subscribe bus. Publishing logs the event and hands it to every
// subscriber in registration order; each subscriber queues it and handles it on the worker
// pool (see IEventSubscriber), so publishing never waits for a handler.
#pragma once

#include <memory>
#include <mutex>
#include <vector>

#include "events/IEventSubscriber.h"

namespace kesu {

class EventPublisher {
public:
    static EventPublisher& instance();

    void addObserver(std::shared_ptr<IEventSubscriber> observer);
    void notifySubscribers(ServiceEvent event);
    // Drops every subscriber (tests, orderly stop).
    void clearObservers();
    std::vector<std::shared_ptr<IEventSubscriber>> observers() const;

private:
    mutable std::mutex mutex_;
    std::vector<std::shared_ptr<IEventSubscriber>> m_observer;
};

}  // namespace kesu
