// The discovery datagrams on the multicast group: building the PC's announcement and the
// search message, classifying a received datagram (old and current announcement formats),
// parsing it into an SsdpDevice and storing it in the discovered-device table.
#pragma once

#include <string>
#include <string_view>

#include "core/Json.h"
#include "discovery/SsdpDevice.h"

namespace kesu {

class SsdpDeviceManager;

class SsdpMessage {
public:
    // ---- Outgoing --------------------------------------------------------------------------
    // The PC's eight-member announcement object.
    static Json pcAnnouncement(const std::string& deviceName, const std::string& deviceId,
                               const std::string& account, const std::string& openId,
                               const std::string& serviceId);
    // "RESPONSE * HTTP/1.1\r\nDATE:<now>\r\ncompatGsonStr:<base64 of the compact object>\r\n"
    static std::string responseMessage(const std::string& deviceName, const std::string& deviceId,
                                       const std::string& account, const std::string& openId,
                                       const std::string& serviceId);
    // The M-SEARCH text (LF-separated lines, the last one ending in CR LF).
    static std::string searchMessage(const std::string& deviceId, const std::string& openId,
                                     const std::string& serviceId);
    // The service record the PC announces: pcsuite service id + "--" + share service id.
    static std::string pcServiceRecord();

    // ---- Incoming --------------------------------------------------------------------------
    enum class Handling {
        dropped,        // empty, no sender, not UTF-8, bad payload
        ignored,        // not a device announcement of interest (search, the PC's own, ...)
        oldFormat,      // handed to insertResponseDevice as old format
        currentFormat,  // handed to insertResponseDevice as current format
    };

    // The whole receive path for one datagram from `host`: classification, the own echo
    // noted in `manager`, parse and store into its table.
    static Handling handleDatagram(std::string_view data, const std::string& host);
    static Handling handleDatagram(std::string_view data, const std::string& host, SsdpDeviceManager& manager);

    // The decoded JSON text of a current-format datagram: what follows the first
    // "compatGsonStr:", CR LF pairs removed, strictly base64-decoded. Empty when absent or
    // undecodable (UTF-8 is not checked here).
    static std::string decodeCompatPayload(std::string_view text);

    // Fill `device` from a current-format JSON text / an old-format datagram text. False for
    // an empty text, and for an old-format text whose markers are missing or out of order.
    static bool parserResponseData(const std::string& ssdpData, SsdpDevice& device);
    static bool parserOldResponseData(const std::string& ssdpData, SsdpDevice& device);

    // Parses (current format when newDataFlag) and stores the record under its device id;
    // `openId` is the PC's own, for isOpenIdSame. The change observers of the manager see
    // the record before the table changes.
    static void insertResponseDevice(const std::string& recvData, const std::string& ip, const std::string& openId,
                                     bool newDataFlag);
    static void insertResponseDevice(const std::string& recvData, const std::string& ip, const std::string& openId,
                                     bool newDataFlag, SsdpDeviceManager& manager);

    // ---- Rules -----------------------------------------------------------------------------
    // Values of 7 or more user-perceived characters become first 3 + "****" + last 3 and
    // `full` is false; shorter ones stay as they are with `full` true.
    static std::string maskValue(const std::string& value, bool& full);
    // Lowercase hex of the UTF-8 bytes of the first 4 user-perceived characters of the id.
    static std::string deviceIdentifier(const std::string& announcedId);
};

}  // namespace kesu
