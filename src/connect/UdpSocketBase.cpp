#include "connect/UdpSocketBase.h"

#include <asio/ip/address.hpp>

#include "core/Utils.h"

namespace kesu {

UdpSocketBase::~UdpSocketBase() { close(); }

void UdpSocketBase::initClientSocket() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!socket) socket.emplace(io_);
}

bool UdpSocketBase::initial(std::uint16_t port, const std::string& ip, int /*timeout*/) {
    initClientSocket();
    std::lock_guard<std::mutex> lock(mutex_);
    asio::error_code ec;
    asio::ip::udp::endpoint endpoint;
    const asio::ip::address address = asio::ip::make_address(ip, ec);
    if (!ec) {
        endpoint = asio::ip::udp::endpoint(address, port);
    } else {
        asio::ip::udp::resolver resolver(io_);
        const auto results = resolver.resolve(asio::ip::udp::v4(), ip, std::to_string(port), ec);
        if (!ec && results.empty()) ec = asio::error::host_not_found;
        if (!ec) endpoint = *results.begin();
    }
    if (!ec && socket->is_open()) socket->close(ec);
    if (!ec) socket->open(endpoint.protocol(), ec);
    if (!ec) socket->non_blocking(true, ec);
    if (!ec) socket->connect(endpoint, ec);
    if (ec) {
        Utils::mPrintlog("[UdpSocketBase::udpSocket] Error connecting to host: " + ec.message());
        asio::error_code ignored;
        socket->close(ignored);
        return false;
    }
    return true;
}

bool UdpSocketBase::close() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (socket && socket->is_open()) {
        asio::error_code ignored;
        socket->close(ignored);
    }
    return true;
}

bool UdpSocketBase::sendMsg(double /*time*/, const Bytes& data) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!socket) return false;
    asio::error_code ec;
    if (!socket->is_open()) ec = asio::error::not_connected;
    if (!ec) socket->send(asio::buffer(data), 0, ec);
    if (ec) {
        const std::string reason = ec.message();
        Utils::mPrintlog("[UdpSocketBase::udpSocket] Failed to send message: " +
                         (reason.empty() ? std::string("Unknown error") : reason));
        return false;
    }
    Utils::mPrintlog("[UdpSocketBase::udpSocket] Message sent");
    return true;
}

bool UdpSocketBase::recvMsg(double /*time*/, Bytes& /*data*/, int& /*errorCode*/) { return true; }

bool UdpSocketBase::isSocketNull() { return false; }

std::string UdpSocketBase::getSokcetType() { return "udp"; }

}  // namespace kesu
