#include "pcsuite/DeviceReports.h"

namespace kesu {

WlanDetectedDeviceCompare& WlanDetectedDeviceCompare::instance() {
    static WlanDetectedDeviceCompare* compare = new WlanDetectedDeviceCompare();
    return *compare;
}

// No reporter is registered until the LAN device reports run.
void WlanDetectedDeviceCompare::notifySubscribers() {}

ReportDevicesV2& ReportDevicesV2::instance() {
    static ReportDevicesV2* report = new ReportDevicesV2();
    return *report;
}

void ReportDevicesV2::notify() {}

}  // namespace kesu
