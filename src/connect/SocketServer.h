// The server for phone-initiated connections: listens on the phone port, reads one request
// frame per accepted link, answers busy while another PC suite connection is handled, hands
// the request to LaunchService, and closes the link. ServerWorkAct starts it.
#pragma once

#include <asio/io_context.hpp>
#include <asio/ip/tcp.hpp>
#include <asio/steady_timer.hpp>
#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <list>
#include <memory>
#include <mutex>
#include <thread>

#include "connect/ConnectCodes.h"
#include "connect/LaunchService.h"
#include "connect/PhoneLink.h"

namespace kesu {

class SocketServer {
public:
    static SocketServer& singleton();

    SocketServer();
    ~SocketServer();  // stop()
    SocketServer(const SocketServer&) = delete;
    SocketServer& operator=(const SocketServer&) = delete;

    // Opens the listener on Config phoneServerHost:phoneServerPort. True when listening
    // (also when it already was); false, logged, when the port cannot be had.
    bool ConnectStatusGet();
    // Closes the listener and every link, ends the allow-window waits and waits for the
    // link handlers to finish. The server can be opened again afterwards.
    void stop();

    // The port listened on; 0 when not listening.
    int port() const;
    // Links accepted and not yet finished.
    std::size_t linkCount() const;
    // Waits until no link is open or the time-out passed; true when none is.
    bool waitForNoLinks(std::chrono::milliseconds timeout) const;

    // Sends the PC's answer (pretty-printed, framed) on `link`; true when it left in time.
    static bool sendTcp(PhoneLink& link, ConnectTag tag, serviceId id);

    LaunchService& launcher() { return launch_; }

private:
    struct Session;

    void startAccept();
    void onAccept(asio::ip::tcp::socket socket);
    void handleLink(Session& session);
    void handleRequest(PhoneLink& link, const PhoneConnectRequest& request);
    void reapFinishedLocked();

    LaunchService launch_;

    asio::io_context io_;
    asio::ip::tcp::acceptor acceptor_{io_};
    asio::steady_timer retryTimer_{io_};
    std::thread ioThread_;
    std::mutex lifecycleMutex_;  // one ConnectStatusGet / stop at a time
    bool listening_ = false;     // guarded by lifecycleMutex_
    std::atomic<int> port_{0};

    mutable std::mutex sessionsMutex_;
    mutable std::condition_variable sessionsChanged_;
    std::list<std::unique_ptr<Session>> sessions_;  // guarded by sessionsMutex_
    std::size_t openLinks_ = 0;                     // sessions not yet finished
};

class ServerWorkAct {
public:
    explicit ServerWorkAct(SocketServer& server = SocketServer::singleton()) : ServerShared(server) {}

    // Starts the server; false when it could not listen (the service runs on without it).
    bool ServerAccept() { return ServerShared.ConnectStatusGet(); }

    SocketServer& ServerShared;
};

}  // namespace kesu
