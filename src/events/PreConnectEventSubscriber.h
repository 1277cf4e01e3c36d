// Adjusts the devices waiting for pre-connection when the PC's situation changes (network,
// Wi-Fi, log-on, account, PC suite requests).
#pragma once

#include "events/IEventSubscriber.h"

namespace kesu {

class PreConnectEventSubscriber : public IEventSubscriber {
public:
    PreConnectEventSubscriber();
    bool eventNotify(const std::string& eventName) override;
};

}  // namespace kesu
