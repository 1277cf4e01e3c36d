// The report that tells the connect center about this PC: its account, ids, name, addresses,
// hardware and push client. Built from gathered facts by a pure function, so that the body
// the center reads can be checked without a machine to gather from.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "core/Json.h"

namespace kesu {

struct PcReportFacts {
    std::string userId;    // the signed-in open id
    std::string deviceId;  // the PC's id
    std::string name;      // the PC's full name
    std::string macAddress;
    // One entry per adapter address, with "ip", "netmask" and (Wi-Fi) "ssid".
    std::vector<std::map<std::string, std::string>> networks;
    std::map<std::string, std::string> systemInfo;  // "vendor", "model"
    bool wifiOn = false;
    std::string clientId;  // the push channel's client id
    std::string version;   // the PC suite's version
};

class PcReport {
public:
    // The report object (the center takes it as the one element of a reportDevice array).
    static Json build(const PcReportFacts& facts);

    // Gathers the facts from the account record and the system. The PC's id and version come
    // from the record, else from the PC suite (getPcsuiteDeviceInfo) and the service's own
    // version. Blocks (system tools, the PC suite's HTTP server): run it off the event loop.
    static PcReportFacts gather();
};

}  // namespace kesu
