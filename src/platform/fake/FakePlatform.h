// A Platform for tests: every answer is a value the test sets, and the calls that change
// the machine (switching Wi-Fi on, opening settings, pinging) are counted. Thread-safe.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>

#include "platform/Platform.h"

namespace kesu {

class FakePlatform : public Platform {
public:
    FakePlatform() = default;

    // ---- Platform ----------------------------------------------------------------------
    std::vector<NetworkService> networkServices() override;
    std::optional<std::vector<InterfaceAddress>> interfaceAddresses() override;
    std::string localizedHostName() override;
    std::string wifiSsid() override;
    bool wifiPowerOn() override;
    bool switchWifiOn(std::string& error) override;
    std::string bluetoothAddress() override;
    std::vector<std::string> vpnScopedInterfaces() override;
    std::optional<std::string> firewallGlobalState() override;
    std::optional<bool> screenLocked() override;
    std::vector<std::string> runningApplicationNames() override;
    std::optional<std::string> processList() override;
    std::string hardwareModel() override;
    std::optional<std::string> cpuVendor() override;
    bool openNetworkSettings() override;
    bool ping(const std::string& ipv4, std::chrono::seconds timeout) override;

    // ---- Setters -----------------------------------------------------------------------
    void setNetworkServices(std::vector<NetworkService> services);
    // Adds one adapter (and, when `ip` is given, its IPv4 address) in one step.
    void addAdapter(const std::string& displayName, const std::string& bsdName, const std::string& hwAddress,
                    const std::string& ip = "", const std::string& netmask = "255.255.255.0");
    // nullopt makes the address list unreadable (as when getifaddrs fails).
    void setInterfaceAddresses(std::optional<std::vector<InterfaceAddress>> addresses);
    void setLocalizedHostName(std::string name);
    void setWifiSsid(std::string ssid);
    void setWifiPowerOn(bool on);
    // What switchWifiOn answers: success (which also turns the power on) or this error.
    void setSwitchWifiOnResult(bool ok, std::string error = "");
    void setBluetoothAddress(std::string address);
    void setVpnScopedInterfaces(std::vector<std::string> names);
    void setFirewallGlobalState(std::optional<std::string> state);
    void setScreenLocked(std::optional<bool> locked);
    void setRunningApplicationNames(std::vector<std::string> names);
    void setProcessList(std::optional<std::string> text);
    void setHardwareModel(std::string model);
    void setCpuVendor(std::optional<std::string> vendor);
    void setOpenNetworkSettingsResult(bool ok);
    void setPingResult(bool ok);

    // ---- Call counters -----------------------------------------------------------------
    int switchWifiOnCalls() const { return switchWifiOnCalls_.load(); }
    int openNetworkSettingsCalls() const { return openNetworkSettingsCalls_.load(); }
    int pingCalls() const { return pingCalls_.load(); }
    int screenLockedCalls() const { return screenLockedCalls_.load(); }
    int networkServicesCalls() const { return networkServicesCalls_.load(); }
    std::string lastPingAddress() const;

private:
    mutable std::mutex lock_;
    std::vector<NetworkService> services_;
    std::optional<std::vector<InterfaceAddress>> addresses_{std::vector<InterfaceAddress>{}};
    std::string hostName_;
    std::string ssid_;
    bool wifiPower_ = false;
    bool switchWifiOk_ = true;
    std::string switchWifiError_;
    std::string bluetooth_;
    std::vector<std::string> vpn_;
    std::optional<std::string> firewall_;
    std::optional<bool> screenLocked_;
    std::vector<std::string> apps_;
    std::optional<std::string> processList_;
    std::string model_;
    std::optional<std::string> vendor_;
    bool openSettingsOk_ = true;
    bool pingOk_ = true;
    std::string lastPing_;

    std::atomic<int> switchWifiOnCalls_{0};
    std::atomic<int> openNetworkSettingsCalls_{0};
    std::atomic<int> pingCalls_{0};
    std::atomic<int> screenLockedCalls_{0};
    std::atomic<int> networkServicesCalls_{0};
};

// Installs a fresh FakePlatform for the scope and puts the previous platform back at its end.
//   ScopedFakePlatform fake;  fake->setScreenLocked(true);
class ScopedFakePlatform {
public:
    ScopedFakePlatform();
    ~ScopedFakePlatform();
    ScopedFakePlatform(const ScopedFakePlatform&) = delete;
    ScopedFakePlatform& operator=(const ScopedFakePlatform&) = delete;

    FakePlatform* operator->() const { return fake_.get(); }
    FakePlatform& operator*() const { return *fake_; }
    const std::shared_ptr<FakePlatform>& get() const { return fake_; }

private:
    std::shared_ptr<FakePlatform> fake_;
};

}  // namespace kesu
