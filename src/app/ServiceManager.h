// Starts the service's workers in their fixed order, and brings them down again for an
// orderly exit (signal) or a test.
#pragma once

#include <memory>
#include <vector>

namespace kesu {

class EventLoop;
class IEventSubscriber;
class EventDetected;
class ServiceWorker;
class PreConnectionThread;
class SocketServer;
class WlanReportDevices;
class WlanDeviceDelete;

class ServiceManager {
public:
    // Every worker runs its sockets and timers on `loop`, which outlives the manager.
    explicit ServiceManager(EventLoop& loop);
    ~ServiceManager();  // defined where EventDetected is complete
    ServiceManager(const ServiceManager&) = delete;
    ServiceManager& operator=(const ServiceManager&) = delete;

    void start();
    void stop();
    void restart();

private:
    EventLoop& loop_;
    bool started_ = false;
    std::vector<std::shared_ptr<IEventSubscriber>> subscribers_;
    std::unique_ptr<EventDetected> eventDetected_;
    std::unique_ptr<ServiceWorker> serviceWorker_;
    std::unique_ptr<PreConnectionThread> preconnectScheduler_;
    std::unique_ptr<SocketServer> phoneServer_;
    std::shared_ptr<WlanReportDevices> wlanReportDevices_;
    std::unique_ptr<WlanDeviceDelete> wlanDeviceDelete_;
};

}  // namespace kesu
