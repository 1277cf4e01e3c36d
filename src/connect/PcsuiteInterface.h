// The PC-initiated connection to a discovered phone, and the cancel request that ends it.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "connect/SocketClient.h"

namespace kesu {

class EventLoop;

// The cancel request of the running PC-initiated connection. Setting it to true also ends
// the running attempt's wait at once (its link is shut); the attempt then answers as
// cancelled. An attempt sets it back to false when it starts.
class CancelFlag {
public:
    CancelFlag& operator=(bool cancel);
    bool load() const { return flag_.load(); }
    explicit operator bool() const { return load(); }

private:
    friend class PcsuiteInterface;
    // Makes `client`, on `loop`, the running attempt's link; returns the flag as it is now.
    bool attach(std::shared_ptr<SocketClient> client, EventLoop& loop);
    void detach();

    std::atomic<bool> flag_{false};
    std::mutex mutex_;
    std::shared_ptr<SocketClient> running_;
    EventLoop* loop_ = nullptr;
};

CancelFlag& SSDPcancel();

class PcsuiteInterface {
public:
    // The event loop the attempts' links run on; the service sets it when it starts and
    // clears it (nullptr) when it stops. Without one an attempt fails at the connect step.
    static void setLoop(EventLoop* loop);

    // The whole attempt; returns the compact connection reply {"error", "error_message",
    // "connection_steps"(, "data")(, "errir_message")}. The exchange with the phone runs on
    // the loop; the calling thread (never the loop's) blocks until the phone answered, the
    // attempt failed or was cancelled, or Config::activeConnectTimeout passed. One attempt
    // runs at a time: a call while another runs gets the busy reply.
    std::string ActiveConnect(const std::string& stringId);

    struct FreshRequest {
        ClientWorkAct::Outcome outcome = ClientWorkAct::Outcome::ConnectFailed;
        std::string answer;  // the text of the phone's answer, "" when none
    };
    // One connection request on a fresh link to ip's phone port, the exchange on the loop,
    // the calling thread (never the loop's) waiting until it ended or `deadline` passed.
    // A running PC-initiated connection is waited for first, within the same deadline: the
    // two must not overlap. `stopRequested` is asked after the connect and after the send.
    static FreshRequest requestOnFreshLink(const std::string& ip, SocketClient::Clock::time_point deadline,
                                           std::function<bool()> stopRequested = {});
};

}  // namespace kesu
