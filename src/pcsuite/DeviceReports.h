// Device-list reports to the PC suite: the LAN list on change and the pre-connect list.
#pragma once

namespace kesu {

// Observers of the discovered-device table; notifySubscribers reports the list now.
class WlanDetectedDeviceCompare {
public:
    static WlanDetectedDeviceCompare& instance();
    void notifySubscribers();
};

// The pre-connect device list report.
class ReportDevicesV2 {
public:
    static ReportDevicesV2& instance();
    void notify();
};

}  // namespace kesu
