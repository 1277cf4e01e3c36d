#include "control/ResponseHandler.h"

#include "core/Text.h"
#include "core/Utils.h"

namespace kesu {

std::string ResponseHandler::switchUint8ArrToString(std::string_view body) {
    std::string text;
    text.reserve(body.size());
    for (char c : body)
        if (static_cast<unsigned char>(c) != 0xFF) text.push_back(c);
    if (!text::isValidUtf8(text)) return {};
    return text;
}

Json ResponseHandler::responseObject(int error, const std::string& message) {
    return Json{{"error", error}, {"error_message", message}};
}

std::string ResponseHandler::response(int error, const std::string& message) {
    return json::pretty(responseObject(error, message));
}

std::string ResponseHandler::create(const requestObj& request) {
    switch (request.event) {
        case RequestEvent::HeartBeat: {
            Utils::mPrintlog("http HeartBeat \n");
            Json answer = responseObject(0, "");
            answer["data"] = "Alive";
            return json::pretty(answer);
        }
        case RequestEvent::LaunchSuccess:
            Utils::mPrintlog("http LaunchSuccess: launch connectstatus windows success! \n");
            return {};
        case RequestEvent::AlreadyStart:
            Utils::mPrintlog("http AlreadyStart: connectstatus windows has already exist! \n");
            return {};
        case RequestEvent::queryAll:
        case RequestEvent::stopSSDPScan:
        case RequestEvent::openWifi:
        case RequestEvent::unknown:
        default:
            return {};
    }
}

}  // namespace kesu
