// Telemetry records ("bury points") in their two shapes: the list shape that is posted to the
// PC suite (Utils::sendBuryPoint) and the flat shape sent as one datagram to the local
// telemetry collector.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

#include "core/Json.h"

namespace kesu {

class BuryPoint {
public:
    // Members keep the order they were added in, so records read like they are built.
    using Record = nlohmann::ordered_json;

    // {"type": 1, "eventId": eventId, "params": params}, followed by the members of `extra`
    // (for example "duration" and "num").
    static Record listRecord(const std::string& eventId, const Json& params, const Json& extra = Json::object());
    // The text posted to the PC suite: "[" + the record's JSON text + "]".
    static std::string listText(const Record& record, bool pretty = false);

    // {"pType": 0, "eventID": eventId, "value": value, "isDayReport": 0, "createTime": now in
    // whole milliseconds}.
    static Record flatRecord(const std::string& eventId, const Json& value);
    // Sends the record's compact JSON as one datagram to the collector
    // (Config buryPointUdpHost:buryPointUdpPort). True when the datagram left.
    static bool sendFlat(const Record& record);
};

}  // namespace kesu
