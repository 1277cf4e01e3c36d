// The registry of pre-connect entries, keyed by device key: merges each cloud device list
// into the entries, gives the strategy its candidates in priority order, and sends the two
// telemetry records about the cloud device list.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "core/Json.h"
#include "core/WallClock.h"
#include "preconnect/FarawayDevice.h"
#include "preconnect/IDeviceWaitForPreConnect.h"

namespace kesu {

class EventLoop;

// "yyyy-MM-dd HH:mm:ss.SSS" (local time; the fraction may be missing) as whole seconds since
// 1970; 0 when the text does not read as such.
long long stringToTimestamp(const std::string& time);

class DeviceWaitForPreConnectManager {
public:
    using Entry = std::shared_ptr<IDeviceWaitForPreConnect>;
    using FarawayMap = std::map<std::string, std::shared_ptr<FarawayDevice>>;

    // The registry of the service. Entries made by a merge work on the loop given with
    // setEventLoop; until then a merge makes no new entries (it says so in the log).
    static DeviceWaitForPreConnectManager& instance();
    explicit DeviceWaitForPreConnectManager(EventLoop* loop = nullptr);
    void setEventLoop(EventLoop* loop);
    EventLoop* eventLoop() const { return loop_.load(); }
    // Whoever reports the pre-connect device list to the PC suite (wired by the composition
    // root) hears of every change of an entry's state through notifyListChanged.
    void setListChangedHandler(std::function<void()> handler);
    void notifyListChanged() const;
    // The scheduler, which sleeps while the registry is empty, is woken by every addition.
    void setDevicesAddedHandler(std::function<void()> handler);

    // Merges one cloud device-list reply into the entries.
    void addFarawayDevices(const Json& req);
    static bool farawayDeviceCheck(const FarawayDevice& device) { return !device.getDeviceId().empty(); }

    void updateDevices(const std::string& key, Entry value);
    bool lookupDevices(const std::string& key, Entry& value) const;
    void deleteDevices(const std::string& key);
    void addDevices(const std::string& key, Entry value);
    void clearAllDevices();
    std::vector<Entry> getAllDevices() const;
    // The candidates: the last pad, the last phone, then the newest cloud report first.
    std::vector<Entry> getSortWaitForPreFarDevices() const;
    int getDevicesSize() const;
    // Waits until the registry holds a device; false when it is still empty at the time-out.
    bool waitForDevices(std::chrono::milliseconds timeout) const;

    // True when the link's address is no longer the device's first reported one.
    static bool checkDeviceInvalid(const FarawayDevice& oldDev, const FarawayDevice& newDev);
    // The four steps of a merge.
    void parserFarawayDevices(const Json& req, FarawayMap& mapFarawayDevices) const;
    static void filterSameWaitForPreConnectDevices(FarawayMap& mapFarawayDevices);
    void removeDisconnectedDevices(FarawayMap& mapFarawayDevices);
    void InsertNewDevices(FarawayMap& mapFarawayDevices);

    // The device-list record (W688|10269), at most once a day while sends succeed.
    bool sendDeviceListBuryPoint(const Json& req, int duration);
    // The failure record of a device-list request (W688|10316), one datagram.
    bool sendDeviceListFailBuryPoint(int status, const std::string& msg, const std::string& triggerReason);

private:
    mutable std::mutex mutexMap;
    mutable std::condition_variable devicesAdded_;
    std::map<std::string, Entry> waitForPreConnectDevicesMap;
    std::atomic<EventLoop*> loop_;
    mutable std::mutex handlerMutex_;
    std::function<void()> listChanged_;
    std::function<void()> devicesAddedHandler_;
    std::mutex reportMutex_;
    bool m_isReportBuryPoint = false;                   // guarded by reportMutex_
    WallClock::Clock::time_point deviceListDate_;           // guarded by reportMutex_: last record sent
};

}  // namespace kesu
