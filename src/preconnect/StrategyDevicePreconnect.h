// Pre-connects one device of the registry on request of the PC suite.
#pragma once

#include <string>

namespace kesu {

class StrategyDevicePreconnect {
public:
    // True when the device's pre-connection was made.
    static bool preconnectDeviceByDeviceId(const std::string& deviceId);
};

}  // namespace kesu
