#include "preconnect/StrategyDevicePreconnect.h"

#include <algorithm>
#include <memory>

#include "core/Config.h"
#include "core/Log.h"
#include "preconnect/PreConnectionStatus.h"

namespace kesu {

std::mutex StrategyDevicePreconnect::m_userPickDeviceMutex;
std::vector<std::string> StrategyDevicePreconnect::m_userPickDeviceIds;

DeviceWaitForPreConnectManager::Entry StrategyDevicePreconnect::pickupWaitforPreconnectDevice() {
    const auto candidates = registry_.getSortWaitForPreFarDevices();
    {
        std::lock_guard<std::mutex> lock(m_userPickDeviceMutex);
        for (const std::string& key : m_userPickDeviceIds) {
            DeviceWaitForPreConnectManager::Entry entry;
            if (!registry_.lookupDevices(key, entry) || entry->getIsConnected()) continue;
            const auto record = entry->getFarawayDevice();
            if (!record || !record->isWlanConnectSupport() || entry->getFarawayWlanConnectCount() >= CONN_MAX) continue;
            Log::mPrintlog("[StrategyDevicePreconnect::pickupWaitforPreconnectDevice] First priority, user pick device, id is " +
                             key + ", connect type FARAWAYWLAN");
            entry->setConnectType(FarawayDevice::kWlan);
            return entry;
        }
        m_userPickDeviceIds.clear();
    }
    for (int round = 1; round <= CONN_MAX; ++round) {
        for (const auto& entry : candidates) {
            const auto record = entry->getFarawayDevice();
            if (!entry->getIsFarawayDiscovered() || entry->getIsConnected() || !entry->getIsOpenIdSame() || !record ||
                !record->isWlanConnectSupport() || entry->getFarawayWlanConnectCount() >= round)
                continue;
            Log::mPrintlog("[StrategyDevicePreconnect::pickupWaitforPreconnectDevice] Get sort device id is " +
                             entry->getDeviceId() + ", connect type FARAWAYWLAN");
            entry->setConnectType(FarawayDevice::kWlan);
            return entry;
        }
    }
    return nullptr;
}

void StrategyDevicePreconnect::addUserPickPreconnectDeviceId(const std::string& deviceId) {
    Log::mPrintlog("[StrategyDevicePreconnect::addUserPickPreconnectDeviceId] add user pick preconnect deviceId: " +
                     deviceId);
    std::lock_guard<std::mutex> lock(m_userPickDeviceMutex);
    if (std::find(m_userPickDeviceIds.begin(), m_userPickDeviceIds.end(), deviceId) == m_userPickDeviceIds.end()) {
        m_userPickDeviceIds.push_back(deviceId);
        Log::mPrintlog("[StrategyDevicePreconnect::addUserPickPreconnectDeviceId] add preconnect deviceId is: " +
                         deviceId);
    }
    DeviceWaitForPreConnectManager::Entry entry;
    if (DeviceWaitForPreConnectManager::instance().lookupDevices(deviceId, entry)) entry->resetConnectCount();
}

void StrategyDevicePreconnect::clearUserPicks() {
    std::lock_guard<std::mutex> lock(m_userPickDeviceMutex);
    m_userPickDeviceIds.clear();
}

bool StrategyDevicePreconnect::preconnectDeviceByDeviceId(const std::string& deviceId) {
    Log::mPrintlog("[StrategyDevicePreconnect::preconnectDeviceByDeviceId] Preconnect device by user choose");
    DeviceWaitForPreConnectManager::Entry entry;
    if (!DeviceWaitForPreConnectManager::instance().lookupDevices(deviceId, entry)) {
        // The scheduler only picks devices of the registry: no outcome could come.
        Log::mPrintlog("[StrategyDevicePreconnect::preconnectDeviceByDeviceId] no device waiting for preconnect: " +
                         deviceId);
        return false;
    }
    if (entry->getIsConnected()) {
        Log::mPrintlog("[StrategyDevicePreconnect::preconnectDeviceByDeviceId] This device is already preconnect success");
        if (entry->getConnectType() != FarawayDevice::kWlan) return true;
        Log::mPrintlog("[StrategyDevicePreconnect::preconnectDeviceByDeviceId] Preconnect type is FARAWAYWLAN, Current "
                         "state is connected, so disconnect it and try preconnect again");
        entry->disconnectPreConnect();
    }
    // The waiter is in place before the device is picked, so that no outcome can come first.
    auto observer = std::make_shared<PreconnectObserver>(deviceId);
    ReportPreconnectResult::instance().addReceiptMessageObserver(deviceId, observer);
    addUserPickPreconnectDeviceId(deviceId);
    const bool ok = observer->wait(Config::current().preconnectUserWait) == "success";
    ReportPreconnectResult::instance().removeReceiptMessageObserver(deviceId, observer);
    return ok;
}

}  // namespace kesu
