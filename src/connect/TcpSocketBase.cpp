#include "connect/TcpSocketBase.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <climits>
#include <system_error>
#include <utility>
#include <vector>

#include "connect/PhoneFrame.h"
#include "core/Config.h"
#include "core/Utils.h"

namespace kesu {

namespace {

using SteadyClock = std::chrono::steady_clock;

constexpr std::size_t kReadChunk = 64 * 1024;

SteadyClock::time_point deadlineAfter(double seconds) {
    if (!(seconds > 0)) return SteadyClock::now();
    // Far beyond any caller's wish, but keeps the arithmetic from overflowing.
    seconds = std::min(seconds, 1.0e6);
    return SteadyClock::now() + std::chrono::duration_cast<SteadyClock::duration>(std::chrono::duration<double>(seconds));
}

int remainingMs(SteadyClock::time_point deadline) {
    const auto left = deadline - SteadyClock::now();
    if (left <= SteadyClock::duration::zero()) return 0;
    const auto ms = std::chrono::ceil<std::chrono::milliseconds>(left).count();
    return ms > INT_MAX ? INT_MAX : static_cast<int>(ms);
}

// A lock whose acquisition gives up at a deadline (a condition variable rather than a timed
// mutex, whose clock-based wait the thread sanitizer does not follow).
class TimedGate {
public:
    bool enterUntil(SteadyClock::time_point deadline) {
        std::unique_lock<std::mutex> lock(mutex_);
        if (!freed_.wait_until(lock, deadline, [this] { return !busy_; })) return false;
        busy_ = true;
        return true;
    }
    void leave() {
        {
            std::lock_guard<std::mutex> lock(mutex_);
            busy_ = false;
        }
        freed_.notify_one();
    }

private:
    std::mutex mutex_;
    std::condition_variable freed_;
    bool busy_ = false;
};

class GateGuard {
public:
    explicit GateGuard(TimedGate& gate, SteadyClock::time_point deadline)
        : gate_(gate), entered_(gate.enterUntil(deadline)) {}
    ~GateGuard() {
        if (entered_) gate_.leave();
    }
    GateGuard(const GateGuard&) = delete;
    GateGuard& operator=(const GateGuard&) = delete;
    bool entered() const { return entered_; }

private:
    TimedGate& gate_;
    bool entered_;
};

std::string errnoText(int error) { return std::error_code(error, std::generic_category()).message(); }

}  // namespace

// One connection. The descriptors are closed only when the last user lets go of the link, so
// a thread still polling never sees a descriptor number reused by another socket; close()
// wakes such threads through the eventfd and by shutting the socket down.
struct TcpSocketBase::Link {
    Link(int fd_, int wakeFd_, std::string ip_) : fd(fd_), wakeFd(wakeFd_), ip(std::move(ip_)) {}
    ~Link() {
        ::close(fd);
        ::close(wakeFd);
    }

    enum class Wait { Ready, Woken, TimedOut };

    // Waits for `events` on the socket until the deadline or a wake-up by close().
    Wait waitFor(short events, SteadyClock::time_point deadline) {
        for (;;) {
            if (shutDown.load()) return Wait::Woken;
            pollfd fds[2] = {{fd, events, 0}, {wakeFd, POLLIN, 0}};
            const int ms = remainingMs(deadline);
            const int ready = ::poll(fds, 2, ms);
            if (ready < 0) {
                if (errno == EINTR) continue;
                return Wait::Woken;  // cannot happen with valid descriptors; treat as broken
            }
            if (fds[1].revents != 0 || shutDown.load()) return Wait::Woken;
            if (fds[0].revents != 0) return Wait::Ready;  // errors show in the next call
            if (ms == 0) return Wait::TimedOut;
        }
    }

    // Ends the link for everyone; repeated calls do nothing.
    void shut() {
        if (shutDown.exchange(true)) return;
        ::shutdown(fd, SHUT_RDWR);
        const std::uint64_t one = 1;
        [[maybe_unused]] const auto written = ::write(wakeFd, &one, sizeof one);
    }

