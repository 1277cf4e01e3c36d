#include "core/UdpSocketBase.h"

#include <arpa/inet.h>
#include <netdb.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>

#include "core/Log.h"

namespace kesu {

namespace {

std::string systemMessage(int error) { return std::system_category().message(error); }

// The peer for an address literal (IPv4 or IPv6), else the first IPv4 address of a host name.
// Empty `error` on success.
sockaddr_storage peerOf(const std::string& ip, std::uint16_t port, socklen_t& length, std::string& error) {
    sockaddr_storage peer{};
    auto* v4 = reinterpret_cast<sockaddr_in*>(&peer);
    auto* v6 = reinterpret_cast<sockaddr_in6*>(&peer);
    if (::inet_pton(AF_INET, ip.c_str(), &v4->sin_addr) == 1) {
        v4->sin_family = AF_INET;
        v4->sin_port = htons(port);
        length = sizeof(sockaddr_in);
        return peer;
    }
    if (::inet_pton(AF_INET6, ip.c_str(), &v6->sin6_addr) == 1) {
        v6->sin6_family = AF_INET6;
        v6->sin6_port = htons(port);
        length = sizeof(sockaddr_in6);
        return peer;
    }
    addrinfo hints{};
    hints.ai_family = AF_INET;
    hints.ai_socktype = SOCK_DGRAM;
    addrinfo* found = nullptr;
    const int status = ::getaddrinfo(ip.c_str(), std::to_string(port).c_str(), &hints, &found);
    if (status != 0 || found == nullptr) {
        error = status != 0 ? ::gai_strerror(status) : "Host not found";
        if (found != nullptr) ::freeaddrinfo(found);
        return peer;
    }
    std::memcpy(&peer, found->ai_addr, found->ai_addrlen);
    length = found->ai_addrlen;
    ::freeaddrinfo(found);
    return peer;
}

}  // namespace

UdpSocketBase::~UdpSocketBase() { close(); }

bool UdpSocketBase::initial(std::uint16_t port, const std::string& ip, int /*timeout*/) {
    std::lock_guard<std::mutex> lock(mutex_);
    used_ = true;
    if (fd_ >= 0) {
        ::close(fd_);
        fd_ = -1;
    }
    std::string error;
    socklen_t length = 0;
    const sockaddr_storage peer = peerOf(ip, port, length, error);
    if (error.empty()) {
        fd_ = ::socket(peer.ss_family, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
        if (fd_ < 0 || ::connect(fd_, reinterpret_cast<const sockaddr*>(&peer), length) != 0) error = systemMessage(errno);
    }
    if (!error.empty()) {
        Log::mPrintlog("[UdpSocketBase::udpSocket] Error connecting to host: " + error);
        if (fd_ >= 0) ::close(fd_);
        fd_ = -1;
        return false;
    }
    return true;
}

bool UdpSocketBase::close() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
    return true;
}

bool UdpSocketBase::sendMsg(double /*time*/, const Bytes& data) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!used_) return false;
    int error = fd_ < 0 ? ENOTCONN : 0;
    if (error == 0 && ::send(fd_, data.data(), data.size(), MSG_DONTWAIT | MSG_NOSIGNAL) < 0) error = errno;
    if (error != 0) {
        const std::string reason = systemMessage(error);
        Log::mPrintlog("[UdpSocketBase::udpSocket] Failed to send message: " +
                         (reason.empty() ? std::string("Unknown error") : reason));
        return false;
    }
    Log::mPrintlog("[UdpSocketBase::udpSocket] Message sent");
    return true;
}

bool UdpSocketBase::recvMsg(double /*time*/, Bytes& /*data*/, int& /*errorCode*/) { return true; }

bool UdpSocketBase::isSocketNull() { return false; }

std::string UdpSocketBase::getSocketType() { return "udp"; }

bool UdpSocketBase::sendToLocalPort(int port, const std::string& text) {
    if (port <= 0 || port > 65535) return false;
    UdpSocketBase socket;
    if (!socket.initial(static_cast<std::uint16_t>(port), "127.0.0.1", -1)) return false;
    const bool sent = socket.sendMsg(-1, Bytes(text.begin(), text.end()));
    socket.close();
    return sent;
}

}  // namespace kesu
