#include "cloud/HttpEventSubscriber.h"

#include <chrono>
#include <vector>

#include "account/DataGet.h"
#include "account/DataInstance.h"
#include "cloud/ConnectCenterRequest.h"
#include "cloud/PcReport.h"
#include "core/Log.h"
#include "pcsuite/RequestBase.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

namespace {

constexpr EventSet kEvents{ServiceEvent::WifiOpen,      ServiceEvent::LogOn,         ServiceEvent::Pcsuite,
                           ServiceEvent::NetworkChange, ServiceEvent::AccountChange, ServiceEvent::DeviceListUpdate,
                           ServiceEvent::DeviceInfoReport};

// The PC's id as the center knows it: the account record's, else the PC suite's.
std::string pcDeviceId() {
    std::string id = dataInstance().get(&databaseParam::pcDeviceId);
    if (id.empty()) id = getPcsuiteDeviceInfo();
    return id;
}

}  // namespace

HttpEventSubscriber::HttpEventSubscriber(EventLoop& loop)
    : HttpEventSubscriber(loop, DeviceWaitForPreConnectManager::instance(), SteadyClock::system()) {}

HttpEventSubscriber::HttpEventSubscriber(EventLoop& loop, DeviceWaitForPreConnectManager& registry,
                                         const SteadyClock& clock)
    : IEventSubscriber(loop, kEvents), registry_(registry), clock_(clock) {}

void HttpEventSubscriber::notify(ServiceEvent event) {
    if (event == ServiceEvent::AccountChange) {
        std::lock_guard<std::mutex> lock(mergeMutex_);
        ++accountGeneration_;
    }
    IEventSubscriber::notify(event);
}

bool HttpEventSubscriber::passesThrottle(ServiceEvent event) {
    const auto now = clock_.now();
    const bool throttled = event == ServiceEvent::Pcsuite || event == ServiceEvent::DeviceListUpdate;
    if (throttled && lastTime_ && now - *lastTime_ < throttle) return false;
    lastTime_ = now;
    return true;
}

void HttpEventSubscriber::eventNotify(ServiceEvent event) {
    if (!handles(event)) return;
    if (!passesThrottle(event)) {
        Log::mPrintlog(std::string("[HttpEventSubscriber::eventNotify] ") + eventName(event) +
                       " within 3 s of the last event, skipped \n");
        return;
    }
    dispatchEvent(event);
}

void HttpEventSubscriber::dispatchEvent(ServiceEvent event) {
    if (!handles(event)) return;
    const std::string name = eventName(event);
    switch (event) {
        case ServiceEvent::DeviceListUpdate:
            getPreDeviceList(name);
            break;
        case ServiceEvent::DeviceInfoReport:
            reportDeviceInfo();
            break;
        case ServiceEvent::AccountChange:
            unBindDevice();
            reportDeviceInfo();
            getPreDeviceList(name);
            break;
        default:
            reportDeviceInfo();
            getPreDeviceList(name);
            break;
    }
}

bool HttpEventSubscriber::reportDeviceInfo() {
    // Signed out: the center takes nothing, so the facts are not gathered either.
    if (dataInstance().get(&databaseParam::openid).empty()) {
        Log::mPrintlog("[HttpEventSubscriber::reportDeviceInfo] not signed in, no report \n");
        return false;
    }
    const Json report = Json::array({PcReport::build(PcReport::gather())});
    {
        std::lock_guard<std::mutex> lock(reportMutex_);
        lastReportDeviceInfo_ = report;
    }
    int status = 0;
    std::string msg;
    if (!ConnectCenterRequest::reportDevice(report, status, msg)) {
        Log::mPrintlog("[HttpEventSubscriber::reportDeviceInfo] device/report request failed! status: " +
                       std::to_string(status) + ", msg: " + RequestBase::maskForLog(msg) + " \n");
        return false;
    }
    std::lock_guard<std::mutex> lock(reportMutex_);
    lastReportDeviceInfo_ = Json::array();
    return true;
}

Json HttpEventSubscriber::lastReportDeviceInfo() const {
    std::lock_guard<std::mutex> lock(reportMutex_);
    return lastReportDeviceInfo_;
}

bool HttpEventSubscriber::unBindDevice() {
    const databaseParam account = dataInstance().get();
    if (account.openid.empty() || account.lastOpenId.empty()) {
        Log::mPrintlog("[HttpEventSubscriber::unBindDevice] no previous account or signed out, nothing to unbind \n");
        return false;
    }
    const std::string id = pcDeviceId();
    if (id.empty()) {
        Log::mPrintlog("[HttpEventSubscriber::unBindDevice] no PC device id, nothing to unbind \n");
        return false;
    }
    int status = 0;
    std::string msg;
    return ConnectCenterRequest::unBindDevice(std::vector<std::string>{id}, status, msg).has_value();
}

bool HttpEventSubscriber::getPreDeviceList(const std::string& triggerReason) {
    static const std::string logPrefix = "[HttpEventSubscriber::getPreDeviceList] ";
    // The account the list is asked for; an account change before the merge makes it stale.
    const std::uint64_t generation = accountGeneration_.load();
    const std::string openid = dataInstance().get(&databaseParam::openid);
    const auto start = clock_.now();
    int status = 0;
    std::string msg;
    const std::optional<Json> reply = ConnectCenterRequest::getDeviceList(status, msg);
    if (!reply) {
        Log::mPrintlog(logPrefix + "device/list request failed! status: " + std::to_string(status) +
                       ", msg: " + RequestBase::maskForLog(msg));
        // Only an exchange that produced a status is worth a failure record.
        if (status != 0) registry_.sendDeviceListFailBuryPoint(status, msg, triggerReason);
        return false;
    }
    const int duration = static_cast<int>(
        std::chrono::duration_cast<std::chrono::milliseconds>(clock_.now() - start).count());

    // The list as merged: "data" must be an array when given (a reply without it lists no
    // device), and no more than maxListedDevices of it are taken.
    Json list = *reply;
    if (list.contains("data") && !list["data"].is_null() && !list["data"].is_array()) {
        Log::mPrintlog(logPrefix + "device/list reply holds no device array, the list is left as it was \n");
        return false;
    }
    if (list.contains("data") && list["data"].is_array() && list["data"].size() > maxListedDevices) {
        Log::mPrintlog(logPrefix + "device/list names " + std::to_string(list["data"].size()) +
                       " devices, the first " + std::to_string(maxListedDevices) + " are taken \n");
        Json& data = list["data"];
        data.erase(data.begin() + static_cast<std::ptrdiff_t>(maxListedDevices), data.end());
    }

    const auto stale = [&] {
        return accountGeneration_.load() != generation || dataInstance().get(&databaseParam::openid) != openid;
    };
    if (stale()) {
        Log::mPrintlog(logPrefix + "account changed while the list was fetched, the list is dropped \n");
        return false;
    }
    registry_.sendDeviceListBuryPoint(list, duration);
    {
        std::lock_guard<std::mutex> lock(mergeMutex_);
        if (stale()) {
            Log::mPrintlog(logPrefix + "account changed while the list was fetched, the list is dropped \n");
            return false;
        }
        registry_.addFarawayDevices(list);
    }
    DeviceWaitForPreConnectManager::instance().notifyListChanged();
    return true;
}

}  // namespace kesu
