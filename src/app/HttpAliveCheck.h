// Watchdog of the control server: every period it sends a HeartBeat to the service's own
// control server and restarts that server when no answer comes back. The period and the
// pause between stopping and starting the server are timers on the loop; the HeartBeat and
// the server's stop and start block, so they run on the worker pool.
#pragma once

#include <chrono>
#include <functional>
#include <memory>

#include "core/PeriodicTimer.h"

namespace kesu {

class EventLoop;
class HttpService;

class HttpAliveCheck {
public:
    // Starts the watchdog of `server`; `probe` answers whether the server is alive (the
    // real check unless a test gives another).
    HttpAliveCheck(EventLoop& loop, HttpService& server, std::function<bool()> probe = {});
    ~HttpAliveCheck();  // stop()
    HttpAliveCheck(const HttpAliveCheck&) = delete;
    HttpAliveCheck& operator=(const HttpAliveCheck&) = delete;

    // No check starts after this; waits (bounded) for a check or restart under way.
    void stop();
    int restarts() const;
    // Waits until the server was restarted `count` times in all; false at the time-out.
    bool waitForRestarts(int count, std::chrono::milliseconds timeout);

private:
    struct State;

    std::shared_ptr<State> state_;
    PeriodicTimer timer_;
};

}  // namespace kesu
