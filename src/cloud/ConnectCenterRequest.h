// Client of the cloud connect center.
#pragma once

#include <optional>
#include <string>

#include "core/Json.h"

namespace kesu {

class ConnectCenterRequest {
public:
    // Reports / creates an event; the connect center's JSON answer, none when it gave none.
    static std::optional<Json> reportEvent(const Json& data, int& status, std::string& msg);
    static std::optional<Json> createEvent(const Json& data, int& status, std::string& msg);
};

}  // namespace kesu
