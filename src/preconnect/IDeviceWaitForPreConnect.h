// A device of the account waiting for, or holding, a pre-connection.
#pragma once

#include <string>

#include "core/Json.h"

namespace kesu {

class IDeviceWaitForPreConnect {
public:
    virtual ~IDeviceWaitForPreConnect() = default;

    virtual std::string getDeviceId() const = 0;
    virtual bool getIsConnected() const = 0;
    virtual bool getIsFarawayDiscovered() const = 0;
    // The device as the PC suite lists it.
    virtual Json getPcsuiteDeviceInfo() const = 0;
    // Ends the held link at the next check of its read loop.
    virtual void setIsDisconnectNow(bool isDisconnectNow) = 0;
    virtual void reduceConnectCount() = 0;
    virtual void resetConnectCount() = 0;
    virtual void setFirstConnect(bool firstConnect) = 0;
    virtual void disconnectPreConnect() = 0;
};

}  // namespace kesu
