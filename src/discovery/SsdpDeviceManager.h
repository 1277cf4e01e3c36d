// The process-wide holder of the discovered-device table, its queries, the hook through
// which the device-list reporting learns of an announcement before it is stored, and the
// time the PC last heard its own announcement (which tells the adapter monitor that its
// sockets still hear the group).
#pragma once

#include <atomic>
#include <cstddef>
#include <functional>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "core/SteadyClock.h"
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
    // `clock` (which must outlive the manager) measures the expiry and the own echo.
    SsdpDeviceManager(std::size_t maxDevices, double expirySeconds, const SteadyClock& clock = SteadyClock::system());

    SsdpSafemap ssdpDeviceMap;

    std::vector<SsdpDevicePtr> getAllDevices() const;
    // Expiry sweep now; true when something was removed.
    bool deleteDevices();
    // Sweeps, then writes {"error":0,"error_message":"","data":[device...]} pretty-printed
    // into `res`. Always true.
    bool getQueryAll(std::string& res);

    // Registers an observer; the returned token removes it again.
    std::size_t addChangeObserver(ChangeObserver observer);
    void removeChangeObserver(std::size_t token);
    // Runs every registered observer on `device` (in registration order).
    void notifyChange(const SsdpDevice& device) const;

    // The PC heard its own announcement now (the adapter monitor also marks the start of its
    // wait for the first one). Any thread.
    void markOwnEcho() { ownEcho_.store(clock_.now().time_since_epoch().count()); }
    // When markOwnEcho last ran (the clock's zero before it ever did).
    SteadyClock::time_point lastOwnEcho() const {
        return SteadyClock::time_point(SteadyClock::duration(ownEcho_.load()));
    }
    const SteadyClock& clock() const { return clock_; }

private:
    const SteadyClock& clock_ = SteadyClock::system();
    std::atomic<SteadyClock::duration::rep> ownEcho_{0};

    mutable std::mutex observerLock_;
    std::vector<std::pair<std::size_t, ChangeObserver>> observers_;
    std::size_t nextToken_ = 1;
};

}  // namespace kesu
