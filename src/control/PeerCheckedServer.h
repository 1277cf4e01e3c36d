// The control server's HTTP server: the library's server with one check per connection,
// made before the first byte is read. A connection the check refuses is closed unanswered;
// every other one is served exactly as the library serves it (keep-alive included, so the
// check costs once per connection, not per request).
#pragma once

#include <httplib.h>

#include <functional>

namespace kesu {

class PeerCheckedServer : public httplib::Server {
public:
    // `admit` sees each accepted socket on the worker that is about to serve it.
    using Admit = std::function<bool(socket_t)>;
    explicit PeerCheckedServer(Admit admit) : admit_(std::move(admit)) {}

private:
    bool process_and_close_socket(socket_t sock) override;

    Admit admit_;
};

}  // namespace kesu
