// The discovery start-up and its loop: every announce period one adapter check, then the
// PC's announcement on every adapter socket. The pre-connection scheduler is started (and
// stopped) beside it.
#pragma once

#include <condition_variable>
#include <mutex>
#include <thread>

namespace kesu {

class ServiceWorker {
public:
    ServiceWorker() = default;
    ~ServiceWorker();  // stop()
    ServiceWorker(const ServiceWorker&) = delete;
    ServiceWorker& operator=(const ServiceWorker&) = delete;

    // ssdpInit(), then preconnectInit(). A second start while running does nothing.
    void start();
    // Ends the loop at once (also during its wait or a socket rebuild pause), waits for it,
    // and closes the discovery sockets. A later start() opens them afresh.
    void stop();
    bool isRunning() const;

    // The discovered-device table and the adapter monitor exist (the monitor opens the
    // first sockets), then the check-and-announce loop starts on its own thread.
    void ssdpInit();
    // Starts the pre-connection scheduler (not part of this build yet: does nothing).
    void preconnectInit();

private:
    void ssdpInitLocked();
    void ssdpLoop();

    std::mutex lifecycle_;  // serialises start and stop
    mutable std::mutex mutex_;
    std::condition_variable wake_;
    bool stopping_ = false;
    std::thread ssdpThread_;
};

}  // namespace kesu
