#include "events/PreConnectEventSubscriber.h"

#include "core/Utils.h"

namespace kesu {

PreConnectEventSubscriber::PreConnectEventSubscriber()
    : IEventSubscriber({"WifiOpenEvent", "WifiCloseEvent", "LogOnEvent", "PcsuiteEvent", "NetworkChangeEvent",
                        "AccountChangeEvent", "DeviceListUpdate", "DeviceInfoReport"}) {}

bool PreConnectEventSubscriber::eventNotify(const std::string& eventName) {
    if (!handles(eventName)) return false;
    std::lock_guard<std::mutex> guard(lock);
    setIsNotify(true);
    Utils::mPrintlog("[PreConnectEventSubscriber::eventNotify] preconnect eventNotify, reset connect count");
    // The pre-connect registry has no devices until pre-connection is built; the per-event
    // actions on its devices join here then.
    setIsNotify(false);
    return true;
}

}  // namespace kesu
