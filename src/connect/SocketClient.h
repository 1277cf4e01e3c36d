// The PC's side of a connection request to a phone: SocketClient is one link to the phone's
// port with the text of the phone's answer; ClientWorkAct runs the exchange on it (connect,
// send the request frame, read the one answer) as one coroutine on the event loop. Used by
// the PC-initiated connection and by the fallback of the connection over a pre-connection.
#pragma once

#include <asio/awaitable.hpp>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "connect/PhoneLink.h"

namespace kesu {

// Every member but ServerMessageReceive() runs on the loop of `executor`.
class SocketClient {
public:
    using Clock = PhoneLink::Clock;

    explicit SocketClient(const asio::any_io_executor& executor) : link_(executor) {}

    // Connects to host:ConnectServerPort before the deadline; false (logged) when that fails.
    asio::awaitable<bool> connect(std::uint16_t ConnectServerPort, std::string host, Clock::time_point deadline);
    // Ends the link, also before or during connect(). Every wait ends at once.
    void disConnectServer();
    // Writes one frame before the deadline.
    asio::awaitable<bool> C2SsendMessage(const Bytes& message, Clock::time_point deadline);
    // Reads the phone's next frame before the deadline and keeps its text (the body as
    // UTF-8, "error parse" when it is not UTF-8). True when a frame arrived.
    asio::awaitable<bool> CFrSpullMessage(Clock::time_point deadline);

    // The text of the last answer read; "" when none. Any thread.
    std::string ServerMessageReceive() const;
    void clearServerMessageReceive();
    // True once disConnectServer() was called.
    bool isDisconnected() const { return link_.isShut(); }

private:
    PhoneLink link_;
    mutable std::mutex mutex_;
    std::string serverMessageReceive_;
};

class ClientWorkAct {
public:
    using Clock = SocketClient::Clock;

    enum class Outcome {
        Answered,       // a frame came back (its text is in ClientShared)
        ConnectFailed,  // the phone's port could not be connected
        NoAnswer,       // connected, but no frame before the deadline or the link's end
        Stopped,        // `stopRequested` said so, or the link was ended from outside
    };

    explicit ClientWorkAct(std::shared_ptr<SocketClient> client) : ClientShared(std::move(client)) {}

    // Connects to ip:Port, sends the connection request frame and reads the phone's answer,
    // all before the deadline. Sets the connection state's wlanConnState by the connect's result.
    // `stopRequested` is asked after the connect and after the send.
    asio::awaitable<Outcome> ClientReqServer(std::uint16_t Port, std::string ip, Clock::time_point deadline,
                                             std::function<bool()> stopRequested = {});
    // Forgets the answer text and closes the link (on the loop).
    void ClientDisConnServer();

    std::shared_ptr<SocketClient> ClientShared;
};

}  // namespace kesu
