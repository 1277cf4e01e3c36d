// The pre-connection side of the event bus: when the PC's situation changes (network,
// Wi-Fi, log-on, account, PC suite requests) the devices waiting for pre-connection are to be
// adjusted. Pre-connection is not built yet, so the registry holds no device and the
// subscriber only logs the event it took.
#pragma once

#include "events/IEventSubscriber.h"

namespace kesu {

class PreConnectEventSubscriber : public IEventSubscriber {
public:
    explicit PreConnectEventSubscriber(EventLoop& loop);
    void eventNotify(ServiceEvent event) override;
};

}  // namespace kesu
