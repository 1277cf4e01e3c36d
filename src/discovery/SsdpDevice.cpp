#include "discovery/SsdpDevice.h"

namespace kesu {

Json SsdpDevice::toJson() const {
    return Json{
        {"deviceName", deviceName},
        {"deviceId", deviceId},
        {"account", account},
        {"openId", openId},
        {"isOpenIdSame", isOpenIdSame},
        {"isDeviceNameFull", isDeviceNameFull},
        {"isAccountFull", isAccountFull},
        {"guide", guide},
        {"ip", ip},
        {"deviceType", deviceType},
    };
}

}  // namespace kesu
