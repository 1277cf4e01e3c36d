// The discovery start-up: the adapter monitor and its sockets on the service's event loop,
// one adapter check and announcement pass at once and then every announce period, and an
// extra pass within moments of the kernel reporting a link or address change. The
// pre-connection scheduler is started (and stopped) beside it.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>

namespace kesu {

class EventLoop;
class KesuAdapterManager;
class LinkChangeListener;
class PeriodicTimer;
class SsdpDeviceManager;

class ServiceWorker {
public:
    // Runs on `loop`, classifies into `devices` (the process-wide table when not given);
    // both must outlive the worker.
    explicit ServiceWorker(EventLoop& loop);
    ServiceWorker(EventLoop& loop, SsdpDeviceManager& devices);
    ~ServiceWorker();  // stop()
    ServiceWorker(const ServiceWorker&) = delete;
    ServiceWorker& operator=(const ServiceWorker&) = delete;

    // ssdpInit(), then preconnectInit(). A second start while running does nothing.
    void start();
    // Ends the passes at once (also during a socket rebuild pause) and closes the discovery
    // sockets; no pass runs once it returned. A later start() opens them afresh.
    void stop();
    bool isRunning() const { return running_.load(); }

    // The adapter monitor opens the first sockets (on the calling thread), then the passes
    // and the change listener start on the loop.
    void ssdpInit();
    // Starts the pre-connection scheduler (not part of this build yet: does nothing).
    void preconnectInit();

    // The adapter monitor while running, else null (for the service's own checks and tests).
    KesuAdapterManager* adapters() const { return adapters_.get(); }

private:
    void ssdpInitLocked();
    void pass();

    EventLoop& loop_;
    SsdpDeviceManager& devices_;
    std::mutex lifecycle_;  // serialises start and stop
    std::atomic<bool> running_{false};
    std::unique_ptr<KesuAdapterManager> adapters_;
    std::unique_ptr<PeriodicTimer> passes_;
    std::unique_ptr<LinkChangeListener> changes_;
};

}  // namespace kesu
