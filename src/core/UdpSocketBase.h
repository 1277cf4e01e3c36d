// A connected UDP client socket that sends single datagrams to a local peer (the telemetry
// collector, the push client): the datagram variant of ISocketBase. A plain socket: no event
// loop and no thread behind it, so that a datagram costs one system call; sends, connects and
// closes may come from any thread.
#pragma once

#include <cstdint>
#include <mutex>
#include <string>

#include "core/ISocketBase.h"

namespace kesu {

class UdpSocketBase : public ISocketBase {
public:
    UdpSocketBase() = default;
    ~UdpSocketBase() override;
    UdpSocketBase(const UdpSocketBase&) = delete;
    UdpSocketBase& operator=(const UdpSocketBase&) = delete;

    // Connects the socket to ip:port (an address literal or a host name). False, with a log
    // line, when that fails. The time-out is not used: a datagram connect does not wait.
    bool initial(std::uint16_t port, const std::string& ip, int timeout) override;
    // Closes the socket; later sends fail.
    bool close() override;
    // Sends `data` as one datagram without waiting: true when the system took it.
    bool sendMsg(double time, const Bytes& data) override;
    // Datagram links here only send: answers nothing and returns true.
    bool recvMsg(double time, Bytes& data, int& errorCode) override;
    bool isSocketNull() override;
    std::string getSocketType() override;  // "udp"

    // Sends `text` as one datagram to a listener on this machine (127.0.0.1:port, e.g. the
    // push client or the telemetry collector); true when the system took it.
    static bool sendToLocalPort(int port, const std::string& text);

private:
    std::mutex mutex_;     // guards the two below
    int fd_ = -1;
    bool used_ = false;    // initial() was called at least once
};

}  // namespace kesu
