// The requests that wait for the PC suite's answer (bury points, the busy checks) and the
// HeartBeat to the service's own control server. Every call blocks up to its time-out: on
// the event loop they go to the pool.
#pragma once

#include <string>

namespace kesu {

class PcsuiteClient {
public:
    // Frames a non-empty text as "N#text" (N its count of user-perceived characters) into
    // `finalStr`; false, and nothing framed, for an empty text.
    static bool RebuildEventData(const std::string& str, std::string& finalStr);
    // Posts a list-shape bury-point text to the PC suite; true when it answered "000000".
    static bool sendBuryPoint(const std::string& data);
    // Asks the PC suite whether a device of `deviceType` may connect. A PC suite that does
    // not answer counts as "connectable". When busy, the PC suite's connected device type
    // and connection status are handed back.
    static bool isDeviceConnectable(const std::string& deviceType, std::string& respondDeviceType,
                                    std::string& connectStatus);
    // Asks the PC suite whether it is already connected to a phone; true with the number of
    // its "N#..." answer in `responseCode`.
    static bool isConnectToPhoneAlready(int& responseCode);
    // Sends a HeartBeat to the service's own control server; true when it answered.
    static bool isHttpAlive();
    // Sends `data` with `method` to `url`; true when an answer came back. `response` is
    // left as it is.
    static bool httpMsgSend(const std::string& data, const std::string& url, const std::string& method,
                            std::string& response);
};

}  // namespace kesu
