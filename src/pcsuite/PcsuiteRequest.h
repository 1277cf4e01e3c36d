// Requests to the PC suite's local HTTP server that go through RequestBase: the PC's device
// information and the start of a connection to a pre-connected device.
#pragma once

#include <map>
#include <optional>
#include <string>

#include "core/Json.h"
#include "pcsuite/RequestBase.h"

namespace kesu {

enum class PCSUITE_HTTP_PATH { GET_PC_DEVICE_INFO, START_CONNECT_PRE_DEVICE };
std::string rawValue(PCSUITE_HTTP_PATH path);  // "pcDeviceInfo", "connectDevice"

enum class PcsuiteResCode { Success };
std::string rawValue(PcsuiteResCode code);  // "000000"

// What the PC suite made of a request to connect a pre-connected device: "data"."code" (0 is
// success) and "data"."reason".
struct ConnectDeviceOutcome {
    long long code = 0;
    std::string reason;
};

class PcsuiteRequest {
public:
    // Sends `body` (compact JSON, or nothing) to the PC suite's `path` and returns the answer
    // when the PC suite accepted the request ("code" is the text "000000"), else none.
    static std::optional<Json> requestIntercept(const std::string& path, const std::optional<Json>& body = std::nullopt,
                                                MethodType method = MethodType::post,
                                                const std::optional<RequestBase::Headers>& header = std::nullopt);
    static std::optional<Json> responseIntercept(const Json& answer, const std::string& path);

    // The PC suite's device information ("data"."deviceId", "data"."version").
    static std::optional<Json> getPcDeviceInfo();
    // Asks the PC suite to start the user-visible connection to a pre-connected device.
    static std::optional<Json> startConnectPreDevice(const std::map<std::string, std::string>& data);
    // The outcome carried by an accepted startConnectPreDevice answer; none unless "data" has
    // an integer "code" and a text "reason".
    static std::optional<ConnectDeviceOutcome> connectDeviceOutcome(const Json& answer);
};

}  // namespace kesu
