// One phone or pad of the account waiting for, or holding, a pre-connection: the handshake
// over its FarawayDevice's link, then the held link, read by one coroutine on the event loop
// that queues the phone's frames for the connect flow and answers the phone's requests to be
// connected to the PC. An idle held link costs no wake-ups.
#pragma once

#include <asio/awaitable.hpp>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>
#include <string>

#include "preconnect/FarawayDevice.h"
#include "preconnect/IDeviceWaitForPreConnect.h"

namespace kesu {

class EventLoop;
class PhoneLink;

class DeviceWaitForPreConnect final : public IDeviceWaitForPreConnect,
                                      public std::enable_shared_from_this<DeviceWaitForPreConnect> {
public:
    // The entry works on `loop` (its link, its pool for ping and the PC suite requests).
    explicit DeviceWaitForPreConnect(EventLoop& loop);
    DeviceWaitForPreConnect(EventLoop& loop, std::string id, std::shared_ptr<FarawayDevice> farawayDevice);
    ~DeviceWaitForPreConnect() override;

    std::string getConnectType() const override;
    void setConnectType(const std::string& type) override;
    // The handshake; on the loop, called by the scheduler only. On success the held link's
    // reader runs until the link breaks.
    asio::awaitable<bool> startPreConnect() override;
    void disconnectPreConnect() override;
    void setFarawayDevice(std::shared_ptr<FarawayDevice> farawayDevice) override;
    void updateFarawayDeviceInfo(const FarawayDevice& farawayDevice) override;
    std::shared_ptr<FarawayDevice> getFarawayDevice() const override;
    bool getIsFarawayDiscovered() const override { return isFarawayDiscovered_; }
    void setIsFarawayDiscovered(bool value) override { isFarawayDiscovered_ = value; }
    bool getIsConnected() const override { return isConnected_; }
    void setIsConnected(bool value) override;
    int getFarawayWlanConnectCount() const override { return farawayCount_; }
    void setFarawayWlanConnectCount(int count) override { farawayCount_ = count; }
    void addConnectCount() override;
    void reduceConnectCount() override;
    void resetConnectCount() override { farawayCount_ = 0; }
    std::string getDeviceId() const override { return id_; }
    Json getPcsuiteDeviceInfo() const override;
    std::string getWlanDeviceIp() const override;

    // The [22] request frame into `data` (nothing for another connect type).
    void DeviceInfoDataBuild(Bytes& data, int& length, const std::string& connectType) const;
    // Checks the phone's [23] reply: its kind, its account and its device key.
    bool DeviceInfoDataParser(const Bytes& data, const std::string& connectType);
    // The frame of a response with tag `code` and "extra_info" `cmd`.
    void responseDataBuild(const std::string& cmd, int code, const std::string& reqId, Bytes& data, int& length) const;

    // The oldest frame the phone sent on the held link (not a request to connect).
    bool getQueueMessage(Bytes& data) override;
    bool waitQueueMessage(Bytes& data, std::chrono::steady_clock::time_point deadline) override;
    void clearQueueMessage() override;
    std::size_t queuedMessages() const;

    bool getIsDisconnectNow() const override { return isDisconnectNow_; }
    void setIsDisconnectNow(bool value) override;
    bool isFirstConnection() const override;
    void preConnectStepBuild(bool result, const std::string& stepStr, const std::string& connectType);
    std::string getPreConnectStep() const override;
    void setPreConnectStep(const std::string& steps) override;
    bool getIsOpenIdSame() const override { return isOpenIdSame_; }
    void setIsOpenIdSame(bool value) override { isOpenIdSame_ = value; }
    bool isPcSameWlan() const override;
    bool getFirstConnect() const override { return firstConnect_; }
    void setFirstConnect(bool value) override { firstConnect_ = value; }
    std::string getReportTime() const override { return {}; }
    int getPreconnectTryNumber() const override { return preconnectTryNumber_; }
    void addPreconnectTryNumber() override { ++preconnectTryNumber_; }

    // True when `body` is of kind `tag`: it holds "bytes":[tag] exactly so, without blanks.
    static bool isKind(const std::string& body, int tag);

private:
    struct HeldLink;
    // Reads the held link until it breaks; queues the phone's frames, hands its requests to
    // the consumer, and publishes the abnormal end when the link is still this generation's.
    asio::awaitable<void> recvMessageAndHeartbeatLoop(int clientId, std::shared_ptr<HeldLink> held);
    // Answers the phone's requests of one held link, one after the other.
    asio::awaitable<void> consumeMessageLoop(std::shared_ptr<HeldLink> held);
    // One [24] request: [25] at once, then the PC suite's answer as [27].
    asio::awaitable<void> mobileAskConnectPC(std::string data);
    void queueMessage(Bytes frame);
    // The oldest frame young enough to be an answer; under messageLock_.
    bool takeOldestLocked(Bytes& data);
    Json envelope(int tag) const;

    EventLoop& loop_;
    const std::string id_;
    std::atomic<bool> isFarawayDiscovered_{false};
    std::atomic<int> farawayCount_{0};
    std::atomic<bool> isConnected_{false};
    std::atomic<bool> isDisconnectNow_{false};
    std::atomic<bool> isOpenIdSame_{true};
    std::atomic<bool> firstConnect_{true};
    std::atomic<int> preconnectTryNumber_{0};

    mutable std::mutex stateMutex_;  // connectType_, farawayDevice_, preConnectSteps_
    std::string connectType_;
    std::shared_ptr<FarawayDevice> farawayDevice_;
    std::string preConnectSteps_;

    struct Queued {
        Bytes frame;
        std::chrono::steady_clock::time_point at;
    };
    mutable std::mutex messageLock_;
    std::condition_variable messageArrived_;  // a frame queued, the link ended or was let go
    std::deque<Queued> messageQueue_;
    std::size_t queuedBytes_ = 0;
    bool heldLinkEnded_ = true;  // guarded by messageLock_
};

}  // namespace kesu
