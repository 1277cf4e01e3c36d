// One TCP link with a phone for a single request and its answer: connect (or adopt an
// accepted descriptor), write a frame, read the next whole frame. Every wait has a deadline,
// and shut() from any thread ends every wait on the link at once, also one not yet begun.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <mutex>
#include <string>

#include "connect/ISocketBase.h"
#include "connect/PhoneFrame.h"

namespace kesu {

class PhoneLink {
public:
    using Clock = std::chrono::steady_clock;

    // A link not yet connected; connect() opens it.
    PhoneLink();
    // Takes over an accepted, connected descriptor.
    explicit PhoneLink(int connectedFd);
    ~PhoneLink();
    PhoneLink(const PhoneLink&) = delete;
    PhoneLink& operator=(const PhoneLink&) = delete;

    // Connects to ip:port (a numeric IPv4 or IPv6 address) before the deadline. False with
    // `error` filled when refused, unreachable, timed out or shut meanwhile.
    bool connect(const std::string& ip, std::uint16_t port, Clock::time_point deadline, std::string& error);
    // Writes all of `data` before the deadline. A write the deadline cuts short would leave half
    // a frame on the wire for the peer to misread, so the link is shut then.
    bool writeAll(const Bytes& data, Clock::time_point deadline, std::string& error);

    enum class Read {
        Frame,     // a whole frame (header included) was moved into `frame`
        TimedOut,  // the deadline passed first
        Closed,    // the peer closed or broke the link first
        Shut,      // shut() was called
    };
    // Waits for the next whole phone frame. Bytes that cannot start a frame are dropped (with
    // a log line); the buffer is bounded by Config::phoneFrameMaxBody. Frames that arrived
    // before the peer closed are handed out before Closed.
    Read readFrame(Bytes& frame, Clock::time_point deadline);
    // Why readFrame gave Closed: "" for the peer's orderly close, else the error. Reading thread only.
    const std::string& readError() const { return readError_; }

    // Ends the link for every user; safe from any thread, repeated calls do nothing. The
    // descriptors are closed by the destructor only, so no waiting thread ever polls a
    // reused descriptor number.
    void shut();
    bool isShut() const { return shut_.load(); }
    bool isConnected() const { return connected_.load(); }

    // Both ends of a connected link ("" and 0 before).
    std::string peerAddress() const;
    int peerPort() const;
    std::string localAddress() const;
    int localPort() const;

private:
    enum class Wait { Ready, Woken, TimedOut };
    Wait waitFor(short events, Clock::time_point deadline);
    void readEndpoints();

    mutable std::mutex mutex_;  // guards fd_ creation against shut(), and the endpoint texts
    int fd_ = -1;
    const int wakeFd_;
    std::atomic<bool> shut_{false};
    std::atomic<bool> connected_{false};
    std::string peerAddress_;
    int peerPort_ = 0;
    std::string localAddress_;
    int localPort_ = 0;

    // Used by the one reading thread only.
    FrameCutter cutter_;
    bool peerClosed_ = false;
    std::string readError_;
};

}  // namespace kesu
