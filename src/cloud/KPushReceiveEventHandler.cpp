#include "cloud/KPushReceiveEventHandler.h"

namespace kesu {

KPushReceiveEventHandler& KPushReceiveEventHandler::instance() {
    static KPushReceiveEventHandler* handler = new KPushReceiveEventHandler();
    return *handler;
}

// Push-triggered pre-connection is not built yet: push messages get the empty answer.
std::string KPushReceiveEventHandler::kpushInfoHandler(const Json&) { return {}; }

}  // namespace kesu
