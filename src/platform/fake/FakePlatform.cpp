#include "platform/fake/FakePlatform.h"

namespace kesu {

using Guard = std::lock_guard<std::mutex>;

std::vector<NetworkService> FakePlatform::networkServices() {
    ++networkServicesCalls_;
    Guard g(lock_);
    return services_;
}

std::optional<std::vector<InterfaceAddress>> FakePlatform::interfaceAddresses() {
    Guard g(lock_);
    return addresses_;
}

std::string FakePlatform::localizedHostName() {
    Guard g(lock_);
    return hostName_;
}

std::string FakePlatform::wifiSsid() {
    Guard g(lock_);
    return ssid_;
}

bool FakePlatform::wifiPowerOn() {
    Guard g(lock_);
    return wifiPower_;
}

bool FakePlatform::switchWifiOn(std::string& error) {
    ++switchWifiOnCalls_;
    Guard g(lock_);
    if (!switchWifiOk_) {
        error = switchWifiError_;
        return false;
    }
    wifiPower_ = true;
    return true;
}

std::string FakePlatform::bluetoothAddress() {
    Guard g(lock_);
    return bluetooth_;
}

std::vector<std::string> FakePlatform::vpnScopedInterfaces() {
    Guard g(lock_);
    return vpn_;
}

std::optional<std::string> FakePlatform::firewallGlobalState() {
    Guard g(lock_);
    return firewall_;
}

std::optional<bool> FakePlatform::screenLocked() {
    ++screenLockedCalls_;
    Guard g(lock_);
    return screenLocked_;
}

std::vector<std::string> FakePlatform::runningApplicationNames() {
    Guard g(lock_);
    return apps_;
}

std::optional<std::string> FakePlatform::processList() {
    Guard g(lock_);
    return processList_;
}

std::string FakePlatform::hardwareModel() {
    Guard g(lock_);
    return model_;
}

std::optional<std::string> FakePlatform::cpuVendor() {
    Guard g(lock_);
    return vendor_;
}

bool FakePlatform::openNetworkSettings() {
    ++openNetworkSettingsCalls_;
    Guard g(lock_);
    return openSettingsOk_;
}

bool FakePlatform::ping(const std::string& ipv4, std::chrono::seconds) {
    ++pingCalls_;
    Guard g(lock_);
    lastPing_ = ipv4;
    return pingOk_;
}

void FakePlatform::setNetworkServices(std::vector<NetworkService> services) {
    Guard g(lock_);
    services_ = std::move(services);
}

void FakePlatform::addAdapter(const std::string& displayName, const std::string& bsdName,
                              const std::string& hwAddress, const std::string& ip, const std::string& netmask) {
    Guard g(lock_);
    services_.push_back({displayName, bsdName, hwAddress});
    if (!ip.empty()) {
        if (!addresses_) addresses_.emplace();
        addresses_->push_back({bsdName, ip, netmask, true});
    }
}

void FakePlatform::setInterfaceAddresses(std::optional<std::vector<InterfaceAddress>> addresses) {
    Guard g(lock_);
    addresses_ = std::move(addresses);
}

void FakePlatform::setLocalizedHostName(std::string name) {
    Guard g(lock_);
    hostName_ = std::move(name);
}

void FakePlatform::setWifiSsid(std::string ssid) {
    Guard g(lock_);
    ssid_ = std::move(ssid);
}

void FakePlatform::setWifiPowerOn(bool on) {
    Guard g(lock_);
    wifiPower_ = on;
}

void FakePlatform::setSwitchWifiOnResult(bool ok, std::string error) {
    Guard g(lock_);
    switchWifiOk_ = ok;
    switchWifiError_ = std::move(error);
}

void FakePlatform::setBluetoothAddress(std::string address) {
    Guard g(lock_);
    bluetooth_ = std::move(address);
}

void FakePlatform::setVpnScopedInterfaces(std::vector<std::string> names) {
    Guard g(lock_);
    vpn_ = std::move(names);
}

void FakePlatform::setFirewallGlobalState(std::optional<std::string> state) {
    Guard g(lock_);
    firewall_ = std::move(state);
}

void FakePlatform::setScreenLocked(std::optional<bool> locked) {
    Guard g(lock_);
    screenLocked_ = locked;
}

void FakePlatform::setRunningApplicationNames(std::vector<std::string> names) {
    Guard g(lock_);
    apps_ = std::move(names);
}

void FakePlatform::setProcessList(std::optional<std::string> text) {
    Guard g(lock_);
    processList_ = std::move(text);
}

void FakePlatform::setHardwareModel(std::string model) {
    Guard g(lock_);
    model_ = std::move(model);
}

void FakePlatform::setCpuVendor(std::optional<std::string> vendor) {
    Guard g(lock_);
    vendor_ = std::move(vendor);
}

void FakePlatform::setOpenNetworkSettingsResult(bool ok) {
    Guard g(lock_);
    openSettingsOk_ = ok;
}

void FakePlatform::setPingResult(bool ok) {
    Guard g(lock_);
    pingOk_ = ok;
}

std::string FakePlatform::lastPingAddress() const {
    Guard g(lock_);
    return lastPing_;
}

ScopedFakePlatform::ScopedFakePlatform() : fake_(std::make_shared<FakePlatform>()) { Platform::install(fake_); }

ScopedFakePlatform::~ScopedFakePlatform() { Platform::install(nullptr); }

}  // namespace kesu
