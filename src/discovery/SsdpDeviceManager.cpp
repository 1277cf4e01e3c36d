#include "discovery/SsdpDeviceManager.h"



namespace kesu {

SsdpDeviceManager& SsdpDeviceManager::instance() {
    static SsdpDeviceManager* manager = new SsdpDeviceManager();
    return *manager;
}

SsdpDeviceManager::SsdpDeviceManager(std::size_t maxDevices, double expirySeconds, const SteadyClock& clock)
    : ssdpDeviceMap(maxDevices, expirySeconds, clock), clock_(clock) {}

std::vector<SsdpDevicePtr> SsdpDeviceManager::getAllDevices() const { return ssdpDeviceMap.getDevicesArray(); }

bool SsdpDeviceManager::deleteDevices() { return ssdpDeviceMap.eraseTimeOut(); }

bool SsdpDeviceManager::getQueryAll(std::string& res) {
    deleteDevices();
    Json data = Json::array();
    for (const auto& device : getAllDevices()) data.push_back(device->toJson());
    res = json::pretty(Json{{"error", 0}, {"error_message", ""}, {"data", std::move(data)}});
    return true;
}

std::size_t SsdpDeviceManager::addChangeObserver(ChangeObserver observer) {
    std::lock_guard<std::mutex> guard(observerLock_);
    const std::size_t token = nextToken_++;
    observers_.emplace_back(token, std::move(observer));
    return token;
}

void SsdpDeviceManager::removeChangeObserver(std::size_t token) {
    std::lock_guard<std::mutex> guard(observerLock_);
    std::erase_if(observers_, [token](const auto& entry) { return entry.first == token; });
}

void SsdpDeviceManager::notifyChange(const SsdpDevice& device) const {
    std::vector<ChangeObserver> observers;
    {
        std::lock_guard<std::mutex> guard(observerLock_);
        for (const auto& entry : observers_) observers.push_back(entry.second);
    }
    // Outside the lock: an observer may look the device up or register another observer.
    for (const auto& observer : observers) {
        if (observer) observer(device);
    }
}

}  // namespace kesu
