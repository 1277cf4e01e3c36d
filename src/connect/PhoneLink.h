// One TCP link with a phone on the service's event loop: connect (or adopt an accepted
// socket), write a frame, read the next whole frame. Each step is a coroutine with an optional
// deadline (a timer raced against the socket operation); a link waiting without a deadline
// costs no wake-ups. Every call, shut() included, is made on the loop: another thread posts
// it there. shut() ends every wait on the link at once, also one not yet begun.
#pragma once

#include <asio/awaitable.hpp>
#include <asio/ip/tcp.hpp>
#include <asio/steady_timer.hpp>

#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "core/ISocketBase.h"
#include "connect/PhoneFrame.h"

namespace kesu {

class PhoneLink {
public:
    using Clock = std::chrono::steady_clock;
    // A wait without a deadline (a held link waiting for the phone's next message).
    static constexpr Clock::time_point kNoDeadline = Clock::time_point::max();

    // A link not yet connected; connect() opens it.
    explicit PhoneLink(const asio::any_io_executor& executor);
    // Takes over an accepted, connected socket.
    explicit PhoneLink(asio::ip::tcp::socket socket);
    PhoneLink(const PhoneLink&) = delete;
    PhoneLink& operator=(const PhoneLink&) = delete;

    // Connects to ip:port (a numeric IPv4 or IPv6 address) before the deadline. False with
    // `error` filled when refused, unreachable, timed out or shut meanwhile.
    asio::awaitable<bool> connect(std::string ip, std::uint16_t port, Clock::time_point deadline, std::string& error);
    // Writes all of `data` before the deadline. A write the deadline cuts short would leave half
    // a frame on the wire for the peer to misread, so the link is shut then.
    asio::awaitable<bool> writeAll(const Bytes& data, Clock::time_point deadline, std::string& error);

    enum class Read {
        Frame,     // a whole frame (header included) was moved into `frame`
        TimedOut,  // the deadline passed first
        Closed,    // the peer closed or broke the link first
        Shut,      // shut() was called
    };
    // Waits for the next whole phone frame. Bytes that cannot start a frame are dropped (with
    // a log line); a frame is handed out only once the body its length announces has arrived,
    // and one announcing more than Config::phoneFrameMaxBody is dropped. Frames that arrived
    // before the peer closed are handed out before Closed. One reader at a time.
    asio::awaitable<Read> readFrame(Bytes& frame, Clock::time_point deadline);
    // Why readFrame gave Closed: "" for the peer's orderly close, else the error.
    const std::string& readError() const { return readError_; }

    // TCP keep-alive on a connected link: the first probe after `idleSeconds` without
    // traffic, then one every `intervalSeconds`, the link given up after `probes` unanswered.
    bool enableKeepAlive(int idleSeconds, int intervalSeconds, int probes);

    // Ends the link; repeated calls do nothing.
    void shut();
    bool isShut() const { return shut_.load(); }
    bool isConnected() const { return connected_.load(); }

    // Both ends of a connected link ("" and 0 before).
    const std::string& peerAddress() const { return peerAddress_; }
    int peerPort() const { return peerPort_; }
    const std::string& localAddress() const { return localAddress_; }
    int localPort() const { return localPort_; }

private:
    void adopt();
    // `operation` raced against `timer` set to `deadline`; nullopt when the deadline came first.
    template <class T>
    asio::awaitable<std::optional<T>> beforeDeadline(asio::awaitable<T> operation, asio::steady_timer& timer,
                                                     Clock::time_point deadline);

    asio::ip::tcp::socket socket_;
    asio::steady_timer readTimer_;
    asio::steady_timer writeTimer_;  // also the connect's
    std::atomic<bool> shut_{false};
    std::atomic<bool> connected_{false};
    std::string peerAddress_;
    int peerPort_ = 0;
    std::string localAddress_;
    int localPort_ = 0;

    FrameCutter cutter_;
    bool peerClosed_ = false;
    std::string readError_;
    std::array<std::uint8_t, 4096> chunk_{};
};

}  // namespace kesu
