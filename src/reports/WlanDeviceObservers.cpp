#include "reports/WlanDeviceObservers.h"

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

#include <algorithm>
#include <functional>

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

// The sweep's timer and state; shared with the table's change hook and the timer's handler.
// Loop only, except for the construction.
struct WlanDeviceDelete::Sweep : std::enable_shared_from_this<Sweep> {
    Sweep(asio::io_context& io, SsdpDeviceManager& m, std::chrono::milliseconds p, std::function<void()> r)
        : timer(io), manager(m), period(std::max(p, std::chrono::milliseconds(1))), removed(std::move(r)) {}

    void sweep() {
        if (stopped) return;
        if (manager.deleteDevices()) removed();
        schedule();
    }
    // The next sweep: at the next expiry (at most one period away), none for an empty table.
    void schedule() {
        const auto next = manager.ssdpDeviceMap.nextExpiry();
        if (!next) {
            armed = false;
            return;
        }
        // An entry exactly at the expiry stays: wake just after it.
        const auto untilExpiry =
            std::chrono::ceil<std::chrono::milliseconds>(*next - manager.clock().now()) + std::chrono::milliseconds(1);
        arm(std::clamp(untilExpiry, std::chrono::milliseconds(1), period));
    }
    void arm(std::chrono::milliseconds wait) {
        armed = true;
        const unsigned generation = ++generation_;
        timer.expires_after(wait);
        timer.async_wait([self = shared_from_this(), generation](const std::error_code& error) {
            if (error || self->stopped || generation != self->generation_) return;
            self->sweep();
        });
    }
    // A device is about to be stored (the hook runs before the table changes, perhaps on
    // another thread): an idle sweep starts again. The table may still look empty here; the
    // device heard now expires one expiry from now, so the sweep looks again just after that.
    void deviceHeard() {
        if (stopped || armed) return;
        if (manager.ssdpDeviceMap.nextExpiry()) {
            schedule();
        } else {
            const auto untilExpiry =
                std::chrono::ceil<std::chrono::milliseconds>(manager.ssdpDeviceMap.expiry()) + std::chrono::milliseconds(1);
            arm(std::clamp(untilExpiry, std::chrono::milliseconds(1), period));
        }
    }
    void stop() {
        stopped = true;
        ++generation_;
        timer.cancel();
    }

    asio::steady_timer timer;
    SsdpDeviceManager& manager;
    const std::chrono::milliseconds period;
    const std::function<void()> removed;
    bool armed = false;
    bool stopped = false;
    unsigned generation_ = 0;
};

WlanDeviceDelete::WlanDeviceDelete(EventLoop& loop) : WlanDeviceDelete(loop, SsdpDeviceManager::instance()) {}

WlanDeviceDelete::WlanDeviceDelete(EventLoop& loop, SsdpDeviceManager& manager) : loop_(loop), manager_(manager) {}

WlanDeviceDelete::~WlanDeviceDelete() { stop(); }

void WlanDeviceDelete::detectedToDelete(std::chrono::milliseconds period) {
    if (sweep_) return;
    sweep_ = std::make_shared<Sweep>(loop_.context(), manager_, period, [this] { notifySubscribers(); });
    std::weak_ptr<Sweep> weak = sweep_;
    hookToken_ = manager_.addChangeObserver([weak](const SsdpDevice&) {
        if (auto sweep = weak.lock()) asio::post(sweep->timer.get_executor(), [sweep] { sweep->deviceHeard(); });
    });
    asio::post(sweep_->timer.get_executor(), [sweep = sweep_] { sweep->sweep(); });
}

void WlanDeviceDelete::stop() {
    if (!sweep_) return;
    manager_.removeChangeObserver(hookToken_);
    loop_.call([sweep = sweep_] { sweep->stop(); });
}

}  // namespace kesu
