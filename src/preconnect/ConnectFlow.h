// Connects a pre-connected device of the account over its held link: the connection request
// goes to the phone on the link the pre-connection keeps open and the phone's answer comes
// back on it. When that exchange fails the flow falls back once to a fresh link to the
// phone's port, as a PC-initiated connection makes it.
#pragma once

#include <functional>
#include <string>

#include "core/ISocketBase.h"
#include "core/Json.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

class ConnectFlow {
public:
    // Told the device's type ("phone", "pad") as soon as the device is found, while the flow
    // still runs.
    using DeviceTypeKnown = std::function<void(const std::string&)>;

    explicit ConnectFlow(DeviceTypeKnown deviceTypeKnown = {},
                         DeviceWaitForPreConnectManager& registry = DeviceWaitForPreConnectManager::instance());

    // The whole flow; returns the compact reply {"error", "error_message", "data",
    // "connection_steps"}. `deviceType` gets the device's type once it is found. Blocks the
    // calling thread (never the event loop's) for at most the send, answer and fallback
    // windows together.
    std::string start(const std::string& id, std::string& deviceType, const std::string& autoConnectType);

    static std::string buildResult(int error, const std::string& errorMsg, const std::string& connectSteps,
                                   const std::string& data = "");
    bool findPreconnectDevice(const std::string& id, std::string& connectSteps);
    // The connection request frame with "extra_info" {"isAutoConnect": autoConnectType}.
    bool wlanBuildSendData(Bytes& bufSend, const std::string& autoConnectType) const;
    // Sends `data` on the held link within `time` seconds.
    bool wlanSendConnectMsg(double time, const Bytes& data, std::string& connectSteps);
    // The phone's first frame on the held link, taken the moment it arrives, within `time`.
    bool wlanRecvConnectMsg(std::chrono::milliseconds time, Bytes& data, std::string& connectSteps);
    // 11 (busy), 1 (accepted), 2 (rejected), else -1.
    static int wlanDataParser(const Bytes& data);
    // One fresh connection to the device; the phone's answer by the PC-initiated rule (1, 2,
    // 11; else -1).
    int retryWlanConnect(std::string& connectSteps);

private:
    std::string fallback(std::string& connectSteps);
    std::string cancelled(const std::string& connectSteps) const;

    DeviceTypeKnown deviceTypeKnown_;
    DeviceWaitForPreConnectManager& registry_;
    DeviceWaitForPreConnectManager::Entry pDeviceWaitForPreConnect;
};

}  // namespace kesu
