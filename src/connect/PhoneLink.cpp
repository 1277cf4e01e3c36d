#include "connect/PhoneLink.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <climits>
#include <system_error>

#include "core/Config.h"
#include "core/Utils.h"

namespace kesu {

namespace {

std::string errnoText(int error) { return std::error_code(error, std::generic_category()).message(); }

int remainingMs(PhoneLink::Clock::time_point deadline) {
    const auto left = deadline - PhoneLink::Clock::now();
    if (left <= PhoneLink::Clock::duration::zero()) return 0;
    const auto ms = std::chrono::ceil<std::chrono::milliseconds>(left).count();
    return ms > INT_MAX ? INT_MAX : static_cast<int>(ms);
}

// The numeric address and port of a socket address.
void describe(const sockaddr_storage& address, std::string& text, int& port) {
    char buffer[INET6_ADDRSTRLEN] = {};
    if (address.ss_family == AF_INET) {
        const auto* v4 = reinterpret_cast<const sockaddr_in*>(&address);
        ::inet_ntop(AF_INET, &v4->sin_addr, buffer, sizeof buffer);
        port = ntohs(v4->sin_port);
    } else if (address.ss_family == AF_INET6) {
        const auto* v6 = reinterpret_cast<const sockaddr_in6*>(&address);
        ::inet_ntop(AF_INET6, &v6->sin6_addr, buffer, sizeof buffer);
        port = ntohs(v6->sin6_port);
    }
    text = buffer;
}

}  // namespace

PhoneLink::PhoneLink() : wakeFd_(::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)) {}

PhoneLink::PhoneLink(int connectedFd) : PhoneLink() {
    fd_ = connectedFd;
    if (fd_ >= 0) {
        ::fcntl(fd_, F_SETFL, ::fcntl(fd_, F_GETFL) | O_NONBLOCK);
        ::fcntl(fd_, F_SETFD, FD_CLOEXEC);
        const int noDelay = 1;
        ::setsockopt(fd_, IPPROTO_TCP, TCP_NODELAY, &noDelay, sizeof noDelay);
        connected_ = true;
        readEndpoints();
    }
}

PhoneLink::~PhoneLink() {
    if (fd_ >= 0) ::close(fd_);
    if (wakeFd_ >= 0) ::close(wakeFd_);
}

void PhoneLink::readEndpoints() {
    sockaddr_storage peer{}, local{};
    socklen_t peerLength = sizeof peer, localLength = sizeof local;
    std::lock_guard<std::mutex> lock(mutex_);
    if (::getpeername(fd_, reinterpret_cast<sockaddr*>(&peer), &peerLength) == 0)
        describe(peer, peerAddress_, peerPort_);
    if (::getsockname(fd_, reinterpret_cast<sockaddr*>(&local), &localLength) == 0)
        describe(local, localAddress_, localPort_);
}

std::string PhoneLink::peerAddress() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return peerAddress_;
}

int PhoneLink::peerPort() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return peerPort_;
}

std::string PhoneLink::localAddress() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return localAddress_;
}

int PhoneLink::localPort() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return localPort_;
}

void PhoneLink::shut() {
    std::lock_guard<std::mutex> lock(mutex_);
    if (shut_.exchange(true)) return;
    connected_ = false;
    if (fd_ >= 0) ::shutdown(fd_, SHUT_RDWR);
    if (wakeFd_ >= 0) {
        const std::uint64_t one = 1;
        [[maybe_unused]] const auto written = ::write(wakeFd_, &one, sizeof one);
    }
}

PhoneLink::Wait PhoneLink::waitFor(short events, Clock::time_point deadline) {
    for (;;) {
        if (shut_.load()) return Wait::Woken;
        pollfd fds[2] = {{fd_, events, 0}, {wakeFd_, POLLIN, 0}};
        const int ms = remainingMs(deadline);
        const int ready = ::poll(fds, wakeFd_ >= 0 ? 2 : 1, ms);
        if (ready < 0) {
            if (errno == EINTR) continue;
            return Wait::Woken;
        }
        if ((wakeFd_ >= 0 && fds[1].revents != 0) || shut_.load()) return Wait::Woken;
        if (fds[0].revents != 0) return Wait::Ready;  // errors show in the next call
        if (ms == 0) return Wait::TimedOut;
    }
}

