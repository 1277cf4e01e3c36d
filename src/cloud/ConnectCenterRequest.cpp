#include "cloud/ConnectCenterRequest.h"

#include "core/Log.h"

namespace kesu {

// The connect-center client is not built yet: every call answers "no answer".
std::optional<Json> ConnectCenterRequest::reportEvent(const Json&, int&, std::string& msg) {
    msg = "connect center unavailable";
    Log::mPrintlog("[ConnectCenterRequest::reportEvent] connect center unavailable");
    return std::nullopt;
}

std::optional<Json> ConnectCenterRequest::createEvent(const Json&, int&, std::string& msg) {
    msg = "connect center unavailable";
    Log::mPrintlog("[ConnectCenterRequest::createEvent] connect center unavailable");
    return std::nullopt;
}

}  // namespace kesu
