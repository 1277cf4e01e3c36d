// The two observers of the discovered-device table that decide when the LAN list goes to the
// PC suite again: WlanDetectedDeviceCompare (an announcement brings a new or changed device)
// and WlanDeviceDelete (the expiry sweep removed devices).
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <mutex>
#include <vector>

namespace kesu {

class EventLoop;
class SsdpDevice;
class SsdpDeviceManager;
class WlanReportDevices;

// The reporters to wake when the LAN list must go again.
class WlanReportObservers {
public:
    void addObserver(std::shared_ptr<WlanReportDevices> observer);
    void removeObserver(const std::shared_ptr<WlanReportDevices>& observer);
    // notify() on every reporter (outside the list's lock).
    void notifySubscribers();

private:
    std::mutex lock_;
    std::vector<std::shared_ptr<WlanReportDevices>> m_observer;
};

class WlanDetectedDeviceCompare : public WlanReportObservers {
public:
    // Watches SsdpDeviceManager::instance(); never destroyed.
    static WlanDetectedDeviceCompare& instance();

    // Registers with the table's change hook, so every announcement about to be stored is
    // checked; the destructor unregisters (so destroy it only while no announcement is being
    // stored in that table).
    explicit WlanDetectedDeviceCompare(SsdpDeviceManager& manager);
    ~WlanDetectedDeviceCompare();
    WlanDetectedDeviceCompare(const WlanDetectedDeviceCompare&) = delete;
    WlanDetectedDeviceCompare& operator=(const WlanDetectedDeviceCompare&) = delete;

    // Called before `device` is stored. A device is changed when its id is not in the table
    // yet, or when account, guide, openId or isOpenIdSame differ from the stored record
    // (name, addresses, type and time are not compared). Changed: notifySubscribers(), true.
    bool checkWhetherDeviceChange(const SsdpDevice& device);

private:
    SsdpDeviceManager& manager_;
    std::size_t hookToken_ = 0;
};

class WlanDeviceDelete : public WlanReportObservers {
public:
    // Sweeps the table of SsdpDeviceManager::instance() (or `manager`) on `loop`.
    explicit WlanDeviceDelete(EventLoop& loop);
    WlanDeviceDelete(EventLoop& loop, SsdpDeviceManager& manager);
    ~WlanDeviceDelete();  // stop()
    WlanDeviceDelete(const WlanDeviceDelete&) = delete;
    WlanDeviceDelete& operator=(const WlanDeviceDelete&) = delete;

    // Starts the sweep, a timer on the loop: sweep now, notifySubscribers() when something
    // was removed, again when the next device expires, at most `period` later; until stop().
    // An empty table is not swept: the next device heard arms the timer again. A second call
    // does nothing.
    void detectedToDelete(std::chrono::milliseconds period);
    // No sweep runs after this returns.
    void stop();

private:
    struct Sweep;

    EventLoop& loop_;
    SsdpDeviceManager& manager_;
    std::shared_ptr<Sweep> sweep_;
    std::size_t hookToken_ = 0;
};

}  // namespace kesu
