// Handles the push channel's messages that the PC suite relays as "kpush" control requests:
// the channel's client id, the cloud's notices for the event bus, and a phone's request
// through the cloud to connect to this PC (pre-connected at once, or connected by the PC
// suite), whose outcome goes back to the connect center as an event report.
#pragma once

#include <string>

#include "core/Json.h"

namespace kesu {

class KPushReceiveEventHandler {
public:
    static KPushReceiveEventHandler& instance();

    // Handles one relayed push message and returns the answer text. Runs on the control
    // handler thread that received it; a "PreConnect" notice holds that thread until the
    // pre-connection ends (at most Config::preconnectUserWait), a user connection until the
    // PC suite answers.
    std::string kpushInfoHandler(const Json& params);
    // Handles one phone-connect notice ("exdata" of the message) and reports its outcome to
    // the connect center.
    void passivePreConnect(const Json& exdata);
};

}  // namespace kesu
