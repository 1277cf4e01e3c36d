// Watchdog of the control server: every period it sends a HeartBeat to the service's own
// control server and restarts that server when no answer comes back.
#pragma once

#include <condition_variable>
#include <functional>
#include <mutex>
#include <thread>

namespace kesu {

class HttpAliveCheck {
public:
    // Starts the watchdog; `probe` answers whether the server is alive (the real check
    // unless a test gives another).
    explicit HttpAliveCheck(std::function<bool()> probe = {});
    ~HttpAliveCheck();
    HttpAliveCheck(const HttpAliveCheck&) = delete;
    HttpAliveCheck& operator=(const HttpAliveCheck&) = delete;

    void stop();
    int restarts() const;
    // Waits until the server was restarted `count` times in all; false at the time-out.
    bool waitForRestarts(int count, std::chrono::milliseconds timeout);

private:
    void httpKeepAliveCheck();
    // Waits for `period` or a stop; true when stopped.
    bool waitStopped(std::chrono::milliseconds period);

    std::function<bool()> probe_;
    mutable std::mutex mutex_;
    std::condition_variable cv_;
    bool stopped_ = false;
    int restarts_ = 0;
    std::thread thread_;
};

}  // namespace kesu
