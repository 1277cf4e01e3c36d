// One discovery socket per network adapter: bound to the discovery port with port reuse,
// joined to the multicast group on one named interface, sending to the group, and handing
// every datagram it receives to a callback on the socket's own receive thread.
#pragma once

#include <asio/executor_work_guard.hpp>
#include <asio/ip/udp.hpp>
#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "connect/UdpSocketBase.h"

namespace kesu {

class SsdpSocket : public UdpSocketBase {
public:
    // Called on the socket's receive thread for every datagram (the empty one included)
    // with its bytes and the sender's address and port.
    using Receiver = std::function<void(std::string_view data, const std::string& host, std::uint16_t port)>;

    // Creating the object is creating a working socket on interface `inNetCard` (port and
    // group from Config). Received datagrams go to `receiver`; without one they go through
    // the discovery classification into the discovered-device table. A set-up step that
    // fails is logged and leaves the socket as far as it got (it may still send, but does
    // not receive); nothing is thrown.
    explicit SsdpSocket(std::string inNetCard, Receiver receiver = {});
    // Closes the socket after the sends already queued and joins the receive thread. Must
    // not run on that thread (a receiver must not destroy its own socket).
    ~SsdpSocket() override;

    // Sends one text datagram to the group through netCard. False, with a log line, for a
    // text that is not UTF-8; false when the socket is closed, was never opened, or could
    // not be given netCard as its outgoing interface. True means only that the datagram was
    // queued: send errors are not reported.
    bool sendMsg(const std::string& message);
    // ISocketBase: the same for raw bytes; the time-out is not used (a datagram send does
    // not wait).
    bool sendMsg(double time, const Bytes& data) override;
    // A multicast socket has no single peer to connect to: logs and answers false.
    bool initial(std::uint16_t port, const std::string& ip, int timeout) override;
    // Stops receiving and closes the socket once the queued sends are out. Safe from any
    // thread; waits for a datagram being handled to finish (except on the receive thread).
    bool close() override;
    // True when no open socket is left (closed, or the first set-up step failed).
    bool isSocketNull() override;

    // The interface the socket was made for (joins the group there, sends from there).
    const std::string netCard;

    // All set-up steps succeeded and the socket has not been closed since.
    bool isReceiving() const { return receiving_.load(); }
    // Datagrams reach this socket only from its own interface (SO_BINDTODEVICE took).
    bool isBoundToDevice() const { return boundToDevice_.load(); }
    // The local port after the bind (0 before or when the bind failed).
    std::uint16_t localPort() const { return localPort_.load(); }

private:
    void initSocket();
    bool setMulticastInterface();
    void startReceive();
    void onReceive(const asio::error_code& error, std::size_t bytes);
    bool queueSend(std::shared_ptr<const std::string> data);

    Receiver receiver_;
    unsigned interfaceIndex_ = 0;
    asio::ip::udp::endpoint group_;
    std::vector<char> buffer_;         // one datagram, receive thread only
    asio::ip::udp::endpoint sender_;   // receive thread only
    std::optional<asio::executor_work_guard<asio::io_context::executor_type>> work_;
    std::thread ioThread_;

    std::atomic<bool> started_{false};  // the receive thread runs and takes sends
    std::atomic<bool> closed_{false};
    std::atomic<bool> receiving_{false};
    std::atomic<bool> boundToDevice_{false};
    std::atomic<bool> multicastIfSet_{false};  // datagrams leave through netCard
    std::atomic<std::uint16_t> localPort_{0};
    std::atomic<int> receiveErrors_{0};  // consecutive receive failures
};

}  // namespace kesu
