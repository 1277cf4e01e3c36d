// Connects a pre-connected device of the account over its held link.
#pragma once

#include <string>

#include "core/Json.h"

namespace kesu {

class ConnectFlow {
public:
    // The whole flow; returns the compact reply {"error", "error_message", "data",
    // "connection_steps"}. `deviceType` gets the device's type once it is found.
    std::string start(const std::string& id, std::string& deviceType, const std::string& autoConnectType);

    static std::string buildResult(int error, const std::string& errorMsg, const std::string& connectSteps,
                                   const std::string& data = "");
    bool findPreconnectDevice(const std::string& id, std::string& connectSteps);
};

}  // namespace kesu
