// Starts the service's workers in their fixed order, and brings them down again for an
// orderly exit (signal) or a test.
#pragma once

#include <memory>
#include <vector>

namespace kesu {

class IEventSubscriber;

class ServiceManager {
public:
    ServiceManager() = default;
    ~ServiceManager();
    ServiceManager(const ServiceManager&) = delete;
    ServiceManager& operator=(const ServiceManager&) = delete;

    void start();
    void stop();
    void restart();

private:
    bool started_ = false;
    std::vector<std::shared_ptr<IEventSubscriber>> subscribers_;
};

}  // namespace kesu
