#include "connect/TcpSocketBase.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <utility>

#include "connect/PhoneLink.h"
#include "core/Utils.h"

namespace kesu {

namespace {

using SteadyClock = PhoneLink::Clock;

SteadyClock::time_point deadlineAfter(double seconds) {
    if (!(seconds > 0)) return SteadyClock::now();
    // Far beyond any caller's wish, but keeps the arithmetic from overflowing.
    seconds = std::min(seconds, 1.0e6);
    return SteadyClock::now() + std::chrono::duration_cast<SteadyClock::duration>(std::chrono::duration<double>(seconds));
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

}  // namespace

// One connection. The PhoneLink closes its descriptors only when the last user lets go of the
// link, so a thread still waiting never polls a descriptor number reused by another socket.
struct TcpSocketBase::Link {
    explicit Link(std::string ip_) : ip(std::move(ip_)) {}

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

    PhoneLink phone;
    const std::string ip;
    std::atomic<bool> established{false};  // the connect completed once
    std::atomic<bool> connected{false};    // established and not yet lost
    TimedGate sendGate;                    // one writer at a time: frames never interleave
    TimedGate recvGate;                    // one reader at a time, as PhoneLink::readFrame wants
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

bool TcpSocketBase::detach(const std::shared_ptr<Link>& link) {
    std::lock_guard<std::mutex> lock(mutex_);
    if (link_ != link) return false;
    link_.reset();
    return true;
}

bool TcpSocketBase::isConnected() const {
    const auto link = currentLink();
    return link && link->connected.load();
}

bool TcpSocketBase::initial(std::uint16_t port, const std::string& ip, int timeout) {
    Utils::mPrintlog("[TcpSocketBase::initial] Tcpsocket init ip is: " + ip + ", port is: " + std::to_string(port));
    std::lock_guard<std::mutex> connectLock(initialMutex_);
    TcpSocketBase::close();

    auto link = std::make_shared<Link>(ip);
    {
        // Published before connecting, so that close() can end the wait below.
        std::lock_guard<std::mutex> lock(mutex_);
        link_ = link;
    }
    std::string error;
    if (link->phone.connect(ip, port, deadlineAfter(timeout), error)) {
        link->established = true;
        link->connected = true;
        if (!link->phone.isShut()) {
            Utils::mPrintlog("[TcpSocketBase::socket] " + ip + " socket didConnectToHost ...");
            return true;
        }
        link->connected = false;
        error = "closed while connecting";
    }
    Utils::mPrintlog("[TcpSocketBase::initial] Error occur during connect as: " + error);
    detach(link);
    link->phone.shut();
    return false;
}

bool TcpSocketBase::close() {
    if (auto link = takeLink()) {
        link->lost("");
        link->phone.shut();
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
    std::string error;
    if (link->phone.writeAll(data, deadline, error)) {
        Utils::mPrintlog("[TcpSocketBase::socket] " + link->ip + " socket didWriteDataWithTag ...");
        return true;
    }
    if (!link->phone.isShut()) {
        if (link->phone.isConnected()) {
            Utils::mPrintlog("[TcpSocketBase::sendMsg] " + link->ip + " " + error);  // nothing went out: the link stays
        } else {
            link->lost(error);
        }
    } else if (detach(link)) {
        // The time-out cut a frame short and the link shut itself (else close() came first).
        Utils::mPrintlog("[TcpSocketBase::sendMsg] " + link->ip + " " + error);
        link->lost("");
    }
    return false;
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
    switch (link->phone.readFrame(data, deadline)) {
    case PhoneLink::Read::Frame:
        Utils::mPrintlog("[TcpSocketBase::socket] " + link->ip + " socket didRead ...");
        return true;
    case PhoneLink::Read::TimedOut:
        return false;  // errorCode left alone
    case PhoneLink::Read::Closed:
        link->lost(link->phone.readError());
        break;
    case PhoneLink::Read::Shut:
        break;
    }
    errorCode = -1;
    return false;
}

}  // namespace kesu
