#include "events/ServiceEvent.h"

namespace kesu {

const char* eventName(ServiceEvent event) {
    switch (event) {
        case ServiceEvent::NetworkChange: return "NetworkChangeEvent";
        case ServiceEvent::WifiOpen: return "WifiOpenEvent";
        case ServiceEvent::WifiClose: return "WifiCloseEvent";
        case ServiceEvent::WlanNetConnect: return "WlanNetConnectEvent";
        case ServiceEvent::WlanNetDisconnect: return "WlanNetDisconnectEvent";
        case ServiceEvent::WiredNetConnect: return "WiredNetConnectEvent";
        case ServiceEvent::WiredNetDisconnect: return "WiredNetDisconnectEvent";
        case ServiceEvent::LogOn: return "LogOnEvent";
        case ServiceEvent::LogOut: return "LogOutEvent";
        case ServiceEvent::AccountChange: return "AccountChangeEvent";
        case ServiceEvent::Pcsuite: return "PcsuiteEvent";
        case ServiceEvent::DeviceListUpdate: return "DeviceListUpdate";
        case ServiceEvent::DeviceInfoReport: return "DeviceInfoReport";
    }
    return "UnknownEvent";
}

}  // namespace kesu
