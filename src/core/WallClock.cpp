#include "core/WallClock.h"

#include <atomic>
#include <mutex>

#include "core/TimeUtil.h"

namespace kesu {

namespace {

std::mutex clockLock;
std::function<WallClock::Clock::time_point()> clockOverride;
std::atomic<bool> clockOverridden{false};

}  // namespace

WallClock::Clock::time_point WallClock::now() {
    if (clockOverridden.load(std::memory_order_acquire)) {
        std::lock_guard<std::mutex> lock(clockLock);
        if (clockOverride) return clockOverride();
    }
    return Clock::now();
}

void WallClock::setClock(std::function<Clock::time_point()> clock) {
    std::lock_guard<std::mutex> lock(clockLock);
    clockOverride = std::move(clock);
    clockOverridden.store(static_cast<bool>(clockOverride), std::memory_order_release);
}

std::string WallClock::getNowTime() { return timeutil::formatLocal(now()); }

double WallClock::currentTimeStamp() { return std::chrono::duration<double>(now().time_since_epoch()).count(); }

}  // namespace kesu
