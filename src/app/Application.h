// The composition root: builds every part of the service in start-up order, hands each the
// event loop it runs on, and stops them in the reverse order.
#pragma once

#include <memory>

namespace kesu {

class EventLoop;
class HttpAliveCheck;
class HttpService;
class ServiceManager;

class Application {
public:
    Application();
    ~Application();  // stop()
    Application(const Application&) = delete;
    Application& operator=(const Application&) = delete;

    // The control server, the event loop, the account monitor, the workers (discovery, the
    // phone server, reports, event subscribers) and the control server's watchdog.
    void start();
    // Everything down again, the last started first; returns when their work has ended.
    void stop();

private:
    bool started_ = false;
    std::unique_ptr<HttpService> controlServer_;
    std::unique_ptr<EventLoop> loop_;
    std::unique_ptr<ServiceManager> workers_;
    std::unique_ptr<HttpAliveCheck> watchdog_;
};

}  // namespace kesu
