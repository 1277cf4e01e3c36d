// A UDP socket on an ephemeral loopback port that catches the datagrams a test expects.
#pragma once

#include <chrono>
#include <optional>
#include <string>

namespace kesu::test {

class UdpCatcher {
public:
    UdpCatcher();  // bound to 127.0.0.1, an ephemeral port
    ~UdpCatcher();
    UdpCatcher(const UdpCatcher&) = delete;
    UdpCatcher& operator=(const UdpCatcher&) = delete;

    int port() const { return port_; }
    // The next datagram, or nullopt when none arrives within `timeout`.
    std::optional<std::string> receive(std::chrono::milliseconds timeout);

private:
    int fd_ = -1;
    int port_ = 0;
};

}  // namespace kesu::test
