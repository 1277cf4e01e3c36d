#include "discovery/KesuAdapterManager.h"

#include <asio/steady_timer.hpp>
#include <chrono>

#include "account/DataInstance.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Json.h"
#include "core/Log.h"
#include "platform/SystemInfo.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/SsdpMessage.h"
#include "events/EventPublisher.h"

namespace kesu {

namespace {

const std::string kWifi = "Wi-Fi";
const std::string kEthernet = "Ethernet";

void publish(ServiceEvent event) { EventPublisher::instance().notifySubscribers(event); }

std::string interfaceOf(const std::string& kind, const std::string& wifiName, const std::string& ethernetName) {
    return kind == kWifi ? wifiName : ethernetName;
}

SsdpSocket::Receiver classifyInto(SsdpDeviceManager& devices, SsdpSocket::Receiver receiver) {
    if (receiver) return receiver;
    return [&devices](std::string_view data, const std::string& host, std::uint16_t) {
        SsdpMessage::handleDatagram(data, host, devices);
    };
}

}  // namespace

// A socket waiting out the rebuild pause before it opens again.
struct KesuAdapterManager::Rebuild {
    explicit Rebuild(asio::io_context& io) : timer(io) {}
    asio::steady_timer timer;
};

KesuAdapterManager::KesuAdapterManager(EventLoop& loop) : KesuAdapterManager(loop, SsdpDeviceManager::instance()) {}

KesuAdapterManager::KesuAdapterManager(EventLoop& loop, SsdpDeviceManager& devices, SsdpSocket::Receiver receiver)
    : loop_(loop), devices_(devices), receiver_(classifyInto(devices, std::move(receiver))) {
    // Nothing on the loop knows the monitor yet: the first sockets open here, on the
    // constructing thread.
    createSockets();
}

KesuAdapterManager::~KesuAdapterManager() {
    loop_.call([this] {
        shutdownNow();
        alive_.reset();
    });
}

void KesuAdapterManager::createAdapterSocket() {
    loop_.call([this] { createSockets(); });
}

void KesuAdapterManager::checkNetWorkStatus() {
    loop_.call([this] { check(); });
}

void KesuAdapterManager::sendSsdp() {
    loop_.call([this] { announce(); });
}

void KesuAdapterManager::shutdown() {
    loop_.call([this] { shutdownNow(); });
}

bool KesuAdapterManager::isActive() {
    return loop_.call([this] { return active_; }).value_or(false);
}

std::vector<std::string> KesuAdapterManager::socketInterfaces() {
    return loop_
        .call([this] {
            std::vector<std::string> names;
            for (const auto& entry : ssdpManager) names.push_back(entry.first);
            return names;
        })
        .value_or(std::vector<std::string>());
}

std::shared_ptr<SsdpSocketManager> KesuAdapterManager::managerFor(const std::string& interfaceName) {
    return loop_
        .call([this, &interfaceName] {
            const auto it = ssdpManager.find(interfaceName);
            return it == ssdpManager.end() ? nullptr : it->second;
        })
        .value_or(nullptr);
}

std::map<std::string, std::string> KesuAdapterManager::networkStatus() {
    return loop_.call([this] { return netStatus; }).value_or(std::map<std::string, std::string>());
}

bool KesuAdapterManager::isWiFiEnabled() { return SystemInfo::SsidWifiCondition(); }

// ---- On the loop ---------------------------------------------------------------------------

void KesuAdapterManager::createSockets() {
    const std::map<std::string, std::string> snapshot = SystemInfo::getNetworkCorrespondAddress();
    const std::string wifiName = SystemInfo::GetWifiName();
    const std::string ethernetName = SystemInfo::GetEthernetName();
    netStatus = snapshot;
    active_ = true;
    // The first "blocked socket" check comes a whole time-out after the start.
    devices_.markOwnEcho();
    Log::mPrintlog(" [netcard status] Currently network card status:" + json::pretty(Json(snapshot)));
    for (const auto& [kind, address] : snapshot) {
        if (kind != kWifi && kind != kEthernet) continue;
        addSocket(kind, interfaceOf(kind, wifiName, ethernetName));
    }
}

void KesuAdapterManager::check() {
    // 1. Wi-Fi power.
    const bool wifiOn = isWiFiEnabled();
    if (wifiOn != wifiSwitch) {
        wifiSwitch = !wifiSwitch;
        publish(wifiOn ? ServiceEvent::WifiOpen : ServiceEvent::WifiClose);
    }

    // 2. The current snapshot and the interface names of this moment.
    const std::map<std::string, std::string> current = SystemInfo::getNetworkCorrespondAddress();
    const std::string wifiName = SystemInfo::GetWifiName();
    const std::string ethernetName = SystemInfo::GetEthernetName();
    const std::map<std::string, std::string> previous = netStatus;
    const bool echoTimedOut =
        devices_.clock().now() - devices_.lastOwnEcho() > Config::current().ssdpSelfEchoTimeout;
    bool timedOut = false;

    // 3. Adapters added, readdressed, or silent.
    for (const auto& [kind, address] : current) {
        if (kind != kWifi && kind != kEthernet) continue;
        const std::string name = interfaceOf(kind, wifiName, ethernetName);
        const bool isWifi = kind == kWifi;
        const auto known = previous.find(kind);

        if (known == previous.end()) {
            statusLine(current);
            Log::mPrintlog("[checkNetWorkStatus] adapter add \n");
            publish(ServiceEvent::NetworkChange);
            addSocket(kind, name);
            logInterface(kind, name);
            publish(isWifi ? ServiceEvent::WlanNetConnect : ServiceEvent::WiredNetConnect);
            continue;
        }

        if (known->second == address) {
            // The time stamp is refreshed by any socket that hears the PC's own announcement,
            // so one adapter that still hears it keeps every socket as it is.
            if (echoTimedOut) {
                timedOut = true;
                statusLine(current);
                Log::mPrintlog(
                    "[checkNetWorkStatus] timeout 60s haven't found myself, ssdp socket maybe block, reinit socket "
                    "here \n");
                rebuildSocket(kind, name);
            } else {
                // The adapter of this kind now has another interface name (with the same
                // address): its socket must follow it, or it would stay on the old one.
                const auto socketName = socketInterface_.find(kind);
                if (socketName != socketInterface_.end() && !socketName->second.empty() &&
                    socketName->second != name) {
                    Log::mPrintlog("[checkNetWorkStatus] adapter " + kind + " moved from " + socketName->second +
                                     " to " + name + " \n");
                    rebuildSocket(kind, name);
                }
            }
            continue;
        }

        statusLine(current);
        Log::mPrintlog("[checkNetWorkStatus] ip is change \n");
        publish(ServiceEvent::NetworkChange);
        rebuildSocket(kind, name);
        const std::string& oldAddress = known->second;
        const ServiceEvent connect = isWifi ? ServiceEvent::WlanNetConnect : ServiceEvent::WiredNetConnect;
        const ServiceEvent disconnect = isWifi ? ServiceEvent::WlanNetDisconnect : ServiceEvent::WiredNetDisconnect;
        if (oldAddress.empty()) {
            publish(connect);
        } else if (address.empty()) {
            publish(disconnect);
        } else {
            publish(disconnect);
            publish(connect);
        }
    }

    // 4. A still-silent network rebuilds at most once per time-out, not on every check.
    if (timedOut) devices_.markOwnEcho();

    // 5. Adapters removed.
    for (const auto& [kind, address] : previous) {
        if (current.contains(kind)) continue;
        publish(ServiceEvent::NetworkChange);
        statusLine(current);
        Log::mPrintlog("[checkNetWorkStatus] adapter remove \n");
        if (kind == kWifi) {
            const std::string name = removeSocket(kind, wifiName);
            Log::mPrintlog("[checkNetWorkStatus] wifiName is " + name + "\n");
            publish(ServiceEvent::WlanNetDisconnect);
        } else if (kind == kEthernet) {
            const std::string name = removeSocket(kind, ethernetName);
            Log::mPrintlog("[checkNetWorkStatus] ethernetName is " + name + " \n");
            publish(ServiceEvent::WiredNetDisconnect);
        }
    }

    // 6.
    netStatus = current;
}

void KesuAdapterManager::announce() {
    const std::string deviceName = SystemInfo::getLocalName();
    const std::string deviceId = SystemInfo::getMacAddress();
    const std::string openId = dataInstance().get(&databaseParam::openid);
    const std::string account = dataInstance().get(&databaseParam::Phone);
    const std::string serviceId = SsdpMessage::pcServiceRecord();
    for (const auto& entry : ssdpManager) entry.second->sendResponseData(deviceName, deviceId, account, openId, serviceId);
}

void KesuAdapterManager::announceOn(SsdpSocketManager& manager) {
    manager.sendResponseData(SystemInfo::getLocalName(), SystemInfo::getMacAddress(), dataInstance().get(&databaseParam::Phone),
                             dataInstance().get(&databaseParam::openid), SsdpMessage::pcServiceRecord());
}

void KesuAdapterManager::shutdownNow() {
    for (const auto& entry : rebuilds_) entry.second->timer.cancel();
    rebuilds_.clear();
    const auto managers = std::exchange(ssdpManager, {});
    netStatus.clear();
    socketInterface_.clear();
    wifiSwitch = false;
    active_ = false;
    for (const auto& entry : managers) entry.second->deleteSocket();
}

void KesuAdapterManager::addSocket(const std::string& kind, const std::string& interfaceName) {
    auto manager = std::make_shared<SsdpSocketManager>(loop_, receiver_);
    manager->createSocket(interfaceName);
    const std::shared_ptr<SsdpSocketManager> replaced = std::exchange(ssdpManager[interfaceName], manager);
    socketInterface_[kind] = interfaceName;
    if (replaced) replaced->deleteSocket();
}

void KesuAdapterManager::rebuildSocket(const std::string& kind, const std::string& interfaceName) {
    cancelRebuild(kind);
    if (auto it = socketInterface_.find(kind); it != socketInterface_.end() && it->second != interfaceName) {
        dropManager(it->second);
    }
    if (auto it = ssdpManager.find(interfaceName); it != ssdpManager.end()) it->second->deleteSocket();
    // From now on this kind's socket belongs on `interfaceName`, also during the pause.
    socketInterface_[kind] = interfaceName;

    const auto pause = Config::current().ssdpRebuildPause;
    if (pause <= std::chrono::milliseconds::zero()) {
        reopen(kind, interfaceName);
        return;
    }
    auto rebuild = std::make_shared<Rebuild>(loop_.context());
    rebuilds_[kind] = rebuild;
    rebuild->timer.expires_after(pause);
    rebuild->timer.async_wait([this, alive = std::weak_ptr<int>(alive_), rebuild, kind,
                               interfaceName](const asio::error_code& error) {
        if (error || alive.expired()) return;
        const auto it = rebuilds_.find(kind);
        if (it == rebuilds_.end() || it->second != rebuild) return;  // superseded or dropped
        rebuilds_.erase(it);
        reopen(kind, interfaceName);
        // The pass that asked for the rebuild announced without this socket.
        if (auto manager = ssdpManager.find(interfaceName); manager != ssdpManager.end()) announceOn(*manager->second);
    });
}

void KesuAdapterManager::reopen(const std::string& kind, const std::string& interfaceName) {
    addSocket(kind, interfaceName);
    logInterface(kind, interfaceName);
}

void KesuAdapterManager::cancelRebuild(const std::string& kind) {
    if (auto it = rebuilds_.find(kind); it != rebuilds_.end()) {
        it->second->timer.cancel();
        rebuilds_.erase(it);
    }
}

std::string KesuAdapterManager::removeSocket(const std::string& kind, const std::string& fallbackName) {
    cancelRebuild(kind);
    std::string name = fallbackName;
    if (auto it = socketInterface_.find(kind); it != socketInterface_.end()) {
        name = it->second;
        socketInterface_.erase(it);
    }
    dropManager(name);
    return name;
}

void KesuAdapterManager::dropManager(const std::string& interfaceName) {
    if (auto it = ssdpManager.find(interfaceName); it != ssdpManager.end()) {
        const std::shared_ptr<SsdpSocketManager> manager = std::move(it->second);
        ssdpManager.erase(it);
        manager->deleteSocket();
    }
}

void KesuAdapterManager::logInterface(const std::string& kind, const std::string& interfaceName) {
    if (kind == kWifi) {
        Log::mPrintlog("[checkNetWorkStatus] wifiName is " + interfaceName + " \n");
    } else {
        Log::mPrintlog("[checkNetWorkStatus] ethernetName is " + interfaceName + " \n");
    }
}

void KesuAdapterManager::statusLine(const std::map<std::string, std::string>& snapshot) {
    Log::mPrintlog("[checkNetWorkStatus] Currently netcard status: " + json::compact(Json(snapshot)));
}

}  // namespace kesu
