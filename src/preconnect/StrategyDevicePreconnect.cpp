#include "preconnect/StrategyDevicePreconnect.h"

#include "core/Log.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

bool StrategyDevicePreconnect::preconnectDeviceByDeviceId(const std::string& deviceId) {
    DeviceWaitForPreConnectManager::Entry device;
    if (!DeviceWaitForPreConnectManager::instance().lookupDevices(deviceId, device)) {
        Log::mPrintlog("[StrategyDevicePreconnect::preconnectDeviceByDeviceId] device not found: " + deviceId);
        return false;
    }
    if (device->getIsConnected()) {
        Log::mPrintlog(
            "[StrategyDevicePreconnect::preconnectDeviceByDeviceId] This device is already preconnect success");
        return true;
    }
    // The handshake runs from the scheduler's entries; none can be started from here yet.
    Log::mPrintlog("[StrategyDevicePreconnect::preconnectDeviceByDeviceId] no pre-connection for " + deviceId);
    return false;
}

}  // namespace kesu
