// Forwards the PC's system states (log-on, Wi-Fi, wired and wireless links) to the PC suite
// and records a telemetry point when a link changes while a device is connected.
#pragma once

#include "events/IEventSubscriber.h"

namespace kesu {

class SystemEventSubscriber : public IEventSubscriber {
public:
    SystemEventSubscriber();
    bool eventNotify(const std::string& eventName) override;

    void systemEventNotifyHandle(const std::string& eventName);
    void networkChangeDuringConnectionHandle(const std::string& eventName);
};

}  // namespace kesu
