// The screen-lock watcher: publishes "LogOutEvent" when the screen gets locked and
// "LogOnEvent" when it gets unlocked, checking every few seconds.
#pragma once

#include <condition_variable>
#include <mutex>
#include <thread>

namespace kesu {

class EventDetected {
public:
    EventDetected();  // starts the watcher
    ~EventDetected();
    EventDetected(const EventDetected&) = delete;
    EventDetected& operator=(const EventDetected&) = delete;
    void stop();

private:
    void screenUnlockedDetected();

    std::mutex mutex_;
    std::condition_variable cv_;
    bool stopped_ = false;
    std::thread thread_;
};

}  // namespace kesu
