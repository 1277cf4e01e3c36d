// The dispatcher behind the control server: turns a decoded request into its action and
// the JSON answer (or the empty text).
#pragma once

#include <string>
#include <string_view>

#include "control/RequestEvent.h"

namespace kesu {

class ResponseHandler {
public:
    // The answer to one request; the empty text means an empty HTTP body.
    static std::string create(const requestObj& request);
    // Body bytes to text: 0xFF bytes are left out; invalid UTF-8 gives the empty text.
    static std::string switchUint8ArrToString(std::string_view body);
    // {"error": error, "error_message": message} pretty-printed.
    static std::string response(int error, const std::string& message);
    static Json responseObject(int error, const std::string& message);
    // The network adapter report and the system report (firewall and related PC facts).
    static std::string structureQueryAdapterRes();
    static std::string querySystemStatus();
};

}  // namespace kesu
