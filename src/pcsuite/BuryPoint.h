// Telemetry records ("bury points") in the list shape that is posted to the PC suite
// (PcsuiteClient::sendBuryPoint).
#pragma once

#include <nlohmann/json.hpp>
#include <string>

#include "core/Json.h"
#include "pcsuite/PcsuiteClient.h"

namespace kesu {

class BuryPoint {
public:
    // Members keep the order they were added in, so records read like they are built.
    using Record = nlohmann::ordered_json;

    // {"type": 1, "eventId": eventId, "params": params}, followed by the members of `extra`
    // (for example "duration" and "num").
    static Record listRecord(const std::string& eventId, const Json& params, const Json& extra = Json::object());
    // A record sent as a datagram to the telemetry collector: {"pType": 0, "eventID": eventId,
    // "value": value, "isDayReport": 0, "createTime": now in milliseconds}.
    static Record datagramRecord(const std::string& eventId, Record value);
    // The text posted to the PC suite: "[" + the record's JSON text + "]".
    static std::string listText(const Record& record, bool pretty = false);
};

}  // namespace kesu