    // The link is no longer connected; logged once.
    void lost(const std::string& error) {
        if (!connected.exchange(false)) return;
        Utils::mPrintlog("[TcpSocketBase::socket] " + ip + " socket socketDidDisconnect ...");
        if (error.empty()) {
            Utils::mPrintlog("[TcpSocketBase::socket] Disconnected without error");
        } else {
            Utils::mPrintlog("[TcpSocketBase::socket] Disconnected with error: " + error);
        }
    }

    void reportDrops() {
        const std::size_t dropped = cutter.takeDropped();
        const bool oversized = cutter.takeOversized();
        if (dropped == 0) return;
        std::string line = "[TcpSocketBase::recvMsg] " + ip + " dropped " + std::to_string(dropped) +
                           " bytes that are not a phone frame";
        if (oversized) {
            line += " (a frame announced a body above " + std::to_string(Config::current().phoneFrameMaxBody) +
                    " bytes)";
        }
        Utils::mPrintlog(line);
    }

    const int fd;
    const int wakeFd;
    const std::string ip;
    std::atomic<bool> established{false};  // the connect completed once
    std::atomic<bool> connected{false};    // established and not yet lost
    std::atomic<bool> shutDown{false};     // close() was called

    TimedGate sendGate;  // one writer at a time: frames never interleave

    TimedGate recvGate;  // one reader at a time; guards the members below
    FrameCutter cutter;
    bool peerClosed = false;
    std::vector<std::uint8_t> readBuffer = std::vector<std::uint8_t>(kReadChunk);
};

TcpSocketBase::~TcpSocketBase() { close(); }

std::shared_ptr<TcpSocketBase::Link> TcpSocketBase::currentLink() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return link_;
}

std::shared_ptr<TcpSocketBase::Link> TcpSocketBase::takeLink() {
    std::lock_guard<std::mutex> lock(mutex_);
    return std::exchange(link_, nullptr);
}

bool TcpSocketBase::isConnected() const {
    const auto link = currentLink();
    return link && link->connected.load();
}

bool TcpSocketBase::initial(std::uint16_t port, const std::string& ip, int timeout) {
    Utils::mPrintlog("[TcpSocketBase::initial] Tcpsocket init ip is: " + ip + ", port is: " + std::to_string(port));
    std::lock_guard<std::mutex> connectLock(initialMutex_);
    if (auto old = takeLink()) {
        old->lost("");
        old->shut();
    }

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
        Utils::mPrintlog("[TcpSocketBase::initial] Error occur during connect as: not a numeric address: " + ip);
        return false;
    }

    const int fd = ::socket(address.ss_family, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        Utils::mPrintlog("[TcpSocketBase::initial] Error occur during connect as: " + errnoText(errno));
        return false;
    }
    const int wakeFd = ::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (wakeFd < 0) {
        Utils::mPrintlog("[TcpSocketBase::initial] Error occur during connect as: " + errnoText(errno));
        ::close(fd);
        return false;
    }
    const int noDelay = 1;
    ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &noDelay, sizeof noDelay);

    auto link = std::make_shared<Link>(fd, wakeFd, ip);
    {
        // Published before connecting, so that close() can end the wait below.
        std::lock_guard<std::mutex> lock(mutex_);
        link_ = link;
    }
    auto fail = [&](const std::string& why) {
        Utils::mPrintlog(why);
        {
            std::lock_guard<std::mutex> lock(mutex_);
            if (link_ == link) link_.reset();
        }
        link->shut();
        return false;
    };

    if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), addressLength) != 0) {
        if (errno != EINPROGRESS) {
            return fail("[TcpSocketBase::initial] Error occur during connect as: " + errnoText(errno));
        }
        switch (link->waitFor(POLLOUT, deadlineAfter(timeout))) {
        case Link::Wait::Woken:
            return fail("[TcpSocketBase::initial] " + ip + " connect ended by close");
        case Link::Wait::TimedOut:
            return fail("[TcpSocketBase::initial] " + ip + " connect timed out after " + std::to_string(timeout) +
                        " s");
        case Link::Wait::Ready:
            break;
        }
        int error = 0;
        socklen_t errorLength = sizeof error;
        if (::getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &errorLength) != 0) error = errno;
        if (error != 0) return fail("[TcpSocketBase::initial] Error occur during connect as: " + errnoText(error));
    }

    link->established = true;
    link->connected = true;
    if (link->shutDown.load()) {
        link->connected = false;
        Utils::mPrintlog("[TcpSocketBase::initial] " + ip + " connect ended by close");
        return false;
    }
    Utils::mPrintlog("[TcpSocketBase::socket] " + ip + " socket didConnectToHost ...");
    return true;
}

