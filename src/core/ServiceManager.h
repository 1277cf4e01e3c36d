// Starts the service's workers in their fixed order, and brings them down again for an
// orderly exit (signal) or a test.
#pragma once

#include <memory>
#include <vector>

namespace kesu {

class IEventSubscriber;
class EventDetected;

class ServiceManager {
public:
    ServiceManager();
    ~ServiceManager();  // defined where EventDetected is complete
    ServiceManager(const ServiceManager&) = delete;
    ServiceManager& operator=(const ServiceManager&) = delete;

    void start();
    void stop();
    void restart();

private:
    bool started_ = false;
    std::vector<std::shared_ptr<IEventSubscriber>> subscribers_;
    std::unique_ptr<EventDetected> eventDetected_;
};

}  // namespace kesu
