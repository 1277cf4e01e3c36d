#include "discovery/KesuAdapterManager.h"

#include <chrono>

#include "account/DataInstance.h"
#include "core/Config.h"
#include "core/Json.h"
#include "core/Utils.h"
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

}  // namespace

KesuAdapterManager& KesuAdapterManager::instance() {
    static KesuAdapterManager* manager = new KesuAdapterManager();
    return *manager;
}

KesuAdapterManager::KesuAdapterManager(SsdpSocket::Receiver receiver) : receiver_(std::move(receiver)) {
    creatAdapterSocket();
}

KesuAdapterManager::~KesuAdapterManager() { shutdown(); }

void KesuAdapterManager::creatAdapterSocket() {
    std::lock_guard<std::mutex> check(checkMutex_);
    creatAdapterSocketLocked();
}

void KesuAdapterManager::creatAdapterSocketLocked() {
    const std::map<std::string, std::string> snapshot = Utils::getNetworkCorrespondAddress();
    const std::string wifiName = Utils::GetWifiName();
    const std::string ethernetName = Utils::GetEthernetName();
    {
        std::lock_guard<std::mutex> guard(lock_);
        netStatus = snapshot;
        active_ = true;
    }
    // The first "blocked socket" check comes a whole time-out after the start.
    Utils::setSsdpDetectedLastTime(Utils::currentTimeStamp());
    Utils::mPrintlog(" [netcard status] Currently network card status:" + json::pretty(Json(snapshot)));
    for (const auto& [kind, address] : snapshot) {
        if (kind != kWifi && kind != kEthernet) continue;
        addSocket(kind, interfaceOf(kind, wifiName, ethernetName));
    }
}

bool KesuAdapterManager::isWiFiEnabled() { return Utils::SsidWifiCondition(); }

