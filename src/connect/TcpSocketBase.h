// Blocking TCP link to a phone with time-outs: connect, send a frame, receive the next whole
// frame, close. Each wait ends the moment its event happens (connected, written, a frame or
// the peer's close arrived, close() called from another thread) or at its time-out.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <string>

#include "connect/ISocketBase.h"

namespace kesu {

class TcpSocketBase : public ISocketBase {
public:
    TcpSocketBase() = default;
    ~TcpSocketBase() override;
    TcpSocketBase(const TcpSocketBase&) = delete;
    TcpSocketBase& operator=(const TcpSocketBase&) = delete;

    // Connects to ip:port (a numeric IPv4 or IPv6 address) within `timeout` seconds; a
    // link already open is closed first. A refused or failed connect returns false at once.
    bool initial(std::uint16_t port, const std::string& ip, int timeout) override;
    // Ends the link and wakes every thread waiting on it. Always true.
    bool close() override;
    // Writes the whole buffer within `time` seconds. A write cut short by the time-out
    // leaves half a frame on the wire, so the link is closed then.
    bool sendMsg(double time, const Bytes& data) override;
    // Waits up to `time` seconds for the next whole phone frame (header included) and moves
    // it into `data`. Frames that arrived before the peer closed are still handed out; after
    // them, a closed or broken link gives false with `errorCode` -1. A time-out gives false
    // and leaves `errorCode` alone; a frame arriving later is kept for the next call.
    bool recvMsg(double time, Bytes& data, int& errorCode) override;
    bool isSocketNull() override { return false; }
    std::string getSokcetType() override { return "tcp"; }

    bool isConnected() const;

private:
    struct Link;
    std::shared_ptr<Link> currentLink() const;
    std::shared_ptr<Link> takeLink();
    bool detach(const std::shared_ptr<Link>& link);  // true if `link` was the current one

    std::mutex initialMutex_;  // one connect at a time
    mutable std::mutex mutex_;
    std::shared_ptr<Link> link_;  // guarded by mutex_
};

}  // namespace kesu
