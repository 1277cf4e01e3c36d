#include "control/PeerGate.h"

#include <unistd.h>

#include <algorithm>

#include "core/Log.h"
#include "platform/PeerOwner.h"

namespace kesu {

PeerGate::PeerGate() : self_(::geteuid()) {}

bool PeerGate::admit(int fd) {
    std::string why;
    const std::optional<uid_t> owner = peer::connectedPeerOwner(fd, &why);
    if (owner && (*owner == self_ || *owner == 0)) return true;
    if (shouldLog(owner)) {
        if (owner) {
            Log::mPrintlog("[httpService] refused a control connection from uid " + std::to_string(*owner) +
                             ": not this service's user");
        } else {
            Log::mPrintlog("[httpService] refused a control connection: its owner is unknown (" + why + ")");
        }
    }
    return false;
}

bool PeerGate::shouldLog(std::optional<uid_t> uid) {
    const long long key = uid ? static_cast<long long>(*uid) : -1;
    const Clock::time_point now = Clock::now();
    std::lock_guard<std::mutex> lock(mutex_);
    if (auto it = lastLogged_.find(key); it != lastLogged_.end()) {
        if (now - it->second < std::chrono::minutes(1)) return false;
        it->second = now;
        return true;
    }
    if (lastLogged_.size() >= maxRemembered) {
        std::erase_if(lastLogged_, [&](const auto& entry) { return now - entry.second >= std::chrono::minutes(1); });
        if (lastLogged_.size() >= maxRemembered) {
            lastLogged_.erase(std::min_element(lastLogged_.begin(), lastLogged_.end(),
                                               [](const auto& a, const auto& b) { return a.second < b.second; }));
        }
    }
    lastLogged_.emplace(key, now);
    return true;
}

}  // namespace kesu
