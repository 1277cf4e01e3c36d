// The PC-initiated connection to a discovered phone.
#pragma once

#include <atomic>
#include <string>

namespace kesu {

// Cancel request for the running PC-initiated connection.
std::atomic<bool>& SSDPcancel();

class Pcuitinterface {
public:
    // The whole attempt; returns the compact connection reply.
    std::string ActiveConnect(const std::string& stringId);
};

}  // namespace kesu
