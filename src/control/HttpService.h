// The local control server: one catch-all handler on 127.0.0.1 (port 9197 by default) that
// decodes the length-prefixed envelope, dispatches it and answers "N#json" or an empty body.
#pragma once

#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "control/PeerGate.h"

namespace httplib {
class Server;
}

namespace kesu {

class HttpService {
public:
    HttpService();
    ~HttpService();
    HttpService(const HttpService&) = delete;
    HttpService& operator=(const HttpService&) = delete;

    // Creates and starts the server if there is none. False when it could not listen.
    bool startHttpService();
    // Stops the server (if any) and waits for its listener to end.
    void stop();
    bool isRunning() const;
    // The port actually listened on (useful when Config asks for port 0), 0 when stopped.
    int port() const;

    // The full answer body for a request body: "N#json" or "".
    static std::string handleBody(const std::string& body);

private:
    PeerGate gate_;  // outlives every server this object starts
    mutable std::mutex mutex_;
    std::unique_ptr<httplib::Server> serve_;
    std::thread listener_;
    std::future<void> listenerEnded_;
    int port_ = 0;
};

}  // namespace kesu
