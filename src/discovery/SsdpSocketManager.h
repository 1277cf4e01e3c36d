// The holder of one adapter's discovery socket: creates and drops it, and builds the PC's
// announcement and the search message that it sends to the group.
#pragma once

#include <memory>
#include <mutex>
#include <string>

#include "discovery/SsdpSocket.h"

namespace kesu {

class EventLoop;

class SsdpSocketManager {
public:
    // Sockets made by this manager live on `loop` and hand their datagrams to `receiver` (the
    // discovery classification when empty).
    explicit SsdpSocketManager(EventLoop& loop, SsdpSocket::Receiver receiver = {});
    ~SsdpSocketManager();
    SsdpSocketManager(const SsdpSocketManager&) = delete;
    SsdpSocketManager& operator=(const SsdpSocketManager&) = delete;

    // A new socket on interface `inNetCard`, replacing (and so closing) any previous one.
    void createSocket(const std::string& inNetCard);
    // Drops the socket: it closes after its queued sends.
    void deleteSocket();

    // Sends the PC's announcement; false when there is no socket or it did not take it.
    bool sendResponseData(const std::string& deviceName, const std::string& deviceId, const std::string& account,
                          const std::string& openId, const std::string& serviceId);
    // Sends the search message; false when there is no socket or it did not take it.
    bool sendSearchData(const std::string& deviceId, const std::string& openId, const std::string& serviceId);

    // The current socket (none before createSocket and after deleteSocket).
    std::shared_ptr<SsdpSocket> socket() const;

private:
    bool send(const std::string& message);

    EventLoop& loop_;
    const SsdpSocket::Receiver receiver_;
    mutable std::mutex lock_;  // guards ssdpInstance
    std::shared_ptr<SsdpSocket> ssdpInstance;
};

}  // namespace kesu