void KesuAdapterManager::checkNetWorkStatus() {
    std::lock_guard<std::mutex> check(checkMutex_);

    // 1. Wi-Fi power.
    const bool wifiOn = isWiFiEnabled();
    bool wifiChanged = false;
    {
        std::lock_guard<std::mutex> guard(lock_);
        if (wifiOn != wifiSwitch) {
            wifiSwitch = !wifiSwitch;
            wifiChanged = true;
        }
    }
    if (wifiChanged) publish(wifiOn ? ServiceEvent::WifiOpen : ServiceEvent::WifiClose);

    // 2. The current snapshot and the interface names of this moment.
    const std::map<std::string, std::string> current = Utils::getNetworkCorrespondAddress();
    const std::string wifiName = Utils::GetWifiName();
    const std::string ethernetName = Utils::GetEthernetName();
    const std::map<std::string, std::string> previous = networkStatus();
    const double selfEchoTimeout = std::chrono::duration<double>(Config::current().ssdpSelfEchoTimeout).count();
    bool timedOut = false;

    // 3. Adapters added, readdressed, or silent.
    for (const auto& [kind, address] : current) {
        if (kind != kWifi && kind != kEthernet) continue;
        const std::string name = interfaceOf(kind, wifiName, ethernetName);
        const bool isWifi = kind == kWifi;
        const auto known = previous.find(kind);

        if (known == previous.end()) {
            statusLine(current);
            Utils::mPrintlog("[checkNetWorkStatus] adapter add \n");
            publish(ServiceEvent::NetworkChange);
            addSocket(kind, name);
            logInterface(kind, name);
            publish(isWifi ? ServiceEvent::WlanNetConnect : ServiceEvent::WiredNetConnect);
            continue;
        }

        if (known->second == address) {
            // The time stamp is refreshed by any socket that hears the PC's own announcement,
            // so one adapter that still hears it keeps every socket as it is.
            if (Utils::currentTimeStamp() - Utils::getSsdpDetectedLastTime() > selfEchoTimeout) {
                timedOut = true;
                statusLine(current);
                Utils::mPrintlog(
                    "[checkNetWorkStatus] timeout 60s haven't found myself, ssdp socket maybe block, reinit socket "
                    "here \n");
                rebuildSocket(kind, name);
            } else {
                // The adapter of this kind now has another interface name (with the same
                // address): its socket must follow it, or it would stay on the old one.
                std::string socketName;
                {
                    std::lock_guard<std::mutex> guard(lock_);
                    if (auto it = socketInterface_.find(kind); it != socketInterface_.end()) socketName = it->second;
                }
                if (!socketName.empty() && socketName != name) {
                    Utils::mPrintlog("[checkNetWorkStatus] adapter " + kind + " moved from " + socketName + " to " +
                                     name + " \n");
                    rebuildSocket(kind, name);
                }
            }
            continue;
        }

        statusLine(current);
        Utils::mPrintlog("[checkNetWorkStatus] ip is change \n");
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
    if (timedOut) Utils::setSsdpDetectedLastTime(Utils::currentTimeStamp());

    // 5. Adapters removed.
    for (const auto& [kind, address] : previous) {
        if (current.contains(kind)) continue;
        publish(ServiceEvent::NetworkChange);
        statusLine(current);
        Utils::mPrintlog("[checkNetWorkStatus] adapter remove \n");
        if (kind == kWifi) {
            const std::string name = removeSocket(kind, wifiName);
            Utils::mPrintlog("[checkNetWorkStatus] wifiName is " + name + "\n");
            publish(ServiceEvent::WlanNetDisconnect);
        } else if (kind == kEthernet) {
            const std::string name = removeSocket(kind, ethernetName);
            Utils::mPrintlog("[checkNetWorkStatus] ethernetName is " + name + " \n");
            publish(ServiceEvent::WiredNetDisconnect);
        }
    }

    // 6.
    std::lock_guard<std::mutex> guard(lock_);
    netStatus = current;
}

void KesuAdapterManager::sendSsdp() {
    std::lock_guard<std::mutex> check(checkMutex_);
    const std::string deviceName = Utils::getLocalName();
    const std::string deviceId = Utils::getMacAddress();
    const std::string openId = dataInstance().get(&databaseParam::openid);
    const std::string account = dataInstance().get(&databaseParam::Phone);
    const std::string serviceId = SsdpMessage::pcServiceRecord();
    std::vector<std::shared_ptr<SsdpSocketManager>> managers;
    {
        std::lock_guard<std::mutex> guard(lock_);
        for (const auto& entry : ssdpManager) managers.push_back(entry.second);
    }
    for (const auto& manager : managers) manager->sendResponseData(deviceName, deviceId, account, openId, serviceId);
}

void KesuAdapterManager::shutdown() {
    std::lock_guard<std::mutex> check(checkMutex_);
    std::map<std::string, std::shared_ptr<SsdpSocketManager>> managers;
    {
        std::lock_guard<std::mutex> guard(lock_);
        managers.swap(ssdpManager);
        netStatus.clear();
        socketInterface_.clear();
        wifiSwitch = false;
        active_ = false;
    }
    for (const auto& entry : managers) entry.second->deleteSocket();
}

bool KesuAdapterManager::isActive() const {
    std::lock_guard<std::mutex> guard(lock_);
    return active_;
}

void KesuAdapterManager::interruptPauses() {
    std::lock_guard<std::mutex> guard(pauseMutex_);
    pauseInterrupted_ = true;
    pauseCv_.notify_all();
}

void KesuAdapterManager::resumePauses() {
    std::lock_guard<std::mutex> guard(pauseMutex_);
    pauseInterrupted_ = false;
}

std::vector<std::string> KesuAdapterManager::socketInterfaces() const {
    std::lock_guard<std::mutex> guard(lock_);
    std::vector<std::string> names;
    for (const auto& entry : ssdpManager) names.push_back(entry.first);
    return names;
}

std::shared_ptr<SsdpSocketManager> KesuAdapterManager::managerFor(const std::string& interfaceName) const {
    std::lock_guard<std::mutex> guard(lock_);
    const auto it = ssdpManager.find(interfaceName);
    return it == ssdpManager.end() ? nullptr : it->second;
}

std::map<std::string, std::string> KesuAdapterManager::networkStatus() const {
    std::lock_guard<std::mutex> guard(lock_);
    return netStatus;
}

// ---- Helpers -------------------------------------------------------------------------------

void KesuAdapterManager::addSocket(const std::string& kind, const std::string& interfaceName) {
    auto manager = std::make_shared<SsdpSocketManager>(receiver_);
    manager->createSocket(interfaceName);
    std::shared_ptr<SsdpSocketManager> replaced;
    {
        std::lock_guard<std::mutex> guard(lock_);
        replaced = std::exchange(ssdpManager[interfaceName], manager);
        socketInterface_[kind] = interfaceName;
    }
    if (replaced) replaced->deleteSocket();
}

void KesuAdapterManager::rebuildSocket(const std::string& kind, const std::string& interfaceName) {
    std::string oldName;
    {
        std::lock_guard<std::mutex> guard(lock_);
        if (auto it = socketInterface_.find(kind); it != socketInterface_.end()) oldName = it->second;
    }
    if (!oldName.empty() && oldName != interfaceName) dropManager(oldName);
    if (auto manager = managerFor(interfaceName)) manager->deleteSocket();
    pause();
    addSocket(kind, interfaceName);
    logInterface(kind, interfaceName);
}

std::string KesuAdapterManager::removeSocket(const std::string& kind, const std::string& fallbackName) {
    std::string name = fallbackName;
    {
        std::lock_guard<std::mutex> guard(lock_);
        if (auto it = socketInterface_.find(kind); it != socketInterface_.end()) {
            name = it->second;
            socketInterface_.erase(it);
        }
    }
    dropManager(name);
    return name;
}

void KesuAdapterManager::dropManager(const std::string& interfaceName) {
    std::shared_ptr<SsdpSocketManager> manager;
    {
        std::lock_guard<std::mutex> guard(lock_);
        if (auto it = ssdpManager.find(interfaceName); it != ssdpManager.end()) {
            manager = std::move(it->second);
            ssdpManager.erase(it);
        }
    }
    if (manager) manager->deleteSocket();
}

void KesuAdapterManager::logInterface(const std::string& kind, const std::string& interfaceName) {
    if (kind == kWifi) {
        Utils::mPrintlog("[checkNetWorkStatus] wifiName is " + interfaceName + " \n");
    } else {
        Utils::mPrintlog("[checkNetWorkStatus] ethernetName is " + interfaceName + " \n");
    }
}

void KesuAdapterManager::statusLine(const std::map<std::string, std::string>& snapshot) {
    Utils::mPrintlog("[checkNetWorkStatus] Currently netcard status: " + json::compact(Json(snapshot)));
}

void KesuAdapterManager::pause() {
    std::unique_lock<std::mutex> guard(pauseMutex_);
    pauseCv_.wait_for(guard, Config::current().ssdpRebuildPause, [this] { return pauseInterrupted_; });
}

}  // namespace kesu
