// The registry of pre-connect entries, keyed by device key.
#pragma once

#include <chrono>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "preconnect/IDeviceWaitForPreConnect.h"

namespace kesu {

class DeviceWaitForPreConnectManager {
public:
    using Entry = std::shared_ptr<IDeviceWaitForPreConnect>;

    static DeviceWaitForPreConnectManager& instance();

    void updateDevices(const std::string& key, Entry value);
    bool lookupDevices(const std::string& key, Entry& value) const;
    void deleteDevices(const std::string& key);
    void addDevices(const std::string& key, Entry value);
    void clearAllDevices();
    std::vector<Entry> getAllDevices() const;
    int getDevicesSize() const;
    // Waits until the registry holds a device; false when it is still empty at the time-out.
    bool waitForDevices(std::chrono::milliseconds timeout) const;

private:
    mutable std::mutex mutexMap;
    mutable std::condition_variable devicesAdded_;
    std::map<std::string, Entry> waitForPreConnectDevicesMap;
};

}  // namespace kesu