bool PhoneLink::connect(const std::string& ip, std::uint16_t port, Clock::time_point deadline, std::string& error) {
    sockaddr_storage address{};
    socklen_t addressLength = 0;
    auto* v4 = reinterpret_cast<sockaddr_in*>(&address);
    auto* v6 = reinterpret_cast<sockaddr_in6*>(&address);
    if (::inet_pton(AF_INET, ip.c_str(), &v4->sin_addr) == 1) {
        v4->sin_family = AF_INET;
        v4->sin_port = htons(port);
        addressLength = sizeof(sockaddr_in);
    } else if (::inet_pton(AF_INET6, ip.c_str(), &v6->sin6_addr) == 1) {
        v6->sin6_family = AF_INET6;
        v6->sin6_port = htons(port);
        addressLength = sizeof(sockaddr_in6);
    } else {
        error = "not a numeric address: " + ip;
        return false;
    }
    if (wakeFd_ < 0) {
        error = "no descriptor left for the link";
        return false;
    }
    {
        std::lock_guard<std::mutex> lock(mutex_);
        if (shut_.load()) {
            error = "closed before connecting";
            return false;
        }
        if (fd_ >= 0) {
            error = "already connected";
            return false;
        }
        fd_ = ::socket(address.ss_family, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
        if (fd_ < 0) {
            error = errnoText(errno);
            return false;
        }
    }
    const int noDelay = 1;
    ::setsockopt(fd_, IPPROTO_TCP, TCP_NODELAY, &noDelay, sizeof noDelay);

    if (::connect(fd_, reinterpret_cast<const sockaddr*>(&address), addressLength) != 0) {
        if (errno != EINPROGRESS) {
            error = errnoText(errno);
            return false;
        }
        switch (waitFor(POLLOUT, deadline)) {
        case Wait::Woken:
            error = "closed while connecting";
            return false;
        case Wait::TimedOut:
            error = "connect timed out";
            return false;
        case Wait::Ready:
            break;
        }
        int soError = 0;
        socklen_t length = sizeof soError;
        if (::getsockopt(fd_, SOL_SOCKET, SO_ERROR, &soError, &length) != 0) soError = errno;
        if (soError != 0) {
            error = errnoText(soError);
            return false;
        }
    }
    readEndpoints();
    connected_ = true;
    if (shut_.load()) {
        connected_ = false;
        error = "closed while connecting";
        return false;
    }
    return true;
}

bool PhoneLink::writeAll(const Bytes& data, Clock::time_point deadline, std::string& error) {
    if (fd_ < 0 || !connected_.load()) {
        error = "not connected";
        return false;
    }
    std::size_t sent = 0;
    while (sent < data.size()) {
        const ssize_t n = ::send(fd_, data.data() + sent, data.size() - sent, MSG_NOSIGNAL);
        if (n > 0) {
            sent += static_cast<std::size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            const Wait wait = waitFor(POLLOUT, deadline);
            if (wait == Wait::Ready) continue;
            if (wait == Wait::Woken) {
                error = "closed while writing";
            } else if (sent == 0) {
                error = "write timed out";
            } else {
                error = "sent only " + std::to_string(sent) + " of " + std::to_string(data.size()) +
                        " bytes in time, closing the link";
                shut();
            }
            return false;
        }
        error = n < 0 ? errnoText(errno) : "nothing written";
        connected_ = false;
        return false;
    }
    return true;
}

PhoneLink::Read PhoneLink::readFrame(Bytes& frame, Clock::time_point deadline) {
    if (fd_ < 0) return Read::Closed;
    std::array<std::uint8_t, 16 * 1024> chunk;
    for (;;) {
        auto next = cutter_.next();
        if (const std::size_t dropped = cutter_.takeDropped(); dropped > 0) {
            const bool oversized = cutter_.takeOversized();
            Utils::mPrintlog("[PhoneLink::readFrame] " + peerAddress() + " dropped " + std::to_string(dropped) +
                             " bytes that are not a phone frame" +
                             (oversized ? " (a frame announced a body above " +
                                              std::to_string(Config::current().phoneFrameMaxBody) + " bytes)"
                                        : std::string()));
        }
        if (next) {
            frame = std::move(*next);
            return Read::Frame;
        }
        if (shut_.load()) return Read::Shut;
        if (peerClosed_) {
            if (const std::size_t rest = cutter_.buffered(); rest > 0) {
                Utils::mPrintlog("[PhoneLink::readFrame] " + peerAddress() + " dropped " + std::to_string(rest) +
                                 " bytes of an unfinished frame");
                cutter_.clear();
            }
            return Read::Closed;
        }
        const ssize_t n = ::recv(fd_, chunk.data(), chunk.size(), 0);
        if (n > 0) {
            cutter_.feed(chunk.data(), static_cast<std::size_t>(n));
            continue;
        }
        if (n == 0) {
            peerClosed_ = true;
            connected_ = false;
            continue;
        }
        if (errno == EINTR) continue;
        if (errno == EAGAIN || errno == EWOULDBLOCK) {
            const Wait wait = waitFor(POLLIN, deadline);
            if (wait == Wait::Ready) continue;
            return wait == Wait::TimedOut ? Read::TimedOut : Read::Shut;
        }
        readError_ = errnoText(errno);
        peerClosed_ = true;
        connected_ = false;
    }
}

}  // namespace kesu
