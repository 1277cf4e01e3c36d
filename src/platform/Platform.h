// The operating-system facilities the service uses, behind one small interface: a real Linux
// implementation for the daemon and a fake for tests. Every call answers quickly with a
// neutral value ("", false, empty, nullopt) when the machine lacks the facility.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace kesu {

// A network service of the machine: a Wi-Fi or Ethernet adapter (or another kind).
struct NetworkService {
    std::string displayName;  // "Wi-Fi", "Ethernet", or another kind's name
    std::string bsdName;      // interface name, e.g. "wlan0", "eth0"
    std::string hwAddress;    // "aa:bb:cc:dd:ee:ff", empty when it has none
};

// One IPv4 address entry of an interface.
struct InterfaceAddress {
    std::string name;     // interface name
    std::string ip;       // dotted IPv4
    std::string netmask;  // dotted IPv4
    bool up = true;
};

class Platform {
public:
    virtual ~Platform() = default;

    // Network adapters in the system's order.
    virtual std::vector<NetworkService> networkServices() = 0;
    // IPv4 addresses of all interfaces; nullopt when the list cannot be read.
    virtual std::optional<std::vector<InterfaceAddress>> interfaceAddresses() = 0;

    virtual std::string localizedHostName() = 0;
    virtual std::string wifiSsid() = 0;
    virtual bool wifiPowerOn() = 0;
    // Switches Wi-Fi on; on failure fills `error` and returns false.
    virtual bool switchWifiOn(std::string& error) = 0;
    virtual std::string bluetoothAddress() = 0;
    // Names of the interfaces the system routes through a VPN (tun*, tap*, ppp*, ipsec*, ...).
    virtual std::vector<std::string> vpnScopedInterfaces() = 0;
    // The firewall's global state as text ("0" off, else on); nullopt when unknown.
    virtual std::optional<std::string> firewallGlobalState() = 0;
    // Whether the user's screen is locked; nullopt when unknown.
    virtual std::optional<bool> screenLocked() = 0;
    // Names of the running programs, one entry per process.
    virtual std::vector<std::string> runningApplicationNames() = 0;
    // The process list as `ps -A` prints it; nullopt when it cannot be run or read.
    virtual std::optional<std::string> processList() = 0;
    virtual std::string hardwareModel() = 0;
    virtual std::optional<std::string> cpuVendor() = 0;
    virtual bool openNetworkSettings() = 0;
    // Sends one echo request; true when ping ended within the time-out.
    virtual bool ping(const std::string& ipv4, std::chrono::seconds timeout) = 0;

    // The platform in use (the Linux one unless a test installed another).
    static Platform& current();
    // Installs a platform for tests; nullptr puts the real one back.
    static void install(std::shared_ptr<Platform> platform);
};

}  // namespace kesu
