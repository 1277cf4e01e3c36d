// A device of the account waiting for, or holding, a pre-connection. DeviceWaitForPreConnect
// is the one implementation; the operations with a body here do nothing for other kinds.
#pragma once

#include <asio/awaitable.hpp>

#include <chrono>
#include <memory>
#include <string>

#include "core/ISocketBase.h"
#include "core/Json.h"

namespace kesu {

class FarawayDevice;

class IDeviceWaitForPreConnect {
public:
    virtual ~IDeviceWaitForPreConnect() = default;

    virtual std::string getDeviceId() const = 0;
    virtual bool getIsConnected() const = 0;
    virtual bool getIsFarawayDiscovered() const = 0;
    // The device as the PC suite lists it.
    virtual Json getPcsuiteDeviceInfo() const = 0;
    // Ends the held link (its read loop ends and the abnormal notice follows).
    virtual void setIsDisconnectNow(bool isDisconnectNow) = 0;
    virtual void reduceConnectCount() = 0;
    virtual void resetConnectCount() = 0;
    virtual void setFirstConnect(bool firstConnect) = 0;
    // Closes the link, clears the state and the failure count.
    virtual void disconnectPreConnect() = 0;

    virtual std::string getConnectType() const { return {}; }
    virtual void setConnectType(const std::string&) {}
    // The handshake; runs on the event loop.
    virtual asio::awaitable<bool> startPreConnect();
    virtual void setFarawayDevice(std::shared_ptr<FarawayDevice>) {}
    virtual void updateFarawayDeviceInfo(const FarawayDevice&) {}
    virtual std::shared_ptr<FarawayDevice> getFarawayDevice() const { return nullptr; }
    virtual void setIsFarawayDiscovered(bool) {}
    virtual void setIsConnected(bool) {}
    virtual int getFarawayWlanConnectCount() const { return 0; }
    virtual void setFarawayWlanConnectCount(int) {}
    virtual void addConnectCount() {}
    virtual bool getIsDisconnectNow() const { return false; }
    virtual bool getQueueMessage(Bytes&) { return false; }
    // The oldest frame the phone sent on the held link, waiting for one until `deadline`;
    // false at the deadline, or at once when the link is not (or no longer) held. Blocks:
    // never called on the event loop.
    virtual bool waitQueueMessage(Bytes& data, std::chrono::steady_clock::time_point) { return getQueueMessage(data); }
    virtual void clearQueueMessage() {}
    virtual bool isFirstConnection() const { return false; }
    virtual std::string getPreConnectStep() const { return {}; }
    virtual void setPreConnectStep(const std::string&) {}
    virtual bool getIsOpenIdSame() const { return true; }
    virtual void setIsOpenIdSame(bool) {}
    virtual bool isPcSameWlan() const { return false; }
    virtual bool getFirstConnect() const { return false; }
    virtual std::string getReportTime() const { return {}; }
    virtual int getPreconnectTryNumber() const { return 0; }
    virtual void addPreconnectTryNumber() {}
    virtual std::string getWlanDeviceIp() const { return {}; }
};

}  // namespace kesu
