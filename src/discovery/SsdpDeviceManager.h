// The process-wide holder of the discovered-device table, its queries, and the hook through
// which the device-list reporting learns of an announcement before it is stored.
#pragma once

#include <cstddef>
#include <functional>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "discovery/SsdpDevice.h"
#include "discovery/SsdpSafemap.h"

namespace kesu {

class SsdpDeviceManager {
public:
    // Called with every record about to be inserted or refreshed, before the table changes,
    // so that the observer can compare it with the stored entry (lookup is allowed; the
    // table lock is not held). Runs on the datagram-delivery thread: keep it short.
    using ChangeObserver = std::function<void(const SsdpDevice& device)>;

    static SsdpDeviceManager& instance();

    SsdpDeviceManager() = default;
    SsdpDeviceManager(std::size_t maxDevices, double expirySeconds);

    SsdpSafemap ssdpDeviceMap;

    std::vector<SsdpDevicePtr> getAllDevices() const;
    // Expiry sweep at the current time; true when something was removed.
    bool deleteDevices();
    // Sweeps, then writes {"error":0,"error_message":"","data":[device...]} pretty-printed
    // into `res`. Always true.
    bool getQueryAll(std::string& res);

    // Registers an observer; the returned token removes it again.
    std::size_t addChangeObserver(ChangeObserver observer);
    void removeChangeObserver(std::size_t token);
    // Runs every registered observer on `device` (in registration order).
    void notifyChange(const SsdpDevice& device) const;

private:
    mutable std::mutex observerLock_;
    std::vector<std::pair<std::size_t, ChangeObserver>> observers_;
    std::size_t nextToken_ = 1;
};

}  // namespace kesu
