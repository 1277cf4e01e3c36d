#include "preconnect/FarawayDevice.h"

#include <asio/dispatch.hpp>
#include <asio/post.hpp>
#include <asio/experimental/channel.hpp>
#include <asio/use_awaitable.hpp>

#include <atomic>
#include <cstdio>

#include "connect/PhoneLink.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Text.h"
#include "core/Utils.h"

namespace kesu {

// Writers on one link take turns: a channel of one slot is the token.
class AsyncLock {
public:
    explicit AsyncLock(const asio::any_io_executor& executor) : slot_(executor, 1) {}
    asio::awaitable<void> lock() { co_await slot_.async_send(asio::error_code{}, true, asio::use_awaitable); }
    void unlock() { slot_.try_receive([](asio::error_code, bool) {}); }

private:
    asio::experimental::channel<void(asio::error_code, bool)> slot_;
};

namespace {

std::chrono::steady_clock::time_point deadlineIn(double seconds) {
    return std::chrono::steady_clock::now() +
           std::chrono::duration_cast<std::chrono::steady_clock::duration>(std::chrono::duration<double>(seconds));
}

std::string typeName(long long type) {
    switch (type) {
    case 1: return "phone";
    case 2: return "pad";
    case 3: return "pc";
    default: return "unknowed";
    }
}

}  // namespace

Json INets::get() const { return {{"inet", inet}, {"localInet", localInet}, {"netmark", netmark}, {"ssid", ssid}}; }

void INets::set(const Json& j) {
    inet = json::str(j, "inet");
    localInet = json::str(j, "localInet");
    netmark = json::str(j, "netmark");
    ssid = json::str(j, "ssid");
}

std::string deviceKeyOf(std::string_view businessId) {
    const auto chars = text::graphemes(businessId);
    std::string key;
    char hex[3];
    for (std::size_t i = 0; i < chars.size() && i < 4; ++i)
        for (unsigned char byte : chars[i]) {
            std::snprintf(hex, sizeof hex, "%02x", byte);
            key += hex;
        }
    return key;
}

FarawayDevice::~FarawayDevice() {
    // A record dropped with its link still open (its entry gone): the link ends on its loop.
    if (client_ && !client_->isShut()) asio::post(executor_, [link = client_] { link->shut(); });
}

void FarawayDevice::setAllInfo(const Json& j) {
    Info fresh;
    fresh.userId = json::str(j, "userId");
    fresh.name = json::str(j, "name");
    fresh.bluetooth = json::str(j, "bluetooth");
    fresh.company = json::str(j, "company");
    fresh.model = json::str(j, "model");
    fresh.reportTime = json::str(j, "reportTime");
    fresh.btSwitch = static_cast<int>(json::integer(j, "btSwitch"));
    fresh.wifiSwitch = static_cast<int>(json::integer(j, "wifiSwitch"));
    const Json base = json::object(json::object(j, "bizInfo"), "conn_base");
    fresh.deviceId = deviceKeyOf(json::str(base, "businessId"));
    fresh.cloudConnectionSupported = json::boolean(base, "cloudConnectionSupported");
    fresh.ext = j.is_object() && j.contains("ext") ? j["ext"] : Json::object();
    fresh.cloudDeviceId = json::str(j, "deviceId");
    fresh.type = typeName(json::integer(j, "type"));
    for (const Json& net : json::array(j, "inets")) {
        INets one;
        one.set(net);
        fresh.iNets.push_back(std::move(one));
    }
    fresh.deviceDiscoverTime = Utils::getNowTime();
    std::lock_guard<std::mutex> lock(mutex_);
    fresh.wlanClientIp = std::move(info_.wlanClientIp);
    fresh.address = info_.address;
    info_ = std::move(fresh);
}

Json FarawayDevice::getLocalInfo() const {
    const Info d = info();
    Json local{{"userId", d.userId},
               {"deviceId", d.deviceId},
               {"type", d.type},
               {"name", d.name},
               {"bluetooth", d.bluetooth},
               {"deviceDiscoverTime", d.deviceDiscoverTime},
               {"reportTime", d.reportTime},
               {"btSwitch", d.btSwitch},
               {"wifiSwitch", d.wifiSwitch},
               {"cloudConnectionSupported", d.cloudConnectionSupported},
               {"ext", d.ext},
               {"cloudDeviceId", d.cloudDeviceId},
               {"model", d.model}};
    if (!d.iNets.empty()) {
        Json nets = Json::array();
        for (const INets& net : d.iNets) nets.push_back(net.get());
        local["inets"] = std::move(nets);
    }
    return local;
}

FarawayDevice::Info FarawayDevice::info() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return info_;
}

void FarawayDevice::updateFrom(const FarawayDevice& other) {
    if (&other == this) return;
    Info fresh = other.info();
    std::lock_guard<std::mutex> lock(mutex_);
    fresh.wlanClientIp = std::move(info_.wlanClientIp);
    info_ = std::move(fresh);
}

std::string FarawayDevice::getDeviceId() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return info_.deviceId;
}

