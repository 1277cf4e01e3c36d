// The blocking socket interface that a remote device record holds as its link to a phone;
// UdpSocketBase (datagrams) implements it.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace kesu {

using Bytes = std::vector<std::uint8_t>;

class ISocketBase {
public:
    virtual ~ISocketBase() = default;

    // Connects to ip:port, waiting at most `timeout` seconds.
    virtual bool initial(std::uint16_t port, const std::string& ip, int timeout) {
        (void)port, (void)ip, (void)timeout;
        return true;
    }
    // Ends the link. Safe to call from any thread, also while another thread is blocked in
    // sendMsg or recvMsg on the same object.
    virtual bool close() { return true; }
    // Sends `data`, waiting at most `time` seconds for it to be taken by the system.
    virtual bool sendMsg(double time, const Bytes& data) {
        (void)time, (void)data;
        return true;
    }
    // Waits at most `time` seconds for the next message and moves it into `data`. A broken
    // link sets `errorCode` to -1; a time-out leaves it as it was.
    virtual bool recvMsg(double time, Bytes& data, int& errorCode) {
        (void)time, (void)data, (void)errorCode;
        return true;
    }
    virtual bool isSocketNull() { return false; }
    virtual std::string getSocketType() { return ""; }
};

}  // namespace kesu
