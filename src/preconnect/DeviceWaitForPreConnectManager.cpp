#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

DeviceWaitForPreConnectManager& DeviceWaitForPreConnectManager::instance() {
    static DeviceWaitForPreConnectManager* manager = new DeviceWaitForPreConnectManager();
    return *manager;
}

void DeviceWaitForPreConnectManager::updateDevices(const std::string& key, Entry value) {
    std::lock_guard<std::mutex> lock(mutexMap);
    auto it = waitForPreConnectDevicesMap.find(key);
    if (it != waitForPreConnectDevicesMap.end()) it->second = std::move(value);
}

bool DeviceWaitForPreConnectManager::lookupDevices(const std::string& key, Entry& value) const {
    std::lock_guard<std::mutex> lock(mutexMap);
    auto it = waitForPreConnectDevicesMap.find(key);
    if (it == waitForPreConnectDevicesMap.end()) return false;
    value = it->second;
    return true;
}

void DeviceWaitForPreConnectManager::deleteDevices(const std::string& key) {
    std::lock_guard<std::mutex> lock(mutexMap);
    waitForPreConnectDevicesMap.erase(key);
}

void DeviceWaitForPreConnectManager::addDevices(const std::string& key, Entry value) {
    std::lock_guard<std::mutex> lock(mutexMap);
    waitForPreConnectDevicesMap[key] = std::move(value);
    devicesAdded_.notify_all();
}

bool DeviceWaitForPreConnectManager::waitForDevices(std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(mutexMap);
    return devicesAdded_.wait_for(lock, timeout, [this] { return !waitForPreConnectDevicesMap.empty(); });
}

void DeviceWaitForPreConnectManager::clearAllDevices() {
    std::lock_guard<std::mutex> lock(mutexMap);
    waitForPreConnectDevicesMap.clear();
}

std::vector<DeviceWaitForPreConnectManager::Entry> DeviceWaitForPreConnectManager::getAllDevices() const {
    std::lock_guard<std::mutex> lock(mutexMap);
    std::vector<Entry> out;
    out.reserve(waitForPreConnectDevicesMap.size());
    for (const auto& [key, entry] : waitForPreConnectDevicesMap) out.push_back(entry);
    return out;
}

int DeviceWaitForPreConnectManager::getDevicesSize() const {
    std::lock_guard<std::mutex> lock(mutexMap);
    return static_cast<int>(waitForPreConnectDevicesMap.size());
}

}  // namespace kesu
