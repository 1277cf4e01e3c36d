#include "events/SystemEventSubscriber.h"

#include "core/Json.h"
#include "core/Endpoints.h"
#include "core/Log.h"
#include "pcsuite/PcsuiteClient.h"

namespace kesu {

SystemEventSubscriber::SystemEventSubscriber(EventLoop& loop)
    : IEventSubscriber(loop, {ServiceEvent::WifiOpen, ServiceEvent::LogOn, ServiceEvent::LogOut,
                              ServiceEvent::WlanNetConnect, ServiceEvent::WlanNetDisconnect,
                              ServiceEvent::WiredNetDisconnect, ServiceEvent::WiredNetConnect}) {}

void SystemEventSubscriber::eventNotify(ServiceEvent event) {
    systemEventNotifyHandle(event);
    networkChangeDuringConnectionHandle(event);
}

void SystemEventSubscriber::systemEventNotifyHandle(ServiceEvent event) {
    if (!handles(event)) return;
    Json body = Json::object();
    if (event == ServiceEvent::LogOn) body = {{"event", "LogOn"}, {"status", 1}};
    else if (event == ServiceEvent::LogOut) body = {{"event", "LogOn"}, {"status", 0}};
    else if (event == ServiceEvent::WifiOpen) body = {{"event", "wifi"}, {"status", 1}};
    std::string response;
    PcsuiteClient::httpMsgSend(json::compact(body), Endpoints::pcsuiteHttpServerNotifySystemEventUrl(), "POST", response);
}

void SystemEventSubscriber::networkChangeDuringConnectionHandle(ServiceEvent event) {
    if (!handles(event)) return;
    std::string deviceType, status;
    if (PcsuiteClient::isDeviceConnectable("phone", deviceType, status) &&
        PcsuiteClient::isDeviceConnectable("pad", deviceType, status)) {
        Log::mPrintlog("[networkChangeDuringConnectionHandle] Current pc haven't connected device \n");
        return;
    }
    int netType = 0, state = 0;
    if (event == ServiceEvent::WlanNetDisconnect) netType = 1, state = 2;
    else if (event == ServiceEvent::WlanNetConnect) netType = 1, state = 1;
    else if (event == ServiceEvent::WiredNetDisconnect) netType = 4, state = 2;
    else if (event == ServiceEvent::WiredNetConnect) netType = 4, state = 1;
    else return;
    const Json record = {{"type", 1}, {"eventId", "W688|10308"}, {"params", {{"net_type", netType}, {"state", state}}}};
    const std::string buryPointStr = "[" + json::pretty(record) + "]";
    Log::mPrintlog("[networkChangeDuringConnectionHandle] sendBuryPoint buryPointStr is: " + buryPointStr + " \n");
    if (PcsuiteClient::sendBuryPoint(buryPointStr))
        Log::mPrintlog("[networkChangeDuringConnectionHandle] sendBuryPoint success \n");
}

}  // namespace kesu
