#include "platform/SystemInfo.h"

#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <mutex>
#include <nlohmann/json.hpp>

#include "core/Config.h"
#include "core/Log.h"
#include "core/Text.h"
#include "platform/Platform.h"

namespace kesu {

namespace {

const std::string defaultWifiName = "en1";
const std::string defaultEthernetName = "en0";

// The adapters last seen in use for Wi-Fi and Ethernet.
struct AdapterNames {
    std::mutex lock;
    std::string wifi = defaultWifiName;
    std::string ethernet = defaultEthernetName;
};

AdapterNames& adapterNames() {
    static AdapterNames* names = new AdapterNames();
    return *names;
}

std::string readName(const std::string& name) {
    std::lock_guard<std::mutex> guard(adapterNames().lock);
    return name;
}

// A value that is costly to read (files, the interface walk) and rarely changes, read again
// once it is older than Config::identityCacheLifetime. Every connection request names the PC.
class CachedText {
public:
    template <class Read>
    std::string get(Read read) {
        const auto now = std::chrono::steady_clock::now();
        std::lock_guard<std::mutex> guard(lock_);
        if (!valid_ || now - readAt_ >= Config::current().identityCacheLifetime) {
            value_ = read();
            readAt_ = now;
            valid_ = true;
        }
        return value_;
    }
    void forget() {
        std::lock_guard<std::mutex> guard(lock_);
        valid_ = false;
    }

private:
    std::mutex lock_;
    bool valid_ = false;
    std::chrono::steady_clock::time_point readAt_;
    std::string value_;
};

CachedText& cachedHostName() {
    static auto* cache = new CachedText();
    return *cache;
}

CachedText& cachedHardwareAddress() {
    static auto* cache = new CachedText();
    return *cache;
}

std::string withoutColons(std::string text) {
    text.erase(std::remove(text.begin(), text.end(), ':'), text.end());
    return text;
}

// The hardware address the PC is known by: the first Wi-Fi adapter's, else the last
// Ethernet adapter's; empty when there is neither.
std::string primaryHardwareAddress() {
    std::string ethernet;
    for (const NetworkService& service : Platform::current().networkServices()) {
        if (service.displayName == "Wi-Fi") return service.hwAddress;
        if (service.displayName == "Ethernet") ethernet = service.hwAddress;
    }
    return ethernet;
}

const InterfaceAddress* firstAddressOf(const std::vector<InterfaceAddress>& addresses, const std::string& name) {
    for (const InterfaceAddress& address : addresses)
        if (address.name == name) return &address;
    return nullptr;
}

bool hasAdapterWithAddress(const std::string& displayName) {
    for (const NetworkService& service : Platform::current().networkServices())
        if (service.displayName == displayName && !service.hwAddress.empty()) return true;
    return false;
}

}  // namespace

std::string SystemInfo::getLocalName() { return text::paramAddMask(getFullLocalName()); }

std::string SystemInfo::getFullLocalName() {
    return cachedHostName().get([] { return Platform::current().localizedHostName(); });
}

std::string SystemInfo::getMacAddress() {
    return cachedHardwareAddress().get([] { return withoutColons(primaryHardwareAddress()); });
}

std::string SystemInfo::getBluetoothMacAddress() { return Platform::current().bluetoothAddress(); }

std::map<std::string, std::string> SystemInfo::GetPcSystemInfo() {
    Platform& platform = Platform::current();
    const std::string model = platform.hardwareModel();
    const std::string vendor = platform.cpuVendor().value_or("apple");
    Log::mPrintlog("[GetPcSystemInfo] model: " + model + " vendor: " + vendor + "\n");
    return {{"model", model}, {"vendor", vendor}};
}

std::map<std::string, std::string> SystemInfo::getNetworkCorrespondAddress() {
    Platform& platform = Platform::current();
    const auto addresses = platform.interfaceAddresses();
    if (!addresses) return {};

    // Per kind, the adapter in use: the first one holding an IPv4 address, else the first one.
    std::map<std::string, std::string> snapshot;
    std::map<std::string, std::string> chosenName;
    for (const NetworkService& service : platform.networkServices()) {
        if (service.displayName != "Wi-Fi" && service.displayName != "Ethernet") continue;
        const InterfaceAddress* address = firstAddressOf(*addresses, service.bsdName);
        auto known = chosenName.find(service.displayName);
        if (known != chosenName.end() && !snapshot[service.displayName].empty()) continue;
        if (known != chosenName.end() && address == nullptr) continue;
        chosenName[service.displayName] = service.bsdName;
        snapshot[service.displayName] = address != nullptr ? address->ip : "";
    }

    AdapterNames& names = adapterNames();
    std::lock_guard<std::mutex> guard(names.lock);
    if (auto it = chosenName.find("Wi-Fi"); it != chosenName.end()) names.wifi = it->second;
    if (auto it = chosenName.find("Ethernet"); it != chosenName.end()) names.ethernet = it->second;
    return snapshot;
}

std::vector<std::map<std::string, std::string>> SystemInfo::GetNetworkInfoList() {
    Log::mPrintlog("[GetNetworkInfoList] start ...");
    Platform& platform = Platform::current();
    const auto addresses = platform.interfaceAddresses();
    if (!addresses) {
        Log::mPrintlog("[GetNetworkInfoList] err: the interface addresses cannot be read");
        return {};
    }
    std::vector<std::map<std::string, std::string>> list;
    std::optional<std::string> ssid;  // asked once, only when a Wi-Fi adapter has an address
    for (const NetworkService& service : platform.networkServices()) {
        for (const InterfaceAddress& address : *addresses) {
            if (address.name != service.bsdName) continue;
            std::map<std::string, std::string> entry{{"name", service.displayName},
                                                     {"bsdName", service.bsdName},
                                                     {"ip", address.ip},
                                                     {"netmask", address.netmask}};
            if (service.displayName == "Wi-Fi") {
                if (!ssid) ssid = platform.wifiSsid();
                entry["ssid"] = *ssid;
            }
            list.push_back(std::move(entry));
        }
    }
    Log::mPrintlog("[GetNetworkInfoList] availableNetworkInfoList is: " + nlohmann::json(list).dump());
    return list;
}

bool SystemInfo::MacWifiNetworkAvailability() { return hasAdapterWithAddress("Wi-Fi"); }

bool SystemInfo::MacEthernetNetworkAvailability() { return hasAdapterWithAddress("Ethernet"); }

std::string SystemInfo::SsidWifiName() { return Platform::current().wifiSsid(); }

bool SystemInfo::SsidWifiCondition() { return Platform::current().wifiPowerOn(); }

std::string SystemInfo::GetWifiName() { return readName(adapterNames().wifi); }

std::string SystemInfo::GetEthernetName() { return readName(adapterNames().ethernet); }

bool SystemInfo::isVpnOn() {
    static const std::array<std::string, 5> markers{"tap", "tun", "ppp", "ipsec", "ipsec0"};
    for (const std::string& name : Platform::current().vpnScopedInterfaces()) {
        if (name.rfind("wg", 0) == 0) return true;  // WireGuard
        for (const std::string& marker : markers)
            if (name.find(marker) != std::string::npos) return true;
    }
    return false;
}

std::optional<bool> SystemInfo::getFirewallState() {
    const auto state = Platform::current().firewallGlobalState();
    if (!state || !text::isValidUtf8(*state)) return std::nullopt;
    const std::string trimmed = text::trim(*state);
    if (trimmed.empty()) return std::nullopt;  // nothing read is not a firewall that is on
    return trimmed != "0";
}

bool SystemInfo::isScreenUnlocked() { return !Platform::current().screenLocked().value_or(false); }

bool SystemInfo::pingAddress(const std::string& ip, int timeoutSeconds) {
    in_addr parsed{};
    if (inet_pton(AF_INET, ip.c_str(), &parsed) != 1) {
        Log::mPrintlog("[SystemInfo::pingAddress] not an IPv4 address, no ping: " + ip);
        return false;
    }
    return Platform::current().ping(ip, std::chrono::seconds(std::max(timeoutSeconds, 1)));
}

bool SystemInfo::openWifi() {
    std::string error;
    if (Platform::current().switchWifiOn(error)) {
        Log::mPrintlog("[SystemInfo::openWifi] Wi-Fi turned on");
        return true;
    }
    Log::mPrintlog("[SystemInfo::openWifi] Error turning on Wi-Fi: " + error);
    return false;
}

std::string SystemInfo::openWlanSetting() {
    nlohmann::json answer;
    if (Platform::current().openNetworkSettings())
        answer = {{"error", 0}, {"error_message", "open success"}};
    else
        answer = {{"error", -1}, {"error_message", "open fail"}};
    return answer.dump(2);
}

bool SystemInfo::isAppRunning(const std::string& appName) {
    const auto names = Platform::current().runningApplicationNames();
    const auto count = std::count(names.begin(), names.end(), appName);
    // Exactly two copies is the one state read as "not running"; callers depend on it.
    return count != 2;
}

void SystemInfo::resetForTest() {
    cachedHostName().forget();
    cachedHardwareAddress().forget();
    AdapterNames& names = adapterNames();
    std::lock_guard<std::mutex> guard(names.lock);
    names.wifi = defaultWifiName;
    names.ethernet = defaultEthernetName;
}

}  // namespace kesu
