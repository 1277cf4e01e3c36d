#include "reports/WlanDeviceObservers.h"

#include <algorithm>

#include "core/EventLoop.h"
#include "discovery/SsdpDeviceManager.h"
#include "reports/DeviceListReporter.h"

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

WlanDeviceDelete::WlanDeviceDelete(EventLoop& loop) : WlanDeviceDelete(loop, SsdpDeviceManager::instance()) {}

WlanDeviceDelete::WlanDeviceDelete(EventLoop& loop, SsdpDeviceManager& manager) : loop_(loop), manager_(manager) {}

WlanDeviceDelete::~WlanDeviceDelete() { stop(); }

void WlanDeviceDelete::detectedToDelete(std::chrono::milliseconds period) {
    if (timer_) return;
    timer_ = std::make_unique<PeriodicTimer>(loop_.context(), period, [this] {
        if (manager_.deleteDevices()) notifySubscribers();
    });
    timer_->start(std::chrono::milliseconds(0));
}

void WlanDeviceDelete::stop() {
    if (timer_) loop_.call([this] { timer_->stop(); });
}

}  // namespace kesu
