// Which device of the registry is pre-connected next: the devices the user picked first,
// then the registry's candidates in their order, never-failed before once-failed, none that
// failed CONN_MAX times. Also the user's request to pre-connect one device now.
#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

// Failed attempts after which a device is no longer chosen (and a waiting requester hears
// "failed").
inline constexpr int CONN_MAX = 2;

class StrategyDevicePreconnect {
public:
    explicit StrategyDevicePreconnect(DeviceWaitForPreConnectManager& registry = DeviceWaitForPreConnectManager::instance())
        : registry_(registry) {}

    // The next entry, already marked FARAWAYWLAN; null when none is eligible.
    DeviceWaitForPreConnectManager::Entry pickupWaitforPreconnectDevice();

    // Puts a device at the head of the choices and wipes its earlier failures.
    static void addUserPickPreconnectDeviceId(const std::string& deviceId);
    // Pre-connects the device now and waits for the outcome (at most
    // Config::preconnectUserWait); true on success. Blocks the caller: never call it on the
    // event loop (the scheduler that makes the attempt runs there).
    static bool preconnectDeviceByDeviceId(const std::string& deviceId);
    // Forgets the user's picks (tests).
    static void clearUserPicks();

private:
    DeviceWaitForPreConnectManager& registry_;
    static std::mutex m_userPickDeviceMutex;
    static std::vector<std::string> m_userPickDeviceIds;
};

}  // namespace kesu
