// Device-list reports to the PC suite: the LAN and pre-connect list reporters, and the
// observers of the discovered-device table that send the LAN list again.
#pragma once

#include "reports/DeviceListReporter.h"
#include "reports/WlanDeviceObservers.h"
