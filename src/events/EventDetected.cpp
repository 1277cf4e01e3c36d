#include "events/EventDetected.h"

#include "core/Config.h"
#include "core/Utils.h"
#include "events/EventPublisher.h"

namespace kesu {

EventDetected::EventDetected() { thread_ = std::thread([this] { screenUnlockedDetected(); }); }

EventDetected::~EventDetected() { stop(); }

void EventDetected::stop() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        stopped_ = true;
    }
    cv_.notify_all();
    if (thread_.joinable()) thread_.join();
}

void EventDetected::screenUnlockedDetected() {
    bool unlocked = true;  // no event at start while the screen stays unlocked
    for (;;) {
        {
            std::unique_lock<std::mutex> lock(mutex_);
            if (cv_.wait_for(lock, Config::current().screenLockPeriod, [this] { return stopped_; })) return;
        }
        const bool now = Utils::isScreenUnlocked();
        if (now == unlocked) continue;
        unlocked = now;
        EventPublisher::instance().notifySubscribers(unlocked ? "LogOnEvent" : "LogOutEvent");
    }
}

}  // namespace kesu
