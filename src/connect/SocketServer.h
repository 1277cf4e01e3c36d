// The server for phone-initiated connections: listens on the phone port, reads one request
// frame per accepted link, answers busy while another PC suite connection is handled, hands
// the request to LaunchService, and closes the link. The listener and every link run on the
// service's event loop, one coroutine per link. ServerWorkAct starts it.
#pragma once

#include <asio/awaitable.hpp>
#include <asio/ip/tcp.hpp>
#include <asio/steady_timer.hpp>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <memory>
#include <mutex>
#include <set>

#include "core/ConnectCodes.h"
#include "connect/LaunchService.h"
#include "connect/PhoneLink.h"

namespace kesu {

class EventLoop;

class SocketServer {
public:
    // Runs on `loop`, which outlives the server.
    explicit SocketServer(EventLoop& loop);
    ~SocketServer();  // stop()
    SocketServer(const SocketServer&) = delete;
    SocketServer& operator=(const SocketServer&) = delete;

    // Opens the listener on Config phoneServerHost:phoneServerPort. True when listening
    // (also when it already was); false, logged, when the port cannot be had.
    bool ConnectStatusGet();
    // Closes the listener and every link, ends the allow-window waits and waits for the
    // link handlers to finish. The server can be opened again afterwards. Not on the loop.
    void stop();

    // The port listened on; 0 when not listening.
    int port() const { return port_.load(); }
    // Links accepted and not yet finished.
    std::size_t linkCount() const;
    // Waits until no link is open or the time-out passed; true when none is.
    bool waitForNoLinks(std::chrono::milliseconds timeout) const;

    // Sends the PC's answer (pretty-printed, framed) on `link`; true when it left in time.
    static asio::awaitable<bool> sendTcp(PhoneLink& link, ConnectTag tag, serviceId id);

private:
    void startAccept();
    void onAccept(asio::ip::tcp::socket socket);
    asio::awaitable<void> handleLink(std::shared_ptr<PhoneLink> link);
    asio::awaitable<void> handleRequest(PhoneLink& link, PhoneConnectRequest request);
    void linkEnded(const std::shared_ptr<PhoneLink>& link);

    EventLoop& loop_;
    LaunchService launch_;
    asio::ip::tcp::acceptor acceptor_;
    asio::steady_timer retryTimer_;
    std::mutex lifecycleMutex_;  // one ConnectStatusGet / stop at a time
    bool listening_ = false;     // guarded by lifecycleMutex_
    std::atomic<int> port_{0};

    std::set<std::shared_ptr<PhoneLink>> links_;  // open links; on the loop only
    mutable std::mutex countMutex_;
    mutable std::condition_variable countChanged_;
    std::size_t openLinks_ = 0;  // links_.size(), for other threads; guarded by countMutex_
};

class ServerWorkAct {
public:
    explicit ServerWorkAct(SocketServer& server) : ServerShared(server) {}

    // Starts the server; false when it could not listen (the service runs on without it).
    bool ServerAccept() { return ServerShared.ConnectStatusGet(); }

    SocketServer& ServerShared;
};

}  // namespace kesu
