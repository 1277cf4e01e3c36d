#include "preconnect/DeviceWaitForPreConnect.h"

#include <asio/co_spawn.hpp>
#include <asio/detached.hpp>
#include <asio/experimental/as_tuple.hpp>
#include <asio/post.hpp>
#include <asio/steady_timer.hpp>
#include <asio/this_coro.hpp>
#include <asio/use_awaitable.hpp>

#include <map>
#include <optional>

#include "account/DataInstance.h"
#include "core/ConnectCodes.h"
#include "connect/PhoneFrame.h"
#include "connect/PhoneLink.h"
#include "connect/Step.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Text.h"
#include "core/Log.h"
#include "platform/SystemInfo.h"
#include "pcsuite/PcsuiteRequest.h"
#include "preconnect/PreConnectionStatus.h"

namespace kesu {

namespace {

constexpr const char* kWlan = FarawayDevice::kWlan;
constexpr double kHandshakeSeconds = 3.0;
// Frames a phone may send back to back before the reader lets the loop's other work run.
constexpr int kFramesPerTurn = 16;
// The longest piece of a phone's message that goes into one log line.
constexpr std::size_t kLoggedBodyMax = 2048;

std::string forLog(const std::string& body) {
    if (body.size() <= kLoggedBodyMax) return body;
    return body.substr(0, kLoggedBodyMax) + "... (" + std::to_string(body.size()) + " bytes)";
}

double handshakeSeconds() {
    return std::chrono::duration<double>(Config::current().preconnectHandshakeTimeout).count();
}

void speedMarker(int node, const std::string& id) {
    Log::mPrintlog("[DeviceWaitForPreConnect::startPreConnect] $$[Statistical][preconnectionspeed][wlan][node" +
                     std::to_string(node) + "][" + id + "]$$");
}

// The body of a frame when it has one that is valid UTF-8.
std::optional<std::string> decodedBody(const Bytes& frame) {
    if (frame.size() <= kPhoneFrameHeaderSize) return std::nullopt;
    std::string body = phoneFrameBody(frame);
    if (!text::isValidUtf8(body)) return std::nullopt;
    return body;
}

Bytes frameOf(const Json& body, const std::string& logPrefix) {
    try {
        return buildPhoneFrame(body.dump());
    } catch (const std::exception& e) {
        Log::mPrintlog(logPrefix + e.what());
        const auto length = lenTo4Bytes(0);
        Bytes head(kPhoneFrameTag.begin(), kPhoneFrameTag.end());
        head.insert(head.end(), length.begin(), length.end());
        return head;
    }
}

}  // namespace

struct DeviceWaitForPreConnect::HeldLink {
    HeldLink(std::shared_ptr<PhoneLink> l, const asio::any_io_executor& executor)
        : link(std::move(l)), wake(executor, std::chrono::steady_clock::time_point::max()) {}
    std::shared_ptr<PhoneLink> link;
    asio::steady_timer wake;            // the consumer waits on it for the next request
    std::deque<std::string> requests;   // [24] bodies not yet answered (loop only)
    bool ended = false;
};

DeviceWaitForPreConnect::DeviceWaitForPreConnect(EventLoop& loop) : loop_(loop) {}

DeviceWaitForPreConnect::DeviceWaitForPreConnect(EventLoop& loop, std::string id,
                                                 std::shared_ptr<FarawayDevice> farawayDevice)
    : loop_(loop), id_(std::move(id)), isFarawayDiscovered_(true), farawayDevice_(std::move(farawayDevice)) {}

DeviceWaitForPreConnect::~DeviceWaitForPreConnect() = default;

std::string DeviceWaitForPreConnect::getConnectType() const {
    std::lock_guard<std::mutex> lock(stateMutex_);
    return connectType_;
}

void DeviceWaitForPreConnect::setConnectType(const std::string& type) {
    std::lock_guard<std::mutex> lock(stateMutex_);
    connectType_ = type;
}

std::shared_ptr<FarawayDevice> DeviceWaitForPreConnect::getFarawayDevice() const {
    std::lock_guard<std::mutex> lock(stateMutex_);
    return farawayDevice_;
}

void DeviceWaitForPreConnect::setFarawayDevice(std::shared_ptr<FarawayDevice> farawayDevice) {
    std::shared_ptr<FarawayDevice> old;
    {
        std::lock_guard<std::mutex> lock(stateMutex_);
        old = std::exchange(farawayDevice_, std::move(farawayDevice));
    }
    // A record replaced while it holds a link must not leave that link open unwatched.
    if (old && old != getFarawayDevice()) old->destroyClient();
}

void DeviceWaitForPreConnect::updateFarawayDeviceInfo(const FarawayDevice& farawayDevice) {
    if (auto device = getFarawayDevice()) device->updateFrom(farawayDevice);
}

void DeviceWaitForPreConnect::setIsConnected(bool value) {
    isConnected_ = value;
    if (value) return;
    // A waiter for the phone's answer checks the flag under the lock: take it once so that
    // the waiter either saw the flag or is waiting when the notice comes.
    { std::lock_guard<std::mutex> lock(messageLock_); }
    messageArrived_.notify_all();
}

void DeviceWaitForPreConnect::addConnectCount() {
    if (getConnectType() != kWlan) return;
    const int count = ++farawayCount_;
    Log::mPrintlog("[DeviceWaitForPreConnect::addConnectCount] add FARAWAYWLAN connect count, current count is: " +
                     std::to_string(count));
}

void DeviceWaitForPreConnect::reduceConnectCount() {
    int count = farawayCount_.load();
    while (count > 0 && !farawayCount_.compare_exchange_weak(count, count - 1)) {
    }
}

bool DeviceWaitForPreConnect::isFirstConnection() const { return getConnectType() == kWlan && farawayCount_ == 0; }

std::string DeviceWaitForPreConnect::getWlanDeviceIp() const {
    auto device = getFarawayDevice();
    return device ? device->getWlanClientIp() : std::string();
}

bool DeviceWaitForPreConnect::isPcSameWlan() const {
    auto device = getFarawayDevice();
    if (!device) return false;
    const std::string ssid = SystemInfo::SsidWifiName();
    for (const INets& net : device->info().iNets)
        if (net.ssid == ssid) return true;
    return false;
}

Json DeviceWaitForPreConnect::getPcsuiteDeviceInfo() const {
    auto device = getFarawayDevice();
    const Json local = device ? device->getLocalInfo() : Json::object();
    return {{"isConnected", isConnected_.load()},
            {"connectType", getConnectType()},
            {"discoveryType", isFarawayDiscovered_ ? "faraway" : ""},
            {"deviceName", json::str(local, "name")},
            {"id", json::str(local, "deviceId")},
            {"openId", json::str(local, "userId")},
            {"account", dataInstance().get(&databaseParam::Phone)},
            {"deviceType", json::str(local, "type")},
            {"reportTime", json::str(local, "reportTime")},
            {"rssi", -99},
            {"btSwitch", json::integer(local, "btSwitch")},
            {"wifiSwitch", json::integer(local, "wifiSwitch")},
            {"inets", local.contains("inets") ? local["inets"] : Json()},
            {"cloudConnectionSupported", json::boolean(local, "cloudConnectionSupported")},
            {"ext", local.contains("ext") ? local["ext"] : Json()},
            {"cloudDeviceId", json::str(local, "cloudDeviceId")},
            {"preconnectTryNumber", preconnectTryNumber_.load()},
            {"bluetooth", json::str(local, "bluetooth")},
            {"model", json::str(local, "model")}};
}

// ---- Frames ------------------------------------------------------------------------------

bool DeviceWaitForPreConnect::isKind(const std::string& body, int tag) {
    return body.find("\"bytes\":[" + std::to_string(tag) + "]") != std::string::npos;
}

Json DeviceWaitForPreConnect::envelope(int tag) const {
    const databaseParam account = dataInstance().get();
    return {{"bytes", {tag}},
            {"deviceName", SystemInfo::getLocalName()},
            {"channel", 0},
            {"id", 87654321},
            {"open_Id", account.openid},
            {"service_id", rawValue(serviceId::pcsuiteId)},
            {"target_id", SystemInfo::getMacAddress()},
            {"account", account.Phone},
            {"type", 1}};
}

void DeviceWaitForPreConnect::DeviceInfoDataBuild(Bytes& data, int& length, const std::string& connectType) const {
    if (connectType != kWlan) return;
    data = frameOf(envelope(rawValue(ConnectTag::DEVICEINFOREQUEST)), "[ConnectFlow::wlanBuildSendData] Error occur as: ");
    length = static_cast<int>(data.size());
}

void DeviceWaitForPreConnect::responseDataBuild(const std::string& cmd, int code, const std::string& /*reqId*/,
                                                Bytes& data, int& length) const {
    if (getConnectType() != kWlan) return;
    Json body = envelope(code);
    body["extra_info"] = cmd;
    Log::mPrintlog("[DeviceWaitForPreConnect::responseDataBuild] responseData is: " + json::compact(body));
    data = frameOf(body, "[DeviceWaitForPreConnect::responseDataBuild] Error occur as: ");
    length = static_cast<int>(data.size());
}

bool DeviceWaitForPreConnect::DeviceInfoDataParser(const Bytes& data, const std::string& connectType) {
    const auto body = decodedBody(data);
    if (!body) {
        Log::mPrintlog("[DeviceWaitForPreConnect::DeviceInfoDataParser] reply has no readable body");
        return false;
    }
    Log::mPrintlog("[DeviceWaitForPreConnect::DeviceInfoDataParser] FARAWAYWLAN recv data is: " + forLog(*body) +
                     " ");
    if (connectType != kWlan || !isKind(*body, rawValue(ConnectTag::DEVICEINFORESPONSE))) return false;
    const auto reply = json::parse(*body);
    if (!reply || !reply->is_object()) {
        Log::mPrintlog("[DeviceWaitForPreConnect::DeviceInfoDataParser] reply is not a JSON object");
        return false;
    }
    bool accepted = true;
    if (json::str(*reply, "open_Id") != dataInstance().get(&databaseParam::openid)) {
        Log::mPrintlog("[DeviceWaitForPreConnect::DeviceInfoDataParser] mobile device openId is different of PC ");
        isOpenIdSame_ = false;
        accepted = false;
    } else {
        isOpenIdSame_ = true;
    }
    const auto device = getFarawayDevice();
    if (!device || deviceKeyOf(json::str(*reply, "target_id")) != device->getDeviceId()) accepted = false;
    return accepted;
}

// ---- Step trace --------------------------------------------------------------------------

void DeviceWaitForPreConnect::preConnectStepBuild(bool result, const std::string& stepStr,
                                                  const std::string& connectType) {
    const Step& step = sharedStep();
    const StepStruct* which = nullptr;
    if (stepStr == "PING_ADDRESS") {
        which = &step.OS4_WLAN_PING_ADDRESS;
    } else if (result || connectType != kWlan) {
        return;
    } else if (stepStr == "CONNECT_ADDRESS") {
        which = &step.OS4_WLAN_CONNECT_ADDRESS;
    } else if (stepStr == "SEND_DEVICE_INFO") {
        which = &step.OS4_WLAN_SEND_DEVICE_INFO;
    } else if (stepStr == "RECV_DEVICE_INFO") {
        which = &step.OS4_WLAN_RECV_DEVICE_INFO;
    } else if (stepStr == "PARSER_DEVICE_INFO") {
        which = &step.OS4_WLAN_PARSER_DEVICE_INFO;
    } else {
        return;
    }
    const std::string entry =
        step.getConnectCodeV2(*which) + step.getConnectResult(*which, result ? Result::OK : Result::FAILED);
    std::lock_guard<std::mutex> lock(stateMutex_);
    preConnectSteps_ += preConnectSteps_.empty() ? entry : "_" + entry;
}

std::string DeviceWaitForPreConnect::getPreConnectStep() const {
    std::lock_guard<std::mutex> lock(stateMutex_);
    return preConnectSteps_;
}

void DeviceWaitForPreConnect::setPreConnectStep(const std::string& steps) {
    std::lock_guard<std::mutex> lock(stateMutex_);
    preConnectSteps_ = steps;
}

// ---- The handshake -----------------------------------------------------------------------

asio::awaitable<bool> DeviceWaitForPreConnect::startPreConnect() {
    auto self = shared_from_this();
    const std::string type = getConnectType();
    const auto device = getFarawayDevice();
    if (type != kWlan) co_return false;
    if (!device) {
        Log::mPrintlog("[DeviceWaitForPreConnect::startPreConnect] " + id_ + " has no device record");
        co_return false;
    }
    // A request to end an earlier link does not apply to the one made now.
    isDisconnectNow_ = false;
    const auto nets = device->info().iNets;
    Log::mPrintlog("[DeviceWaitForPreConnect::startPreConnect] preConnect type is: " + type + ", deviceId is: " +
                     id_ + ", device ip: " + (nets.empty() ? std::string("nil") : nets.front().localInet));
    const auto executor = co_await asio::this_coro::executor;
    device->createClient(type, executor);
    speedMarker(0, id_);

    bool pinged = false;
    const bool ok = co_await device->initClient(loop_, pinged);
    preConnectStepBuild(pinged, "PING_ADDRESS", type);
    preConnectStepBuild(ok, "CONNECT_ADDRESS", type);
    if (!ok) co_return false;

    speedMarker(1, id_);
    Bytes request;
    int length = 0;
    DeviceInfoDataBuild(request, length, type);
    const bool sent = co_await device->sendMsg(handshakeSeconds(), std::move(request));
    preConnectStepBuild(sent, "SEND_DEVICE_INFO", type);
    speedMarker(2, id_);
    if (!sent) co_return false;

    Bytes reply;
    int error = 0;
    const bool got = co_await device->recvMsg(handshakeSeconds(), reply, error);
    preConnectStepBuild(got, "RECV_DEVICE_INFO", type);
    if (!got) co_return false;

    speedMarker(3, id_);
    const bool parsed = DeviceInfoDataParser(reply, type);
    if (parsed) speedMarker(4, id_);
    preConnectStepBuild(parsed, "PARSER_DEVICE_INFO", type);
    if (!parsed) co_return false;

    const auto link = device->getCommunicationChannel();
    if (!link || link->isShut()) co_return false;
    auto held = std::make_shared<HeldLink>(link, executor);
    {
        std::lock_guard<std::mutex> lock(messageLock_);
        heldLinkEnded_ = false;
    }
    asio::co_spawn(executor, recvMessageAndHeartbeatLoop(device->getClientId(), held), asio::detached);
    asio::co_spawn(executor, consumeMessageLoop(held), asio::detached);
    co_return true;
}

void DeviceWaitForPreConnect::disconnectPreConnect() {
    Log::mPrintlog("[DeviceWaitForPreConnect::disconnectPreConnect] Disconnect one device preconnect, device id: " +
                     id_ + "...");
    if (auto device = getFarawayDevice()) device->destroyClient();
    isConnected_ = false;
    isDisconnectNow_ = false;
    setConnectType("");
    resetConnectCount();
}

void DeviceWaitForPreConnect::setIsDisconnectNow(bool value) {
    isDisconnectNow_ = value;
    if (!value) return;
    // The held link's reader waits without a deadline: end the link so that it sees the request.
    auto device = getFarawayDevice();
    if (auto link = device ? device->getCommunicationChannel() : nullptr)
        asio::post(loop_.executor(), [link] { link->shut(); });
}

// ---- The held link -----------------------------------------------------------------------

asio::awaitable<void> DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop(int clientId,
                                                                          std::shared_ptr<HeldLink> held) {
    auto self = shared_from_this();
    const auto executor = co_await asio::this_coro::executor;
    const std::size_t maxPending = std::max<std::size_t>(1, Config::current().preconnectMaxPendingRequests);
    int inTurn = 0;
    while (!isDisconnectNow_) {
        Bytes frame;
        if (co_await held->link->readFrame(frame, PhoneLink::kNoDeadline) != PhoneLink::Read::Frame) break;
        if (auto body = decodedBody(frame)) {
            Log::mPrintlog("[DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop] "
                             "[INTERACTION][MOBILEPHONE_TO_CONNSERVER] id " +
                             id_ + " FARAWAYWLAN recv data is: " + forLog(*body));
            if (isKind(*body, rawValue(ConnectTag::MOBILECONNECTPCREQUEST))) {
                Log::mPrintlog("[DeviceWaitForPreConnect::consumeMessageLoop] pc recv mobile_ask_connect_pc request ...");
                if (held->requests.size() >= maxPending) {
                    Log::mPrintlog("[DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop] id " + id_ +
                                     " too many requests waiting, the oldest is dropped");
                    held->requests.pop_front();
                }
                held->requests.push_back(std::move(*body));
                held->wake.cancel();
            } else {
                queueMessage(std::move(frame));
            }
        } else {
            Log::mPrintlog("[DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop] id " + id_ +
                             " dropped a frame without a readable body");
        }
        if (++inTurn == kFramesPerTurn) {  // a phone that floods must not hold the loop
            inTurn = 0;
            co_await asio::post(executor, asio::use_awaitable);
        }
    }
    held->ended = true;
    held->wake.cancel();
    held->link->shut();

    const auto device = getFarawayDevice();
    const std::string deviceId = device ? device->getDeviceId() : std::string();
    if (!device || device->getClientId() == clientId) {  // not when a newer link is held already
        {
            std::lock_guard<std::mutex> lock(messageLock_);
            heldLinkEnded_ = true;
        }
        messageArrived_.notify_all();
    }
    Log::mPrintlog("[DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop] device " + deviceId +
                     " heartbeat is alnormal");
    Log::mPrintlog("[DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop] recvMessageAndHeartbeatLoop is ready to quit");
    if (device && device->getClientId() == clientId) {
        Log::mPrintlog("[DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop] client id is same, notify to destory client");
        PreConnectionStatusChangePublisher::instance().notifySubscribers(deviceId);
    } else {
        Log::mPrintlog("[DeviceWaitForPreConnect::recvMessageAndHeartbeatLoop] client id is not same, client have "
                         "changed....do nothing");
    }
}

asio::awaitable<void> DeviceWaitForPreConnect::consumeMessageLoop(std::shared_ptr<HeldLink> held) {
    auto self = shared_from_this();
    for (;;) {
        while (!held->ended && !held->requests.empty()) {
            std::string body = std::move(held->requests.front());
            held->requests.pop_front();
            co_await mobileAskConnectPC(std::move(body));
        }
        if (held->ended) co_return;
        held->wake.expires_at(std::chrono::steady_clock::time_point::max());
        co_await held->wake.async_wait(asio::experimental::as_tuple(asio::use_awaitable));
    }
}

asio::awaitable<void> DeviceWaitForPreConnect::mobileAskConnectPC(std::string data) {
    (void)data;  // the phone's request carries nothing the PC suite needs
    if (getConnectType() != kWlan) co_return;
    const auto device = getFarawayDevice();
    if (!device) co_return;
    Log::mPrintlog("[DeviceWaitForPreConnect::mobileAskConnectPC] pc recv wlan_mobile_ask_connect_pc request ...");
    Bytes ack;
    int length = 0;
    responseDataBuild("", rawValue(ConnectTag::MOBILECONNECTPCRESPONSE), "", ack, length);
    co_await device->sendMsg(kHandshakeSeconds, std::move(ack));

    const std::map<std::string, std::string> request{
        {"requestSource", "preconnect"}, {"eventId", "12345678"}, {"deviceId", id_}};
    Log::mPrintlog("[DeviceWaitForPreConnect::mobileAskConnectPC] [INTERACTION][CONNSERVER_TO_PCSUITE] connect device "
                     "request data = " +
                     json::compact(Json(request)) + " \n");
    auto ask = [request] { return PcsuiteRequest::startConnectPreDevice(request); };
    const std::optional<Json> reply = co_await loop_.runBlocking(std::move(ask));
    Json result = Json::object();
    if (reply) {
        if (const auto outcome = PcsuiteRequest::connectDeviceOutcome(*reply))
            result = {{"retCode", outcome->code}, {"retMsg", outcome->reason}};
    } else {
        Log::mPrintlog("[DeviceWaitForPreConnect::mobileAskConnectPC] connect device failed \n");
    }
    Bytes outcome;
    responseDataBuild(json::compact(result), rawValue(ConnectTag::MOBILECONNECTPCRESULT), "", outcome, length);
    co_await device->sendMsg(kHandshakeSeconds, std::move(outcome));
}

// ---- The queue of the phone's frames -----------------------------------------------------

void DeviceWaitForPreConnect::queueMessage(Bytes frame) {
    const auto& config = Config::current();
    const auto now = std::chrono::steady_clock::now();
    std::lock_guard<std::mutex> lock(messageLock_);
    queuedBytes_ += frame.size();
    messageQueue_.push_back({std::move(frame), now});
    std::size_t dropped = 0;
    while (messageQueue_.size() > 1 &&
           (messageQueue_.size() > config.preconnectQueueMaxFrames || queuedBytes_ > config.preconnectQueueMaxBytes ||
            now - messageQueue_.front().at > config.preconnectQueueMaxAge)) {
        queuedBytes_ -= messageQueue_.front().frame.size();
        messageQueue_.pop_front();
        ++dropped;
    }
    if (dropped > 0)
        Log::mPrintlog("[DeviceWaitForPreConnect::queueMessage] id " + id_ + " message queue full, dropped the " +
                         std::to_string(dropped) + " oldest frame(s)");
    messageArrived_.notify_all();
}

bool DeviceWaitForPreConnect::takeOldestLocked(Bytes& data) {
    const auto oldest = std::chrono::steady_clock::now() - Config::current().preconnectQueueMaxAge;
    while (!messageQueue_.empty() && messageQueue_.front().at < oldest) {
        queuedBytes_ -= messageQueue_.front().frame.size();
        messageQueue_.pop_front();
    }
    if (messageQueue_.empty()) return false;
    queuedBytes_ -= messageQueue_.front().frame.size();
    data = std::move(messageQueue_.front().frame);
    messageQueue_.pop_front();
    return true;
}

bool DeviceWaitForPreConnect::getQueueMessage(Bytes& data) {
    std::lock_guard<std::mutex> lock(messageLock_);
    return takeOldestLocked(data);
}

bool DeviceWaitForPreConnect::waitQueueMessage(Bytes& data, std::chrono::steady_clock::time_point deadline) {
    std::unique_lock<std::mutex> lock(messageLock_);
    for (;;) {
        if (takeOldestLocked(data)) return true;
        if (!isConnected_ || heldLinkEnded_) return false;
        if (messageArrived_.wait_until(lock, deadline) == std::cv_status::timeout) return takeOldestLocked(data);
    }
}

void DeviceWaitForPreConnect::clearQueueMessage() {
    std::lock_guard<std::mutex> lock(messageLock_);
    messageQueue_.clear();
    queuedBytes_ = 0;
}

std::size_t DeviceWaitForPreConnect::queuedMessages() const {
    std::lock_guard<std::mutex> lock(messageLock_);
    return messageQueue_.size();
}

}  // namespace kesu
