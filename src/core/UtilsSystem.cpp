// The system side of Utils: processes and files, identity, network state, actions, text
// conversions and the process-wide flags and URLs. Operating-system facts come from the
// platform layer; everything here is safe to call from any thread.
#include <arpa/inet.h>

#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <nlohmann/json.hpp>
#include <regex>
#include <sstream>

#include "core/Config.h"
#include "core/Process.h"
#include "core/Text.h"
#include "core/Utils.h"
#include "platform/Platform.h"

namespace kesu {

namespace fs = std::filesystem;

namespace {

// Files larger than this are not read into memory as configuration text.
constexpr std::uintmax_t maxReadFileSize = 16u << 20;
// Lines of the host override file longer than this cannot hold a usable URL and are skipped
// (the regular-expression engine recurses per character).
constexpr std::size_t maxOverrideLineLength = 4096;

const std::string defaultWifiName = "en1";
const std::string defaultEthernetName = "en0";

// The flags and counters: lock-free.
std::atomic<long long> seqNo{-1};
std::atomic<bool> isAllowQtWindow{false};
std::atomic<bool> isAutoConnFlag{false};
std::atomic<bool> isCanConnectDevice{true};
std::atomic<bool> isCanPrimaryConnectDevice{true};
std::atomic<bool> wlanConnState{false};

// The texts, under one lock.
struct TextState {
    std::mutex lock;
    std::string connectingDeviceType;
    std::string primaryConnectDeviceType;
    std::string connectCenterOverride;  // empty: the configured default is in use
    std::string wifiName = defaultWifiName;
    std::string ethernetName = defaultEthernetName;
};

TextState& texts() {
    static TextState* state = new TextState();
    return *state;
}

std::string readText(std::string TextState::*member) {
    TextState& s = texts();
    std::lock_guard<std::mutex> guard(s.lock);
    return s.*member;
}

void writeText(std::string TextState::*member, const std::string& value) {
    TextState& s = texts();
    std::lock_guard<std::mutex> guard(s.lock);
    s.*member = value;
}

std::string httpBase(const std::string& host, int port) {
    return "http://" + host + ":" + std::to_string(port) + "/";
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

void appendUtf8(std::string& out, unsigned codePoint) {
    if (codePoint < 0x80) {
        out.push_back(static_cast<char>(codePoint));
    } else {
        out.push_back(static_cast<char>(0xC0 | (codePoint >> 6)));
        out.push_back(static_cast<char>(0x80 | (codePoint & 0x3F)));
    }
}

}  // namespace

// ---- Processes and files -------------------------------------------------------------------

bool Utils::startProcess(const std::string& launchPath, const std::vector<std::string>& arguments, int& exitCode) {
    std::string error;
    if (!process::spawnDetached(launchPath, arguments, error)) {
        exitCode = -1;
        mPrintlog("[startProcess] something went wrong, error: " + error);
        return false;
    }
    exitCode = 0;
    return true;
}

bool Utils::isAppRunning(const std::string& appName) {
    const auto names = Platform::current().runningApplicationNames();
    const auto count = std::count(names.begin(), names.end(), appName);
    // Exactly two copies is the one state read as "not running"; callers depend on it.
    return count != 2;
}

bool Utils::isFileExist(const std::string& filePath) {
    std::error_code ec;
    if (fs::exists(filePath, ec)) return true;
    mPrintlog("[Utils::isFileExist] config " + filePath + " is not exist ...");
    return false;
}

void Utils::readFile(const std::string& filePath, std::string& fileContent) {
    std::error_code ec;
    if (!fs::exists(filePath, ec)) {
        mPrintlog("[Utils::readFile] file is not exist ...");
        return;
    }
    const auto size = fs::file_size(filePath, ec);
    std::ifstream in(filePath, std::ios::binary);
    std::string text;
    if (!ec && size <= maxReadFileSize && in) {
        std::ostringstream buffer;
        buffer << in.rdbuf();
        if (!in.bad()) text = buffer.str();
        else ec = std::make_error_code(std::errc::io_error);
    }
    if (ec || size > maxReadFileSize || !in || !text::isValidUtf8(text)) {
        mPrintlog("[Utils::readFile] config file exist but read fail");
        return;
    }
    fileContent = std::move(text);
    mPrintlog("[Utils::readFile] config file exist and content is: " + fileContent);
}

// ---- Identity and counters -----------------------------------------------------------------

long long Utils::getNfcLanConnectSeqNo() { return seqNo.fetch_add(1, std::memory_order_relaxed) + 1; }

std::string Utils::getLocalName() { return paramAddMask(getFullLocalName()); }

std::string Utils::getFullLocalName() { return Platform::current().localizedHostName(); }

std::string Utils::paramAddMask(const std::string& str) {
    const auto chars = text::graphemes(str);
    if (chars.size() < 7) return str;
    std::string masked;
    for (std::size_t i = 0; i < 3; ++i) masked += chars[i];
    masked += "****";
    for (std::size_t i = chars.size() - 3; i < chars.size(); ++i) masked += chars[i];
    return masked;
}

std::string Utils::getMacAddress() { return withoutColons(primaryHardwareAddress()); }

std::string Utils::getBluetoothMacAddress() { return Platform::current().bluetoothAddress(); }

std::map<std::string, std::string> Utils::GetPcSystemInfo() {
    Platform& platform = Platform::current();
    const std::string model = platform.hardwareModel();
    const std::string vendor = platform.cpuVendor().value_or("apple");
    mPrintlog("[GetPcSystemInfo] model: " + model + " vendor: " + vendor + "\n");
    return {{"model", model}, {"vendor", vendor}};
}

// ---- Network state -------------------------------------------------------------------------

std::map<std::string, std::string> Utils::getNetworkCorrespondAddress() {
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

    TextState& s = texts();
    std::lock_guard<std::mutex> guard(s.lock);
    if (auto it = chosenName.find("Wi-Fi"); it != chosenName.end()) s.wifiName = it->second;
    if (auto it = chosenName.find("Ethernet"); it != chosenName.end()) s.ethernetName = it->second;
    return snapshot;
}

std::vector<std::map<std::string, std::string>> Utils::GetNetworkInfoList() {
    mPrintlog("[GetNetworkInfoList] start ...");
    Platform& platform = Platform::current();
    const auto addresses = platform.interfaceAddresses();
    if (!addresses) {
        mPrintlog("[GetNetworkInfoList] err: the interface addresses cannot be read");
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
    mPrintlog("[GetNetworkInfoList] availableNetworkInfoList is: " + nlohmann::json(list).dump());
    return list;
}

bool Utils::MacWifiNetworkAvailability() { return hasAdapterWithAddress("Wi-Fi"); }

bool Utils::MacEthernetNetworkAvailability() { return hasAdapterWithAddress("Ethernet"); }

std::string Utils::SsidWifiName() { return Platform::current().wifiSsid(); }

bool Utils::SsidWifiCondition() { return Platform::current().wifiPowerOn(); }

std::string Utils::GetWifiName() { return readText(&TextState::wifiName); }

std::string Utils::GetEthernetName() { return readText(&TextState::ethernetName); }

bool Utils::isVpnOn() {
    static const std::array<std::string, 5> markers{"tap", "tun", "ppp", "ipsec", "ipsec0"};
    for (const std::string& name : Platform::current().vpnScopedInterfaces()) {
        if (name.rfind("wg", 0) == 0) return true;  // WireGuard
        for (const std::string& marker : markers)
            if (name.find(marker) != std::string::npos) return true;
    }
    return false;
}

std::optional<bool> Utils::getFirewallState() {
    const auto state = Platform::current().firewallGlobalState();
    if (!state || !text::isValidUtf8(*state)) return std::nullopt;
    const std::string trimmed = text::trim(*state);
    if (trimmed.empty()) return std::nullopt;  // nothing read is not a firewall that is on
    return trimmed != "0";
}

bool Utils::isScreenUnlocked() { return !Platform::current().screenLocked().value_or(false); }

bool Utils::pingAddress(const std::string& ip, int timeoutSeconds) {
    in_addr parsed{};
    if (inet_pton(AF_INET, ip.c_str(), &parsed) != 1) {
        mPrintlog("[Utils::pingAddress] not an IPv4 address, no ping: " + ip);
        return false;
    }
    return Platform::current().ping(ip, std::chrono::seconds(std::max(timeoutSeconds, 1)));
}

// ---- Actions -------------------------------------------------------------------------------

bool Utils::openWifi() {
    std::string error;
    if (Platform::current().switchWifiOn(error)) {
        mPrintlog("[Utils::openWifi] Wi-Fi turned on");
        return true;
    }
    mPrintlog("[Utils::openWifi] Error turning on Wi-Fi: " + error);
    return false;
}

std::string Utils::openWlanSetting() {
    nlohmann::json answer;
    if (Platform::current().openNetworkSettings())
        answer = {{"error", 0}, {"error_message", "open success"}};
    else
        answer = {{"error", -1}, {"error_message", "open fail"}};
    return answer.dump(2);
}

std::optional<std::string> Utils::parseSwitchHost(std::string_view content) {
    std::regex expression;
    try {
        expression = std::regex(R"((ConnectionCenterHost=\S*))");
    } catch (const std::regex_error& e) {
        mPrintlog(std::string("[Utils::getConnectCenterUrl] regex Error: ") + e.what());
        return std::nullopt;
    }
    // A match never spans a line end, so the text is searched line by line.
    std::istringstream lines{std::string(content)};
    for (std::string line; std::getline(lines, line);) {
        if (line.size() > maxOverrideLineLength) continue;
        std::smatch match;
        if (std::regex_search(line, match, expression)) return match[1].str();
    }
    return std::nullopt;
}

void Utils::getConnectCenterUrl() {
    const std::string path = rootedPath(Config::current().switchHostIni);
    if (!isFileExist(path)) return;
    std::string content;
    readFile(path, content);
    const auto matched = parseSwitchHost(content);
    if (!matched) return;

    mPrintlog("[Utils::getConnectCenterUrl] ConnectCenterUrl: " + *matched);
    // Everything after the first "=" is the URL (a URL may itself hold "=").
    const std::string value = matched->substr(matched->find('=') + 1);
    if (!value.empty()) setConnectCenterServerUrl(value);
    mPrintlog("[Utils::getConnectCenterUrl] connectCenterServerUrl: " + connectCenterServerUrl());
}

// ---- Text conversions ----------------------------------------------------------------------

std::string Utils::uintToHexString(const std::string& value) {
    static const char digits[] = "0123456789abcdef";
    std::string hex;
    hex.reserve(value.size() * 2);
    for (unsigned char byte : value) {
        hex.push_back(digits[byte >> 4]);
        hex.push_back(digits[byte & 0x0F]);
    }
    return hex;
}

std::string Utils::asciiToString(const std::vector<std::uint8_t>& inBody) {
    std::string out;
    out.reserve(inBody.size());
    for (std::uint8_t byte : inBody) appendUtf8(out, byte);
    return out;
}

// ---- Shared flags and URLs -----------------------------------------------------------------

bool Utils::getIsAllowWindow() { return isAllowQtWindow.load(); }
void Utils::setIsAllowWindow(bool isAllow) { isAllowQtWindow.store(isAllow); }
bool Utils::getThisPhoneAutoConnect() { return isAutoConnFlag.load(); }
void Utils::setThisPhoneAutoConnect(bool thisPhoneAutoConnect) { isAutoConnFlag.store(thisPhoneAutoConnect); }
bool Utils::getIsCanConnectDevice() { return isCanConnectDevice.load(); }
void Utils::setIsCanConnectDevice(bool isCanConnect) {
    isCanConnectDevice.store(isCanConnect);
    mPrintlog(std::string("setIsCanConnectDevice ") + (isCanConnect ? "true" : "false") + " ...");
}

bool Utils::tryClaimConnectDevice() {
    bool expected = true;
    if (!isCanConnectDevice.compare_exchange_strong(expected, false)) return false;
    mPrintlog("setIsCanConnectDevice false ...");
    return true;
}

std::string Utils::getConnectingDeviceType() { return readText(&TextState::connectingDeviceType); }
void Utils::setConnectingDeviceType(const std::string& type) {
    writeText(&TextState::connectingDeviceType, type);
    mPrintlog("setConnectingDeviceType is " + type + " ...");
}
bool Utils::getIsCanPrimaryConnectDevice() { return isCanPrimaryConnectDevice.load(); }
void Utils::setIsCanPrimaryConnectDevice(bool isCan) { isCanPrimaryConnectDevice.store(isCan); }

bool Utils::tryClaimPrimaryConnectDevice() {
    bool expected = true;
    return isCanPrimaryConnectDevice.compare_exchange_strong(expected, false);
}

std::string Utils::getPrimaryConnectDeviceType() { return readText(&TextState::primaryConnectDeviceType); }
void Utils::setPrimaryConnectDeviceType(const std::string& type) {
    writeText(&TextState::primaryConnectDeviceType, type);
    mPrintlog("setPrimaryConnectDeviceType is " + type + " ...");
}
bool Utils::getWlanConnState() { return wlanConnState.load(); }
void Utils::setWlanConnState(bool state) { wlanConnState.store(state); }

std::string Utils::connectCenterServerUrl() {
    const std::string url = readText(&TextState::connectCenterOverride);
    return url.empty() ? Config::current().defaultConnectCenterUrl : url;
}

void Utils::setConnectCenterServerUrl(const std::string& url) { writeText(&TextState::connectCenterOverride, url); }

std::string Utils::pcsuiteHttpServerUrl() {
    const Config& config = Config::current();
    return httpBase(config.pcsuiteHost, config.pcsuitePort);
}

std::string Utils::kesuConnHttpServerUrl() {
    const Config& config = Config::current();
    return httpBase(config.controlHost, config.controlPort);
}

std::string Utils::pcsuiteHttpServerSSDPQuerryAllUrl() { return pcsuiteHttpServerUrl() + "SSDPQueryAll"; }

std::string Utils::pcsuiteHttpServerPushGattClientListUrl() {
    return pcsuiteHttpServerUrl() + "RH2RF_PUSH_GATT_CLIENT_LIST";
}

std::string Utils::pcsuiteHttpIsConnectBusyUrl() { return pcsuiteHttpServerUrl() + "isConnectBusy?deviceType="; }

std::string Utils::pcsuiteHttpServerNotifySystemEventUrl() { return pcsuiteHttpServerUrl() + "notifySystemEvent"; }

void Utils::resetStateForTest() {
    seqNo.store(-1);
    isAllowQtWindow.store(false);
    isAutoConnFlag.store(false);
    isCanConnectDevice.store(true);
    isCanPrimaryConnectDevice.store(true);
    wlanConnState.store(false);
    TextState& s = texts();
    std::lock_guard<std::mutex> guard(s.lock);
    s.connectingDeviceType.clear();
    s.primaryConnectDeviceType.clear();
    s.connectCenterOverride.clear();
    s.wifiName = defaultWifiName;
    s.ethernetName = defaultEthernetName;
}

}  // namespace kesu
