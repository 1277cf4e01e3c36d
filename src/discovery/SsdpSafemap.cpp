#include "discovery/SsdpSafemap.h"

#include <chrono>

#include "core/Config.h"
#include "core/Log.h"

namespace kesu {

SsdpSafemap::SsdpSafemap()
    : SsdpSafemap(Config::current().ssdpMaxDevices,
                  std::chrono::duration<double>(Config::current().ssdpDeviceExpiry).count()) {}

SsdpSafemap::SsdpSafemap(std::size_t maxDevices, double expirySeconds, const SteadyClock& clock)
    : maxDevices_(maxDevices == 0 ? 1 : maxDevices),
      expiry_(std::chrono::duration_cast<SteadyClock::duration>(std::chrono::duration<double>(expirySeconds))),
      clock_(clock) {}

void SsdpSafemap::eraseLocked(Entries::iterator it) {
    byAge_.erase({it->second.heard, it->first});
    safeMap.erase(it);
}

void SsdpSafemap::storeLocked(const std::string& key, SsdpDevicePtr value) {
    const SteadyClock::time_point now = clock_.now();
    auto it = safeMap.find(key);
    if (it != safeMap.end()) {
        byAge_.erase({it->second.heard, key});
        it->second = Entry{std::move(value), now};
    } else {
        it = safeMap.emplace(key, Entry{std::move(value), now}).first;
    }
    byAge_.emplace(now, key);
}

bool SsdpSafemap::insert(const std::string& opKey, SsdpDevicePtr opValue, bool cover) {
    if (!opValue) return false;
    std::string evictedKey;
    bool logEviction = false;
    {
        std::lock_guard<std::mutex> guard(lock);
        auto present = safeMap.find(opKey);
        if (cover && present != safeMap.end()) {
            eraseLocked(present);
            present = safeMap.end();
        }
        if (present == safeMap.end() && safeMap.size() >= maxDevices_) {
            // Full: the entry heard longest ago makes room. A flood of distinct ids thus
            // churns the table instead of growing it.
            auto oldest = safeMap.find(byAge_.begin()->second);
            evictedKey = oldest->first;
            eraseLocked(oldest);
            ++evicted_;
            if (!evictionLogged_) {
                evictionLogged_ = true;
                logEviction = true;
            }
        }
        storeLocked(opKey, std::move(opValue));
    }
    if (logEviction) {
        Log::mPrintlog("[SsdpSafemap::insert] device table full (" + std::to_string(maxDevices_) +
                         " devices), evicting the oldest entries, first: " + evictedKey + "\n");
    }
    return true;
}

bool SsdpSafemap::lookup(const std::string& opKey, SsdpDevicePtr& opValue) const {
    std::lock_guard<std::mutex> guard(lock);
    auto it = safeMap.find(opKey);
    if (it == safeMap.end()) return false;
    opValue = it->second.device;
    return true;
}

bool SsdpSafemap::update(const std::string& opKey, SsdpDevicePtr opValue) {
    if (!opValue) return false;
    std::lock_guard<std::mutex> guard(lock);
    if (safeMap.find(opKey) == safeMap.end()) return false;
    storeLocked(opKey, std::move(opValue));
    return true;
}

std::vector<SsdpDevicePtr> SsdpSafemap::getDevicesArray() const {
    std::lock_guard<std::mutex> guard(lock);
    std::vector<SsdpDevicePtr> devices;
    devices.reserve(safeMap.size());
    for (const auto& entry : safeMap) devices.push_back(entry.second.device);
    return devices;
}

bool SsdpSafemap::eraseTimeOut() {
    std::vector<SsdpDevicePtr> erased;
    {
        std::lock_guard<std::mutex> guard(lock);
        const SteadyClock::time_point now = clock_.now();
        // Oldest first: stop at the first entry young enough to stay.
        while (!byAge_.empty() && now - byAge_.begin()->first > expiry_) {
            auto it = safeMap.find(byAge_.begin()->second);
            erased.push_back(it->second.device);
            eraseLocked(it);
        }
        if (safeMap.size() < maxDevices_) evictionLogged_ = false;
    }
    for (const auto& device : erased) {
        Log::mPrintlog("[eraseTimeOut]: erase ssdpdevice: " + device->deviceName + ", " + device->deviceId + "\r\n");
    }
    return !erased.empty();
}

std::optional<SteadyClock::time_point> SsdpSafemap::nextExpiry() const {
    std::lock_guard<std::mutex> guard(lock);
    if (byAge_.empty()) return std::nullopt;
    return byAge_.begin()->first + expiry_;
}

void SsdpSafemap::clear() {
    std::lock_guard<std::mutex> guard(lock);
    safeMap.clear();
    byAge_.clear();
    evictionLogged_ = false;
}

std::size_t SsdpSafemap::size() const {
    std::lock_guard<std::mutex> guard(lock);
    return safeMap.size();
}

std::size_t SsdpSafemap::evictedCount() const {
    std::lock_guard<std::mutex> guard(lock);
    return evicted_;
}

}  // namespace kesu
