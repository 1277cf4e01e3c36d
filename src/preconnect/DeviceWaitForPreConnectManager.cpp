#include "preconnect/DeviceWaitForPreConnectManager.h"

#include <algorithm>
#include <cctype>
#include <ctime>
#include <set>

#include "account/DataInstance.h"
#include "core/UdpSocketBase.h"
#include "core/Config.h"
#include "pcsuite/BuryPoint.h"
#include "preconnect/DeviceWaitForPreConnect.h"
#include "core/Log.h"
#include "core/WallClock.h"
#include "pcsuite/PcsuiteClient.h"

namespace kesu {

long long stringToTimestamp(const std::string& time) {
    std::tm parsed{};
    const char* rest = ::strptime(time.c_str(), "%Y-%m-%d %H:%M:%S", &parsed);
    if (!rest) return 0;
    if (*rest == '.') {
        ++rest;
        if (!std::isdigit(static_cast<unsigned char>(*rest))) return 0;
        while (std::isdigit(static_cast<unsigned char>(*rest))) ++rest;
    }
    if (*rest != '\0') return 0;
    parsed.tm_isdst = -1;
    const std::time_t seconds = std::mktime(&parsed);
    return seconds == -1 ? 0 : static_cast<long long>(seconds);
}

DeviceWaitForPreConnectManager& DeviceWaitForPreConnectManager::instance() {
    static DeviceWaitForPreConnectManager* manager = new DeviceWaitForPreConnectManager();
    return *manager;
}

DeviceWaitForPreConnectManager::DeviceWaitForPreConnectManager(EventLoop* loop)
    : loop_(loop), deviceListDate_(WallClock::now()) {}

void DeviceWaitForPreConnectManager::setEventLoop(EventLoop* loop) { loop_ = loop; }

void DeviceWaitForPreConnectManager::setListChangedHandler(std::function<void()> handler) {
    std::lock_guard<std::mutex> lock(handlerMutex_);
    listChanged_ = std::move(handler);
}

void DeviceWaitForPreConnectManager::notifyListChanged() const {
    std::function<void()> handler;
    {
        std::lock_guard<std::mutex> lock(handlerMutex_);
        handler = listChanged_;
    }
    if (handler) handler();
}

void DeviceWaitForPreConnectManager::setDevicesAddedHandler(std::function<void()> handler) {
    std::lock_guard<std::mutex> lock(handlerMutex_);
    devicesAddedHandler_ = std::move(handler);
}

void DeviceWaitForPreConnectManager::updateDevices(const std::string& key, Entry value) {
    std::lock_guard<std::mutex> lock(mutexMap);
    auto it = waitForPreConnectDevicesMap.find(key);
    if (it != waitForPreConnectDevicesMap.end()) it->second = std::move(value);
}

bool DeviceWaitForPreConnectManager::lookupDevices(const std::string& key, Entry& value) const {
    std::lock_guard<std::mutex> lock(mutexMap);
    auto it = waitForPreConnectDevicesMap.find(key);
    if (it == waitForPreConnectDevicesMap.end()) return false;
    value = it->second;
    return true;
}

void DeviceWaitForPreConnectManager::deleteDevices(const std::string& key) {
    std::lock_guard<std::mutex> lock(mutexMap);
    waitForPreConnectDevicesMap.erase(key);
}

void DeviceWaitForPreConnectManager::addDevices(const std::string& key, Entry value) {
    {
        std::lock_guard<std::mutex> lock(mutexMap);
        waitForPreConnectDevicesMap[key] = std::move(value);
        devicesAdded_.notify_all();
    }
    std::function<void()> handler;
    {
        std::lock_guard<std::mutex> lock(handlerMutex_);
        handler = devicesAddedHandler_;
    }
    if (handler) handler();
}

bool DeviceWaitForPreConnectManager::waitForDevices(std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(mutexMap);
    return devicesAdded_.wait_for(lock, timeout, [this] { return !waitForPreConnectDevicesMap.empty(); });
}

void DeviceWaitForPreConnectManager::clearAllDevices() {
    std::lock_guard<std::mutex> lock(mutexMap);
    waitForPreConnectDevicesMap.clear();
}

std::vector<DeviceWaitForPreConnectManager::Entry> DeviceWaitForPreConnectManager::getAllDevices() const {
    std::lock_guard<std::mutex> lock(mutexMap);
    std::vector<Entry> out;
    out.reserve(waitForPreConnectDevicesMap.size());
    for (const auto& [key, entry] : waitForPreConnectDevicesMap) out.push_back(entry);
    return out;
}

int DeviceWaitForPreConnectManager::getDevicesSize() const {
    std::lock_guard<std::mutex> lock(mutexMap);
    return static_cast<int>(waitForPreConnectDevicesMap.size());
}

std::vector<DeviceWaitForPreConnectManager::Entry> DeviceWaitForPreConnectManager::getSortWaitForPreFarDevices() const {
    const databaseParam account = dataInstance().get();
    std::lock_guard<std::mutex> lock(mutexMap);
    std::vector<std::pair<long long, Entry>> ranked;
    for (const auto& [key, entry] : waitForPreConnectDevicesMap) {
        const auto record = entry->getFarawayDevice();
        ranked.emplace_back(record ? stringToTimestamp(record->getReportTime()) : 0, entry);
    }
    std::stable_sort(ranked.begin(), ranked.end(), [](const auto& a, const auto& b) { return a.first > b.first; });
    std::vector<Entry> out;
    for (auto& [time, entry] : ranked) out.push_back(std::move(entry));
    auto toFront = [&out](const std::string& key) {
        if (key.empty()) return;
        auto it = std::find_if(out.begin(), out.end(), [&](const Entry& e) { return e->getDeviceId() == key; });
        if (it != out.end()) std::rotate(out.begin(), it, it + 1);
    };
    toFront(account.historyPhoneId);
    toFront(account.historyPadId);
    return out;
}

bool DeviceWaitForPreConnectManager::checkDeviceInvalid(const FarawayDevice& oldDev, const FarawayDevice& newDev) {
    const auto nets = newDev.info().iNets;
    if (nets.empty()) return true;
    return oldDev.getWlanClientIp() != nets.front().localInet;
}

// ---- The merge ---------------------------------------------------------------------------

void DeviceWaitForPreConnectManager::addFarawayDevices(const Json& req) {
    FarawayMap devices;
    parserFarawayDevices(req, devices);
    filterSameWaitForPreConnectDevices(devices);
    removeDisconnectedDevices(devices);
    InsertNewDevices(devices);
}

void DeviceWaitForPreConnectManager::parserFarawayDevices(const Json& req, FarawayMap& mapFarawayDevices) const {
    for (const Json& element : json::array(req, "data")) {
        if (json::integer(element, "type") == 3) continue;  // a PC
        auto device = std::make_shared<FarawayDevice>();
        device->setAllInfo(element);
        if (farawayDeviceCheck(*device)) mapFarawayDevices[device->getDeviceId()] = device;
    }
}

void DeviceWaitForPreConnectManager::filterSameWaitForPreConnectDevices(FarawayMap& mapFarawayDevices) {
    std::set<std::string> older;
    for (const auto& [keyA, a] : mapFarawayDevices) {
        const auto infoA = a->info();
        if (infoA.bluetooth.empty()) continue;
        for (const auto& [keyB, b] : mapFarawayDevices) {
            const auto infoB = b->info();
            if (infoA.bluetooth == infoB.bluetooth && infoA.model == infoB.model &&
                stringToTimestamp(infoA.reportTime) < stringToTimestamp(infoB.reportTime))
                older.insert(keyA);
        }
    }
    for (const auto& key : older) mapFarawayDevices.erase(key);
}

void DeviceWaitForPreConnectManager::removeDisconnectedDevices(FarawayMap& mapFarawayDevices) {
    for (const Entry& entry : getAllDevices()) {
        const std::string key = entry->getDeviceId();
        const auto fresh = mapFarawayDevices.find(key);
        const bool found = fresh != mapFarawayDevices.end();
        bool invalid = false;
        if (found && entry->getConnectType() == FarawayDevice::kWlan)
            if (const auto record = entry->getFarawayDevice()) invalid = checkDeviceInvalid(*record, *fresh->second);
        if ((!found || invalid) && entry->getIsConnected()) {
            Log::mPrintlog("[DeviceWaitForPreConnect::removeDisconnectedDevices] " + key +
                             " device is not exist or device network info change ");
            entry->setIsDisconnectNow(true);
        }
        if (!found) deleteDevices(key);
    }
}

void DeviceWaitForPreConnectManager::InsertNewDevices(FarawayMap& mapFarawayDevices) {
    EventLoop* loop = loop_.load();
    for (const auto& [key, record] : mapFarawayDevices) {
        Entry entry;
        if (lookupDevices(key, entry)) {
            if (entry->getIsFarawayDiscovered()) {
                const auto held = entry->getFarawayDevice();
                if (held && held->getReportTime() != record->getReportTime()) entry->setIsOpenIdSame(true);
                entry->updateFarawayDeviceInfo(*record);
            } else {
                entry->setFarawayDevice(record);
                entry->setIsFarawayDiscovered(true);
            }
            continue;
        }
        if (!loop) {
            Log::mPrintlog("[DeviceWaitForPreConnectManager::InsertNewDevices] no event loop yet, " + key +
                             " is not added");
            continue;
        }
        addDevices(key, std::make_shared<DeviceWaitForPreConnect>(*loop, key, record));
    }
}

// ---- Telemetry ---------------------------------------------------------------------------

bool DeviceWaitForPreConnectManager::sendDeviceListBuryPoint(const Json& req, int duration) {
    std::lock_guard<std::mutex> lock(reportMutex_);
    if (!m_isReportBuryPoint) {
        const auto days = std::chrono::floor<std::chrono::days>(WallClock::now() - deviceListDate_).count();
        if (days < 1) return false;
        m_isReportBuryPoint = true;
    }
    const Json list = json::array(req, "data");
    std::string types;
    std::string models;
    for (const Json& element : list) {
        switch (json::integer(element, "type")) {
        case 1: types += "phone#"; break;
        case 2: types += "pad#"; break;
        case 3: types += "pc#"; break;
        default: break;
        }
        models += json::str(element, "model") + "#";
    }
    BuryPoint::Record record;
    record["type"] = 1;
    record["eventId"] = "W688|10269";
    record["duration"] = duration;
    record["num"] = list.size();
    record["params"] = {{"type", types}, {"device_model", models}};
    Log::mPrintlog(
        "[DeviceWaitForPreConnectManager::sendDeviceListBuryPoint] DeviceListBuryPoint sendBuryPoint, buryPointStr is: " +
        record.dump(-1, ' ', false, Json::error_handler_t::replace) + " \n");
    const bool sent = PcsuiteClient::sendBuryPoint(BuryPoint::listText(record));
    if (sent) {
        m_isReportBuryPoint = false;
        deviceListDate_ = WallClock::now();
    }
    return sent;
}

bool DeviceWaitForPreConnectManager::sendDeviceListFailBuryPoint(int status, const std::string& msg,
                                                                 const std::string& triggerReason) {
    const BuryPoint::Record record = BuryPoint::datagramRecord(
        "W688|10316", {{"fail_code", status}, {"fail_reason", msg}, {"trigger_reason", triggerReason}});
    std::string text;
    try {
        text = record.dump();
    } catch (const std::exception& e) {
        Log::mPrintlog("[DeviceWaitForPreConnectManager::sendDeviceListFailBuryPoint] Error occur as: " +
                         std::string(e.what()));
        return false;
    }
    Log::mPrintlog(
        "[DeviceWaitForPreConnectManager::sendDeviceListFailBuryPoint] sendDeviceListFailBuryPoint, buryPointStr is: " +
        text);
    return UdpSocketBase::sendToLocalPort(Config::current().telemetryUdpPort, text);
}

}  // namespace kesu
