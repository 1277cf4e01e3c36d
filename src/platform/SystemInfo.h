// What the service tells about the PC and its networks, and the few actions it takes on
// them, on top of the platform layer. Safe to call from any thread; some calls block
// (ping, reading adapter state), so the event loop hands them to its pool.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace kesu {

class SystemInfo {
public:
    // ---- Identity ----
    static std::string getLocalName();      // the PC's name, masked
    static std::string getFullLocalName();
    static std::string getMacAddress();     // Wi-Fi's, else Ethernet's, without colons
    static std::string getBluetoothMacAddress();
    static std::map<std::string, std::string> GetPcSystemInfo();  // {"model", "vendor"}

    // ---- Network state ----
    // The IPv4 address in use per adapter kind ("Wi-Fi", "Ethernet"); remembers the adapters.
    static std::map<std::string, std::string> getNetworkCorrespondAddress();
    static std::vector<std::map<std::string, std::string>> GetNetworkInfoList();
    static bool MacWifiNetworkAvailability();
    static bool MacEthernetNetworkAvailability();
    static std::string SsidWifiName();
    static bool SsidWifiCondition();
    static std::string GetWifiName();      // the Wi-Fi adapter last seen in use
    static std::string GetEthernetName();  // the Ethernet adapter last seen in use
    static bool isVpnOn();
    static std::optional<bool> getFirewallState();
    static bool isScreenUnlocked();
    static bool pingAddress(const std::string& ip, int timeoutSeconds);
    // True unless exactly two copies of `appName` run (the one state read as "not running").
    static bool isAppRunning(const std::string& appName);

    // ---- Actions ----
    static bool openWifi();
    static std::string openWlanSetting();

    // The remembered adapters back at their defaults (tests).
    static void resetForTest();
};

}  // namespace kesu
