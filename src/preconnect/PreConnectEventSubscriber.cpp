#include "preconnect/PreConnectEventSubscriber.h"

#include <string>

#include "core/Log.h"

namespace kesu {

PreConnectEventSubscriber::PreConnectEventSubscriber(EventLoop& loop)
    : IEventSubscriber(loop, {ServiceEvent::WifiOpen, ServiceEvent::WifiClose, ServiceEvent::LogOn,
                              ServiceEvent::Pcsuite, ServiceEvent::NetworkChange, ServiceEvent::AccountChange,
                              ServiceEvent::DeviceListUpdate, ServiceEvent::DeviceInfoReport}) {}

void PreConnectEventSubscriber::eventNotify(ServiceEvent event) {
    Log::mPrintlog(std::string("[PreConnectEventSubscriber::eventNotify] preconnect eventNotify ") +
                     eventName(event) + ": pre-connection not built yet, no device to adjust");
}

}  // namespace kesu
