// A phone or pad of the signed-in account as the cloud lists it: its identity, its address
// sets, and the one TCP link (on the event loop) over which it is kept pre-connected.
#pragma once

#include <asio/any_io_executor.hpp>
#include <asio/awaitable.hpp>

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "connect/ISocketBase.h"
#include "core/Json.h"

namespace kesu {

class EventLoop;
class PhoneLink;
class AsyncLock;

// One address set of a device (one of its network interfaces as it reported it).
struct INets {
    std::string inet;
    std::string localInet;  // the only field used to connect
    std::string netmark;
    std::string ssid;

    Json get() const;
    void set(const Json& j);
    bool operator==(const INets&) const = default;
};

// The device key: the first 4 characters of a business id, each UTF-8 byte as two lower-case
// hexadecimal digits ("ab" gives "6162").
std::string deviceKeyOf(std::string_view businessId);

class FarawayDevice {
public:
    static constexpr const char* kWlan = "FARAWAYWLAN";

    // The record's data; a snapshot is handed out whole (the record is shared between threads).
    struct Info {
        std::string userId;
        std::string deviceId;
        std::string type;
        std::string name;
        std::string bluetooth;
        std::string company;
        std::string model;
        std::string wlanClientIp;
        std::string reportTime;
        std::vector<INets> iNets;
        std::uint64_t address = 0;
        std::string deviceDiscoverTime;
        int btSwitch = 2;
        int wifiSwitch = 2;
        bool cloudConnectionSupported = false;
        Json ext = Json::object();
        std::string cloudDeviceId;
    };

    FarawayDevice() = default;
    ~FarawayDevice();
    FarawayDevice(const FarawayDevice&) = delete;
    FarawayDevice& operator=(const FarawayDevice&) = delete;

    // Fills the record from one element of the cloud device list.
    void setAllInfo(const Json& j);
    Json getLocalInfo() const;
    Info info() const;
    // Takes the cloud's fields of `other` (its report time included: a newer report must
    // count as newer once only, and the candidates are ranked by it); wlanClientIp and the
    // link stay.
    void updateFrom(const FarawayDevice& other);
    // Changes the data in place (tests and the registry's merge).
    template <class F>
    void change(F&& fn) {
        std::lock_guard<std::mutex> lock(mutex_);
        fn(info_);
    }

    std::string getDeviceId() const;
    std::string getReportTime() const;
    std::string getWlanClientIp() const;
    bool isWlanConnectSupport() const;
    bool isBtConnectSupport() const;

    // ---- The link. createClient, initClient, sendMsg and recvMsg run on the event loop
    // that `executor` belongs to; destroyClient and the accessors from any thread.
    // A new link object of the next generation when none is held and `type` is FARAWAYWLAN.
    void createClient(const std::string& type, const asio::any_io_executor& executor);
    // Connects to the first address set that accepts the phone port in time, pinging it on
    // the loop's pool meanwhile; `pingRes` is the ping's outcome when the connect ended.
    asio::awaitable<bool> initClient(EventLoop& loop, bool& pingRes);
    // Writes one frame; writers on one link take turns.
    asio::awaitable<bool> sendMsg(double time, Bytes data);
    // Reads the next frame; errorCode -1 when the link is down.
    asio::awaitable<bool> recvMsg(double time, Bytes& data, int& errorCode);
    // Closes the link (when there is one); always true. clientId keeps its value.
    bool destroyClient();
    std::shared_ptr<PhoneLink> getCommunicationChannel() const;
    int getClientId() const;
    void setClientId(int clientId);

    static bool pingAddress(const std::string& ip, int timeout);

private:
    mutable std::mutex mutex_;
    Info info_;
    std::shared_ptr<PhoneLink> client_;
    std::shared_ptr<AsyncLock> writeLock_;
    asio::any_io_executor executor_;
    int clientId_ = 0;
};

}  // namespace kesu
