#include "preconnect/PreConnectionStatus.h"

#include <algorithm>

#include "core/Utils.h"
#include "pcsuite/DeviceListReporter.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

bool PreconnectObserver::notify(const std::string& data) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        data_ = data;
        notifyInvoked_.store(true, std::memory_order_release);
    }
    notified_.notify_all();
    return true;
}

std::string PreconnectObserver::getData() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return data_;
}

std::string PreconnectObserver::wait(std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(mutex_);
    if (!notified_.wait_for(lock, timeout, [this] { return notifyInvoked_.load(); })) return {};
    return data_;
}

ReportPreconnectResult& ReportPreconnectResult::instance() {
    static ReportPreconnectResult* report = new ReportPreconnectResult();
    return *report;
}

void ReportPreconnectResult::addReceiptMessageObserver(const std::string& deviceId,
                                                       std::shared_ptr<PreconnectObserver> observer) {
    std::lock_guard<std::mutex> lock(observersLock_);
    m_observer_[deviceId] = std::move(observer);
}

void ReportPreconnectResult::removeReceiptMessageObserver(const std::string& deviceId) {
    std::lock_guard<std::mutex> lock(observersLock_);
    m_observer_.erase(deviceId);
}

bool ReportPreconnectResult::notify(const std::string& deviceId, const std::string& data) {
    std::lock_guard<std::mutex> lock(observersLock_);
    auto it = m_observer_.find(deviceId);
    if (it == m_observer_.end()) return false;
    return it->second->notify(data);
}

bool PreConnectionAbnormalSubscriber::eventNotify(const std::string& id) {
    std::lock_guard<std::mutex> lock(lock_);
    Utils::mPrintlog(
        "[PreConnectionAbnormalSubscriber::eventNotify] PreConnectionAbnormalNotify, connection appear abnormal id is: " +
        id);
    DeviceWaitForPreConnectManager::Entry device;
    if (!registry_.lookupDevices(id, device)) return false;
    device->disconnectPreConnect();
    ReportDevicesV2::instance().notify();
    return true;
}

PreConnectionStatusChangePublisher& PreConnectionStatusChangePublisher::instance() {
    static PreConnectionStatusChangePublisher* publisher =
        new PreConnectionStatusChangePublisher(DeviceWaitForPreConnectManager::instance());
    return *publisher;
}

PreConnectionStatusChangePublisher::PreConnectionStatusChangePublisher(DeviceWaitForPreConnectManager& registry)
    : preConnectionAbnormalSubscriber_(std::make_shared<PreConnectionAbnormalSubscriber>(registry)) {}

void PreConnectionStatusChangePublisher::notifySubscribers(const std::string& data) {
    preConnectionAbnormalSubscriber_->notify(data);
    std::vector<std::shared_ptr<IPreConnectionSubscriber>> others;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        others = others_;
    }
    for (const auto& subscriber : others) subscriber->notify(data);
}

void PreConnectionStatusChangePublisher::addSubscriber(std::shared_ptr<IPreConnectionSubscriber> subscriber) {
    std::lock_guard<std::mutex> lock(mutex_);
    others_.push_back(std::move(subscriber));
}

void PreConnectionStatusChangePublisher::removeSubscriber(const std::shared_ptr<IPreConnectionSubscriber>& subscriber) {
    std::lock_guard<std::mutex> lock(mutex_);
    others_.erase(std::remove(others_.begin(), others_.end(), subscriber), others_.end());
}

}  // namespace kesu
