#include "pcsuite/WlanDeviceObservers.h"

#include <algorithm>

#include "discovery/SsdpDeviceManager.h"
#include "pcsuite/DeviceListReporter.h"

namespace kesu {

// ---- WlanReportObservers --------------------------------------------------------------------

void WlanReportObservers::addObserver(std::shared_ptr<WlanReportDevices> observer) {
    if (!observer) return;
    std::lock_guard<std::mutex> guard(lock_);
    m_observer.push_back(std::move(observer));
}

void WlanReportObservers::removeObserver(const std::shared_ptr<WlanReportDevices>& observer) {
    std::lock_guard<std::mutex> guard(lock_);
    std::erase(m_observer, observer);
}

void WlanReportObservers::notifySubscribers() {
    std::vector<std::shared_ptr<WlanReportDevices>> observers;
    {
        std::lock_guard<std::mutex> guard(lock_);
        observers = m_observer;
    }
    for (const auto& observer : observers) observer->notify();
}

// ---- WlanDetectedDeviceCompare --------------------------------------------------------------

WlanDetectedDeviceCompare& WlanDetectedDeviceCompare::instance() {
    static WlanDetectedDeviceCompare* compare = new WlanDetectedDeviceCompare(SsdpDeviceManager::instance());
    return *compare;
}

WlanDetectedDeviceCompare::WlanDetectedDeviceCompare(SsdpDeviceManager& manager) : manager_(manager) {
    hookToken_ = manager_.addChangeObserver([this](const SsdpDevice& device) { checkWhetherDeviceChange(device); });
}

WlanDetectedDeviceCompare::~WlanDetectedDeviceCompare() { manager_.removeChangeObserver(hookToken_); }

bool WlanDetectedDeviceCompare::checkWhetherDeviceChange(const SsdpDevice& device) {
    SsdpDevicePtr stored;
    const bool changed = !manager_.ssdpDeviceMap.lookup(device.deviceId, stored) || !stored ||
                         stored->account != device.account || stored->guide != device.guide ||
                         stored->openId != device.openId || stored->isOpenIdSame != device.isOpenIdSame;
    if (changed) notifySubscribers();
    return changed;
}

// ---- WlanDeviceDelete -----------------------------------------------------------------------

WlanDeviceDelete::WlanDeviceDelete() : WlanDeviceDelete(SsdpDeviceManager::instance()) {}

WlanDeviceDelete::WlanDeviceDelete(SsdpDeviceManager& manager) : manager_(manager) {}

WlanDeviceDelete::~WlanDeviceDelete() { stop(); }

void WlanDeviceDelete::detectedToDelete(std::chrono::milliseconds period) {
    std::lock_guard<std::mutex> guard(stateLock_);
    if (stopping_ || loop_.joinable()) return;
    loop_ = std::thread([this, period] {
        std::unique_lock<std::mutex> state(stateLock_);
        while (!stopping_) {
            state.unlock();
            if (manager_.deleteDevices()) notifySubscribers();
            state.lock();
            wake_.wait_for(state, period, [this] { return stopping_; });
        }
    });
}

void WlanDeviceDelete::stop() {
    {
        std::lock_guard<std::mutex> guard(stateLock_);
        stopping_ = true;
    }
    wake_.notify_all();
    if (loop_.joinable() && loop_.get_id() != std::this_thread::get_id()) loop_.join();
}

}  // namespace kesu
