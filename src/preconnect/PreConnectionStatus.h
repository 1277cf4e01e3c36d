// The two channels of pre-connection outcomes: ReportPreconnectResult hands the outcome of an
// attempt ("success" or "failed") to whoever waits for that device, and
// PreConnectionStatusChangePublisher carries the abnormal end of a held link to the
// subscriber that tears the entry down.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace kesu {

class DeviceWaitForPreConnectManager;

// One waiter for the outcome of one device's attempt.
class PreconnectObserver {
public:
    explicit PreconnectObserver(std::string deviceId) : deviceId_(std::move(deviceId)) {}
    bool notify(const std::string& data);
    bool isInvoked() const { return notifyInvoked_.load(std::memory_order_acquire); }
    std::string getData() const;
    const std::string& getDeviceId() const { return deviceId_; }
    // Waits for the outcome; "" when none came in time.
    std::string wait(std::chrono::milliseconds timeout) const;

private:
    mutable std::mutex mutex_;
    mutable std::condition_variable notified_;
    std::atomic<bool> notifyInvoked_{false};
    std::string data_;
    const std::string deviceId_;
};

class ReportPreconnectResult {
public:
    static ReportPreconnectResult& instance();

    // One waiter per device: a second registration replaces the first.
    void addReceiptMessageObserver(const std::string& deviceId, std::shared_ptr<PreconnectObserver> observer);
    void removeReceiptMessageObserver(const std::string& deviceId);
    // Hands `data` to the waiter of the device, if there is one.
    bool notify(const std::string& deviceId, const std::string& data);

private:
    std::mutex observersLock_;
    std::map<std::string, std::shared_ptr<PreconnectObserver>> m_observer_;
};

class IPreConnectionSubscriber {
public:
    virtual ~IPreConnectionSubscriber() = default;
    virtual void notify() {}
    virtual void notify(const std::string& /*data*/) {}
};

// Tears down the entry whose held link ended and refreshes the device reports. Every notice
// is handled (none is dropped while another is handled: each concerns its own device).
class PreConnectionAbnormalSubscriber : public IPreConnectionSubscriber {
public:
    explicit PreConnectionAbnormalSubscriber(DeviceWaitForPreConnectManager& registry) : registry_(registry) {}
    void notify(const std::string& data) override { eventNotify(data); }
    bool eventNotify(const std::string& id);

private:
    DeviceWaitForPreConnectManager& registry_;
    std::mutex lock_;
};

class PreConnectionStatusChangePublisher {
public:
    // With the abnormal subscriber of the registry's instance().
    static PreConnectionStatusChangePublisher& instance();
    explicit PreConnectionStatusChangePublisher(DeviceWaitForPreConnectManager& registry);

    // `data` is the device key of the link that ended.
    void notifySubscribers(const std::string& data);
    // Further listeners (tests, the scheduler's owner); removed by the same pointer.
    void addSubscriber(std::shared_ptr<IPreConnectionSubscriber> subscriber);
    void removeSubscriber(const std::shared_ptr<IPreConnectionSubscriber>& subscriber);

private:
    std::shared_ptr<PreConnectionAbnormalSubscriber> preConnectionAbnormalSubscriber_;
    std::mutex mutex_;
    std::vector<std::shared_ptr<IPreConnectionSubscriber>> others_;
};

}  // namespace kesu
