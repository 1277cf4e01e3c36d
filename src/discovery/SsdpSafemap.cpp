#include "discovery/SsdpSafemap.h"

#include "core/Config.h"
#include "core/Utils.h"

#include <cmath>

namespace kesu {

namespace {
// The age used for ordering: a time stamp that is not a finite number counts as never set,
// so the ordering of the age index stays sound whatever a caller stored.
double ageOf(const SsdpDevicePtr& device) { return std::isfinite(device->lastUpdate) ? device->lastUpdate : 0.0; }
}  // namespace

SsdpSafemap::SsdpSafemap()
    : SsdpSafemap(Config::current().ssdpMaxDevices,
                  std::chrono::duration<double>(Config::current().ssdpDeviceExpiry).count()) {}

SsdpSafemap::SsdpSafemap(std::size_t maxDevices, double expirySeconds)
    : maxDevices_(maxDevices == 0 ? 1 : maxDevices), expirySeconds_(expirySeconds) {}

void SsdpSafemap::eraseLocked(std::map<std::string, SsdpDevicePtr>::iterator it) {
    byAge_.erase({ageOf(it->second), it->first});
    safeMap.erase(it);
}

void SsdpSafemap::storeLocked(const std::string& key, SsdpDevicePtr value) {
    auto it = safeMap.find(key);
    if (it != safeMap.end()) {
        byAge_.erase({ageOf(it->second), key});
        it->second = std::move(value);
    } else {
        it = safeMap.emplace(key, std::move(value)).first;
    }
    byAge_.emplace(ageOf(it->second), key);
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
        Utils::mPrintlog("[SsdpSafemap::insert] device table full (" + std::to_string(maxDevices_) +
                         " devices), evicting the oldest entries, first: " + evictedKey + "\n");
    }
    return true;
}

bool SsdpSafemap::lookup(const std::string& opKey, SsdpDevicePtr& opValue) const {
    std::lock_guard<std::mutex> guard(lock);
    auto it = safeMap.find(opKey);
    if (it == safeMap.end()) return false;
    opValue = it->second;
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
    for (const auto& entry : safeMap) devices.push_back(entry.second);
    return devices;
}

bool SsdpSafemap::eraseTimeOut(double now) {
    std::vector<SsdpDevicePtr> erased;
    {
        std::lock_guard<std::mutex> guard(lock);
        // Oldest first: stop at the first entry young enough to stay.
        while (!byAge_.empty() && now - byAge_.begin()->first > expirySeconds_) {
            auto it = safeMap.find(byAge_.begin()->second);
            erased.push_back(it->second);
            eraseLocked(it);
        }
        if (safeMap.size() < maxDevices_) evictionLogged_ = false;
    }
    for (const auto& device : erased) {
        Utils::mPrintlog("[eraseTimeOut]: erase ssdpdevice: " + device->deviceName + ", " + device->deviceId + "\r\n");
    }
    return !erased.empty();
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
