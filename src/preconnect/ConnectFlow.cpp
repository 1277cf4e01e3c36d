#include "preconnect/ConnectFlow.h"

#include "core/ConnectCodes.h"
#include "connect/Step.h"
#include "core/Log.h"
#include "discovery/StateCheck.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

std::string ConnectFlow::buildResult(int error, const std::string& errorMsg, const std::string& connectSteps,
                                     const std::string& data) {
    return json::compact(
        Json{{"error", error}, {"error_message", errorMsg}, {"data", data}, {"connection_steps", connectSteps}});
}

bool ConnectFlow::findPreconnectDevice(const std::string& id, std::string& connectSteps) {
    const Step& step = sharedStep();
    Log::mPrintlog("[ConnectFlow::findPreconnectDevice] Find preconnect device by deviceId: " + id);
    DeviceWaitForPreConnectManager::Entry device;
    const bool found = DeviceWaitForPreConnectManager::instance().lookupDevices(id, device);
    connectSteps += step.getConnectCode(step.OS4_WLAN_FIND_DEVICES);
    if (!found) {
        Log::mPrintlog("[ConnectFlow::findPreconnectDevice] Preconnect device not find!");
        connectSteps += step.getConnectResult(step.OS4_WLAN_FIND_DEVICES, Result::FAILED);
        return false;
    }
    if (!device->getIsConnected()) {
        Log::mPrintlog("[ConnectFlow::findPreconnectDevice] device is not preconnect!");
        connectSteps += step.getConnectResult(step.OS4_WLAN_FIND_DEVICES, Result::FAILED);
        return false;
    }
    connectSteps += step.getConnectResult(step.OS4_WLAN_FIND_DEVICES, Result::OK);
    Log::mPrintlog("[ConnectFlow::findPreconnectDevice] preconnect device find, deviceId is: " +
                     device->getDeviceId());
    return true;
}

std::string ConnectFlow::start(const std::string& id, std::string& /*deviceType*/,
                               const std::string& /*autoConnectType*/) {
    std::string steps;
    StateCheck::instance().setPrimaryConnectCancel(false);
    Log::mPrintlog("[ConnectFlow::start] $$[Statistical][connectionspeed][wlan][node0][" + id + "]$$");
    if (!findPreconnectDevice(id, steps))
        return buildResult(rawValue(ErrorCode::NOT_FOUND), "Preconnect device not find", steps);
    // The connection over the held link is not built yet.
    return buildResult(rawValue(ErrorCode::UNKNOWN), "Preconnect type is unkonw", steps);
}

}  // namespace kesu
