// Decoding of a control request body: the optional "N#" prefix and the JSON envelope
// {"event", "args"} or {"cmd", "param"}.
#pragma once

#include <optional>
#include <string>

#include "control/RequestEvent.h"

namespace kesu {

class RequestHandle {
public:
    requestObj format(const std::string& requestStr) const;
    // The parsed value: nothing for the empty text; a null value for text that is not JSON.
    std::optional<Json> parseJson(const std::string& jsonString) const;
    static bool isEmpty(const std::string& s) { return s.empty(); }
};

}  // namespace kesu
