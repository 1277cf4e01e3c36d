#include "events/SystemEventSubscriber.h"

#include "core/Json.h"
#include "core/Utils.h"

namespace kesu {

SystemEventSubscriber::SystemEventSubscriber()
    : IEventSubscriber({"WifiOpenEvent", "LogOnEvent", "LogOutEvent", "WlanNetConnectEvent", "WlanNetDisconnectEvent",
                        "WiredNetDisconnectEvent", "WiredNetConnectEvent"}) {}

bool SystemEventSubscriber::eventNotify(const std::string& eventName) {
    std::lock_guard<std::mutex> guard(lock);
    setIsNotify(true);
    systemEventNotifyHandle(eventName);
    networkChangeDuringConnectionHandle(eventName);
    setIsNotify(false);
    return true;
}

void SystemEventSubscriber::systemEventNotifyHandle(const std::string& eventName) {
    if (!handles(eventName)) return;
    Json body = Json::object();
    if (eventName == "LogOnEvent") body = {{"event", "LogOn"}, {"status", 1}};
    else if (eventName == "LogOutEvent") body = {{"event", "LogOn"}, {"status", 0}};
    else if (eventName == "WifiOpenEvent") body = {{"event", "wifi"}, {"status", 1}};
    std::string response;
    Utils::httpMsgSend(json::compact(body), Utils::pcsuiteHttpServerNotifySystemEventUrl(), "POST", response);
}

void SystemEventSubscriber::networkChangeDuringConnectionHandle(const std::string& eventName) {
    if (!handles(eventName)) return;
    std::string deviceType, status;
    if (Utils::isDeviceConnectable("phone", deviceType, status) &&
        Utils::isDeviceConnectable("pad", deviceType, status)) {
        Utils::mPrintlog("[networkChangeDuringConnectionHandle] Current pc haven't connected device \n");
        return;
    }
    int netType = 0, state = 0;
    if (eventName == "WlanNetDisconnectEvent") netType = 1, state = 2;
    else if (eventName == "WlanNetConnectEvent") netType = 1, state = 1;
    else if (eventName == "WiredNetDisconnectEvent") netType = 4, state = 2;
    else if (eventName == "WiredNetConnectEvent") netType = 4, state = 1;
    else return;
    const Json record = {{"type", 1}, {"eventId", "W688|10308"}, {"params", {{"net_type", netType}, {"state", state}}}};
    const std::string buryPointStr = "[" + json::pretty(record) + "]";
    Utils::mPrintlog("[networkChangeDuringConnectionHandle] sendBuryPoint buryPointStr is: " + buryPointStr + " \n");
    if (Utils::sendBuryPoint(buryPointStr))
        Utils::mPrintlog("[networkChangeDuringConnectionHandle] sendBuryPoint success \n");
}

}  // namespace kesu
