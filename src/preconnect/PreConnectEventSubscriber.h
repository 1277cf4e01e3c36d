// The pre-connection side of the event bus: when the PC's situation changes (network,
// Wi-Fi, log-on, account, PC suite requests) the devices waiting for pre-connection are
// adjusted: failure counts wiped or lowered, held links ended, or everything dropped when
// the account signs out or another account signs in.
#pragma once

#include <string>

#include "events/IEventSubscriber.h"

namespace kesu {

class DeviceWaitForPreConnectManager;

class PreConnectEventSubscriber : public IEventSubscriber {
public:
    explicit PreConnectEventSubscriber(EventLoop& loop);
    PreConnectEventSubscriber(EventLoop& loop, DeviceWaitForPreConnectManager& registry);
    void eventNotify(ServiceEvent event) override;

private:
    DeviceWaitForPreConnectManager& registry_;
    std::string entriesOpenId_;  // the account the entries belong to (events are handled one at a time)
};

}  // namespace kesu
