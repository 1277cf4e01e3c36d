// Handles push messages relayed by the PC suite.
#pragma once

#include <string>

#include "core/Json.h"

namespace kesu {

class KPushReceiveEventHandler {
public:
    static KPushReceiveEventHandler& instance();
    // The answer text for one relayed push message.
    std::string kpushInfoHandler(const Json& params);
};

}  // namespace kesu
