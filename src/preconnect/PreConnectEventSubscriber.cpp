#include "preconnect/PreConnectEventSubscriber.h"

#include <string>

#include "account/DataInstance.h"
#include "core/Log.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

PreConnectEventSubscriber::PreConnectEventSubscriber(EventLoop& loop)
    : PreConnectEventSubscriber(loop, DeviceWaitForPreConnectManager::instance()) {}

PreConnectEventSubscriber::PreConnectEventSubscriber(EventLoop& loop, DeviceWaitForPreConnectManager& registry)
    : IEventSubscriber(loop, {ServiceEvent::WifiOpen, ServiceEvent::WifiClose, ServiceEvent::LogOn,
                              ServiceEvent::Pcsuite, ServiceEvent::NetworkChange, ServiceEvent::AccountChange,
                              ServiceEvent::DeviceListUpdate, ServiceEvent::DeviceInfoReport}),
      registry_(registry),
      entriesOpenId_(dataInstance().get(&databaseParam::openid)) {}

void PreConnectEventSubscriber::eventNotify(ServiceEvent event) {
    if (!handles(event)) return;
    const auto devices = registry_.getAllDevices();
    Log::mPrintlog("[PreConnectEventSubscriber::eventNotify] preconnect eventNotify, reset connect count");
    switch (event) {
    case ServiceEvent::Pcsuite:
        for (const auto& device : devices) device->reduceConnectCount();
        break;
    case ServiceEvent::WifiClose:
    case ServiceEvent::NetworkChange:
        for (const auto& device : devices) device->setIsDisconnectNow(true);
        Log::mPrintlog("[PreConnectEventSubscriber::eventNotify] Wifi close or network change ... \n");
        break;
    case ServiceEvent::AccountChange: {
        const std::string openId = dataInstance().get(&databaseParam::openid);
        if (openId.empty()) {
            for (const auto& device : devices) device->disconnectPreConnect();
            Log::mPrintlog("[PreConnectEventSubscriber::eventNotify] account log off, clear all devices ... \n");
            registry_.clearAllDevices();
        } else if (!entriesOpenId_.empty() && openId != entriesOpenId_) {
            // Another account signed in without a sign-out between: no link of the previous
            // account's devices may stay open, whether or not the new account's list arrives.
            for (const auto& device : devices) device->disconnectPreConnect();
            Log::mPrintlog("[PreConnectEventSubscriber::eventNotify] another account signed in, clear all devices");
            registry_.clearAllDevices();
        } else {
            for (const auto& device : devices) device->setFirstConnect(true);
        }
        entriesOpenId_ = openId;
        break;
    }
    default:
        for (const auto& device : devices) device->resetConnectCount();
        break;
    }
}

}  // namespace kesu