bool TcpSocketBase::close() {
    if (auto link = takeLink()) {
        link->lost("");
        link->shut();
    }
    return true;
}

bool TcpSocketBase::sendMsg(double time, const Bytes& data) {
    const auto link = currentLink();
    if (!link || !link->connected.load()) {
        Utils::mPrintlog("[TcpSocketBase::sendMsg] " + (link ? link->ip : std::string()) + " socket is not connected");
        return false;
    }
    const auto deadline = deadlineAfter(time);
    GateGuard sendLock(link->sendGate, deadline);
    if (!sendLock.entered()) {
        Utils::mPrintlog("[TcpSocketBase::sendMsg] " + link->ip + " another send held the link until the time-out");
        return false;
    }

    std::size_t sent = 0;
    while (sent < data.size()) {
        const ssize_t n = ::send(link->fd, data.data() + sent, data.size() - sent, MSG_NOSIGNAL);
        if (n > 0) {
            sent += static_cast<std::size_t>(n);
            continue;
        }
        if (n < 0 && errno == EINTR) continue;
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            const auto wait = link->waitFor(POLLOUT, deadline);
            if (wait == Link::Wait::Ready) continue;
            if (wait == Link::Wait::Woken) return false;
            if (sent > 0) {
                // The peer would read the rest of this frame as the start of the next one.
                Utils::mPrintlog("[TcpSocketBase::sendMsg] " + link->ip + " sent only " + std::to_string(sent) +
                                 " of " + std::to_string(data.size()) + " bytes in time, closing the link");
                {
                    std::lock_guard<std::mutex> lock(mutex_);
                    if (link_ == link) link_.reset();
                }
                link->lost("");
                link->shut();
            } else {
                Utils::mPrintlog("[TcpSocketBase::sendMsg] " + link->ip + " send timed out");
            }
            return false;
        }
        link->lost(n < 0 ? errnoText(errno) : std::string("nothing written"));
        return false;
    }
    Utils::mPrintlog("[TcpSocketBase::socket] " + link->ip + " socket didWriteDataWithTag ...");
    return true;
}

bool TcpSocketBase::recvMsg(double time, Bytes& data, int& errorCode) {
    const auto link = currentLink();
    if (!link || !link->established.load()) {
        errorCode = -1;
        return false;
    }
    const auto deadline = deadlineAfter(time);
    GateGuard recvLock(link->recvGate, deadline);
    if (!recvLock.entered()) return false;

    for (;;) {
        auto frame = link->cutter.next();
        link->reportDrops();
        if (frame) {
            data = std::move(*frame);
            Utils::mPrintlog("[TcpSocketBase::socket] " + link->ip + " socket didRead ...");
            return true;
        }
        if (link->peerClosed || link->shutDown.load()) {
            if (link->peerClosed && link->cutter.buffered() > 0) {
                Utils::mPrintlog("[TcpSocketBase::recvMsg] " + link->ip + " dropped " +
                                 std::to_string(link->cutter.buffered()) + " bytes of an unfinished frame");
                link->cutter.clear();
            }
            errorCode = -1;
            return false;
        }
        const ssize_t n = ::recv(link->fd, link->readBuffer.data(), link->readBuffer.size(), 0);
        if (n > 0) {
            link->cutter.feed(link->readBuffer.data(), static_cast<std::size_t>(n));
            continue;
        }
        if (n == 0) {
            link->peerClosed = true;
            link->lost("");
            continue;
        }
        if (errno == EINTR) continue;
        if (errno == EAGAIN || errno == EWOULDBLOCK) {
            const auto wait = link->waitFor(POLLIN, deadline);
            if (wait == Link::Wait::Ready) continue;
            if (wait == Link::Wait::TimedOut) return false;
            errorCode = -1;
            return false;
        }
        link->peerClosed = true;
        link->lost(errnoText(errno));
    }
}

}  // namespace kesu
