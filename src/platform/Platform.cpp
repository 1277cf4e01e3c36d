#include "platform/Platform.h"

#include <atomic>
#include <mutex>
#include <vector>

#include "platform/linux/LinuxPlatform.h"

namespace kesu {

namespace {

std::atomic<Platform*> installed{nullptr};

Platform& linuxPlatform() {
    static Platform* platform = makeLinuxPlatform().release();
    return *platform;
}

}  // namespace

Platform& Platform::current() {
    if (Platform* p = installed.load(std::memory_order_acquire)) return *p;
    return linuxPlatform();
}

void Platform::install(std::shared_ptr<Platform> platform) {
    // Installed platforms are kept alive for the life of the process: a thread that took a
    // reference before a test swapped the platform must never see it destroyed.
    static std::mutex keepLock;
    static auto* keep = new std::vector<std::shared_ptr<Platform>>();
    std::lock_guard<std::mutex> lock(keepLock);
    if (platform) keep->push_back(platform);
    installed.store(platform.get(), std::memory_order_release);
}

}  // namespace kesu
