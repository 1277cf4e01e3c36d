// Who may command the service: the control port is on loopback, where every local account
// can reach it, so a connection is served only when the process at its other end runs as
// this service's user or as root. Refusals are logged, at most one line a minute for each
// refused user (and one for connections whose owner could not be found).
#pragma once

#include <sys/types.h>

#include <chrono>
#include <map>
#include <mutex>
#include <optional>
#include <string>

namespace kesu {

class PeerGate {
public:
    PeerGate();
    // True when the connection `fd` may be served. Called once per connection, right after
    // accept: the client is then still waiting for its answer, so its socket is open.
    bool admit(int fd);

private:
    using Clock = std::chrono::steady_clock;
    static constexpr std::size_t maxRemembered = 256;

    // Whether a refusal of `uid` (nullopt: owner unknown) is to be logged now.
    bool shouldLog(std::optional<uid_t> uid);

    uid_t self_;
    std::mutex mutex_;
    std::map<long long, Clock::time_point> lastLogged_;  // key -1: owner unknown
};

}  // namespace kesu
