// A phone or pad heard on the LAN: the record built from one announcement and its JSON form,
// the element of the device lists given to the PC suite. Stored records are never modified.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "core/Json.h"

namespace kesu {

class SsdpDevice {
public:
    std::string deviceName;            // prefix stripped, masked
    std::string deviceId;              // table key: hex of the first 4 characters of the id
    std::string account;               // masked
    std::string openId;                // as announced
    std::vector<std::string> ip;       // the sender of the datagram that produced the record
    std::string guide;                 // "pcCustomizedData", not interpreted here
    bool isOpenIdSame = false;         // same open id as the account signed in on this PC
    bool isDeviceNameFull = true;      // false when deviceName was masked
    bool isAccountFull = true;         // false when account was masked
    double lastUpdate = 0.0;           // wall-clock seconds of the datagram that stored it (shown
                                       // and logged only: the table ages entries monotonically)
    std::string deviceType = "phone";  // "phone" or "pad"

    // The ten members of the device-list element; lastUpdate is not part of it.
    Json toJson() const;
};

// Records are shared: a reader keeps a consistent snapshot of one announcement.
using SsdpDevicePtr = std::shared_ptr<const SsdpDevice>;

}  // namespace kesu
