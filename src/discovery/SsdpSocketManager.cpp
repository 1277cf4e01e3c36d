#include "discovery/SsdpSocketManager.h"

#include <utility>

#include "discovery/SsdpMessage.h"

namespace kesu {

SsdpSocketManager::SsdpSocketManager(EventLoop& loop, SsdpSocket::Receiver receiver)
    : loop_(loop), receiver_(std::move(receiver)) {}

SsdpSocketManager::~SsdpSocketManager() { deleteSocket(); }

// The old socket is closed outside the lock: closing off the loop waits for the loop.
void SsdpSocketManager::createSocket(const std::string& inNetCard) {
    auto fresh = std::make_shared<SsdpSocket>(loop_, inNetCard, receiver_);
    std::shared_ptr<SsdpSocket> old;
    {
        std::lock_guard<std::mutex> guard(lock_);
        old = std::exchange(ssdpInstance, std::move(fresh));
    }
    if (old) old->close();
}

void SsdpSocketManager::deleteSocket() {
    std::shared_ptr<SsdpSocket> old;
    {
        std::lock_guard<std::mutex> guard(lock_);
        old = std::move(ssdpInstance);
        ssdpInstance.reset();
    }
    // A send running on another thread may still hold the socket; the last holder closes it.
    if (old) old->close();
}

bool SsdpSocketManager::sendResponseData(const std::string& deviceName, const std::string& deviceId,
                                         const std::string& account, const std::string& openId,
                                         const std::string& serviceId) {
    return send(SsdpMessage::responseMessage(deviceName, deviceId, account, openId, serviceId));
}

bool SsdpSocketManager::sendSearchData(const std::string& deviceId, const std::string& openId,
                                       const std::string& serviceId) {
    return send(SsdpMessage::searchMessage(deviceId, openId, serviceId));
}

std::shared_ptr<SsdpSocket> SsdpSocketManager::socket() const {
    std::lock_guard<std::mutex> guard(lock_);
    return ssdpInstance;
}

bool SsdpSocketManager::send(const std::string& message) {
    const std::shared_ptr<SsdpSocket> current = socket();
    return current && current->sendMsg(message);
}

}  // namespace kesu
