// Forwards the PC's system states (log-on, Wi-Fi, wired and wireless links) to the PC suite
// and records a telemetry point when a link changes while a device is connected.
#pragma once

#include "events/IEventSubscriber.h"

namespace kesu {

class SystemEventSubscriber : public IEventSubscriber {
public:
    explicit SystemEventSubscriber(EventLoop& loop);
    void eventNotify(ServiceEvent event) override;

    void systemEventNotifyHandle(ServiceEvent event);
    void networkChangeDuringConnectionHandle(ServiceEvent event);
};

}  // namespace kesu