std::string FarawayDevice::getReportTime() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return info_.reportTime;
}

std::string FarawayDevice::getWlanClientIp() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return info_.wlanClientIp;
}

bool FarawayDevice::isWlanConnectSupport() const {
    std::lock_guard<std::mutex> lock(mutex_);
    for (const INets& net : info_.iNets)
        if (!net.localInet.empty()) return true;
    return false;
}

bool FarawayDevice::isBtConnectSupport() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return !info_.bluetooth.empty();
}

void FarawayDevice::createClient(const std::string& type, const asio::any_io_executor& executor) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (client_ || type != kWlan) return;
    client_ = std::make_shared<PhoneLink>(executor);
    writeLock_ = std::make_shared<AsyncLock>(executor);
    executor_ = executor;
    ++clientId_;
    Utils::mPrintlog("[FarawayDevice::createClient] TcpSocketBase create client\xEF\xBC\x8C clientId is: " +
                     std::to_string(clientId_));
}

asio::awaitable<bool> FarawayDevice::initClient(EventLoop& loop, bool& pingRes) {
    auto pinged = std::make_shared<std::atomic<bool>>(false);
    std::shared_ptr<PhoneLink> link = getCommunicationChannel();
    const Info d = info();
    const auto& config = Config::current();
    for (const INets& net : d.iNets) {
        if (net.localInet.empty()) continue;
        if (!link || getCommunicationChannel() != link) break;  // destroyed meanwhile
        loop.offload([pinged, ip = net.localInet] { pinged->store(FarawayDevice::pingAddress(ip, 1)); });
        std::string error;
        const bool ok = co_await link->connect(net.localInet, static_cast<std::uint16_t>(config.phoneTcpPort),
                                               std::chrono::steady_clock::now() + config.preconnectConnectTimeout,
                                               error);
        if (ok) {
            link->enableKeepAlive(config.preconnectKeepAliveIdle, config.preconnectKeepAliveInterval,
                                  config.preconnectKeepAliveProbes);
            Utils::mPrintlog("[FarawayDevice::initClient] TcpSocketBase init success-----------------, id is " +
                             d.deviceId + ", ip is " + net.localInet);
            change([&](Info& i) { i.wlanClientIp = net.localInet; });
            pingRes = pinged->load();
            co_return true;
        }
        // A socket that failed to connect is not reused: the next address gets a fresh one of
        // the same generation.
        std::lock_guard<std::mutex> lock(mutex_);
        if (client_ != link) break;
        link->shut();
        client_ = link = std::make_shared<PhoneLink>(executor_);
    }
    Utils::mPrintlog("[FarawayDevice::initClient] TcpSocketBase init failed, id is " + d.deviceId);
    pingRes = pinged->load();
    co_return false;
}

asio::awaitable<bool> FarawayDevice::sendMsg(double time, Bytes data) {
    std::shared_ptr<PhoneLink> link;
    std::shared_ptr<AsyncLock> turn;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        link = client_;
        turn = writeLock_;
    }
    if (!link) {
        Utils::mPrintlog("[FarawayDevice::sendMsg] " + getDeviceId() + " socket client is nil ");
        co_return false;
    }
    const auto deadline = deadlineIn(time);
    co_await turn->lock();
    std::string error;
    const bool sent = co_await link->writeAll(data, deadline, error);
    turn->unlock();
    if (!sent) Utils::mPrintlog("[FarawayDevice::sendMsg] " + getDeviceId() + " send failed: " + error);
    co_return sent;
}

asio::awaitable<bool> FarawayDevice::recvMsg(double time, Bytes& data, int& errorCode) {
    std::shared_ptr<PhoneLink> link = getCommunicationChannel();
    if (!link) co_return false;
    switch (co_await link->readFrame(data, deadlineIn(time))) {
    case PhoneLink::Read::Frame:
        errorCode = 0;
        co_return true;
    case PhoneLink::Read::TimedOut:
        errorCode = 0;
        co_return false;
    default:
        errorCode = -1;
        co_return false;
    }
}

bool FarawayDevice::destroyClient() {
    std::shared_ptr<PhoneLink> link;
    asio::any_io_executor executor;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        link = std::move(client_);
        client_.reset();
        writeLock_.reset();
        executor = executor_;
    }
    if (!link) return true;
    asio::dispatch(executor, [link] { link->shut(); });
    Utils::mPrintlog("[FarawayDevice::destoryClient] " + getDeviceId() + " socket client destory ");
    return true;
}

std::shared_ptr<PhoneLink> FarawayDevice::getCommunicationChannel() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return client_;
}

int FarawayDevice::getClientId() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return clientId_;
}

void FarawayDevice::setClientId(int clientId) {
    std::lock_guard<std::mutex> lock(mutex_);
    clientId_ = clientId;
}

bool FarawayDevice::pingAddress(const std::string& ip, int timeout) {
    const bool ok = Utils::pingAddress(ip, timeout);
    Utils::mPrintlog("[FarawayDevice::pingAddress] Ping " + ip + (ok ? " success" : " failed"));
    return ok;
}

}  // namespace kesu
