// One discovery socket per network adapter: bound to the discovery port with port reuse,
// joined to the multicast group on one named interface, sending to the group, and handing
// every datagram it receives to a callback on the service's event loop.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "core/ISocketBase.h"

namespace kesu {

class EventLoop;

class SsdpSocket : public ISocketBase {
public:
    // Called on the loop for every datagram (the empty one included) with its bytes and the
    // sender's address and port.
    using Receiver = std::function<void(std::string_view data, const std::string& host, std::uint16_t port)>;

    // Creating the object is creating a working socket on interface `inNetCard` (port and
    // group from Config), on the calling thread (so in its network namespace); it then
    // receives on `loop`, which must outlive it. Received datagrams go to `receiver`; without
    // one they go through the discovery classification into the discovered-device table. A
    // set-up step that fails is logged and leaves the socket as far as it got (it may still
    // send, but does not receive); nothing is thrown.
    SsdpSocket(EventLoop& loop, std::string inNetCard, Receiver receiver = {});
    // close().
    ~SsdpSocket() override;
    SsdpSocket(const SsdpSocket&) = delete;
    SsdpSocket& operator=(const SsdpSocket&) = delete;

    // Sends one text datagram to the group through netCard (on the loop, in the order
    // queued). False, with a log line, for a text that is not UTF-8; false when the socket is
    // closed, was never opened, or could not be given netCard as its outgoing interface. True
    // means only that the datagram was queued: send errors are not reported.
    bool sendMsg(const std::string& message);
    // ISocketBase: the same for raw bytes; the time-out is not used (a datagram send does
    // not wait).
    bool sendMsg(double time, const Bytes& data) override;
    // A multicast socket has no single peer to connect to: logs and answers false.
    bool initial(std::uint16_t port, const std::string& ip, int timeout) override;
    // Stops receiving and closes the socket once the sends queued before are out. Safe from
    // any thread; off the loop it waits for a datagram being handled to finish, so that the
    // receiver is not called any more when it returns.
    bool close() override;
    // True when no open socket is left (closed, or the first set-up step failed).
    bool isSocketNull() override;
    std::string getSocketType() override { return "udp"; }

    // The interface the socket was made for (joins the group there, sends from there).
    const std::string netCard;

    // All set-up steps succeeded and the socket has not been closed since.
    bool isReceiving() const;
    // Datagrams reach this socket only from its own interface (SO_BINDTODEVICE took).
    bool isBoundToDevice() const;
    // The local port after the bind (0 before or when the bind failed).
    std::uint16_t localPort() const;

private:
    struct State;  // what the loop's pending operations hold on to

    bool queueSend(std::shared_ptr<const std::string> data);

    EventLoop& loop_;
    std::shared_ptr<State> state_;
};

}  // namespace kesu
