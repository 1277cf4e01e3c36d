#include "pcsuite/DeviceListReporter.h"

#include "core/Config.h"
#include "core/Json.h"
#include "core/Utils.h"
#include "discovery/SsdpDeviceManager.h"
#include "pcsuite/RequestBase.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu {

namespace {

// The list text the PC suite reads: "[" + compact element texts joined by ", " + "]".
template <typename Range, typename ToJson>
std::string listText(const Range& items, ToJson toJson) {
    std::string body = "[";
    bool first = true;
    for (const auto& item : items) {
        if (!item) continue;
        if (!first) body += ", ";
        body += json::compact(toJson(*item));
        first = false;
    }
    body += "]";
    return body;
}

}  // namespace

// ---- DeviceListReporter ---------------------------------------------------------------------

DeviceListReporter::~DeviceListReporter() { stop(); }

void DeviceListReporter::notify() {
    const std::string url = reportUrl();
    const auto delay = Config::current().reportDelay;
    std::lock_guard<std::mutex> guard(state_);
    if (stopping_) return;
    if (pending_) return;  // the list still to be built carries this change too
    pending_ = true;
    pendingSince_ = Steady::now();
    pendingDelay_ = delay;
    pendingUrl_ = url;
    if (!worker_.joinable()) worker_ = std::thread([this] { run(); });
    changed_.notify_all();
}

void DeviceListReporter::run() {
    std::unique_lock<std::mutex> state(state_);
    for (;;) {
        changed_.wait(state, [this] { return stopping_ || pending_; });
        if (stopping_) return;
        const std::uint64_t epoch = epoch_;
        // The pause lets the table settle: a burst of announcements goes as one list.
        changed_.wait_until(state, pendingSince_ + pendingDelay_, [&] { return stopping_ || epoch_ != epoch; });
        if (stopping_) return;
        if (epoch_ != epoch) continue;  // cancelled while waiting
        const std::string url = pendingUrl_;
        state.unlock();
        sendRound(url, epoch);
        state.lock();
    }
}

bool DeviceListReporter::send(const std::string& url) {
    std::uint64_t epoch = 0;
    {
        std::lock_guard<std::mutex> guard(state_);
        epoch = epoch_;
    }
    return sendRound(url, epoch);
}

bool DeviceListReporter::sendRound(const std::string& url, std::uint64_t epoch) {
    std::lock_guard<std::mutex> sendGuard(lock);
    {
        std::lock_guard<std::mutex> guard(state_);
        if (stopping_ || epoch_ != epoch) return false;
        ++sending_;
    }
    setIsNotify(true);
    // Whatever way the send ends: not busy any more.
    struct Done {
        DeviceListReporter& self;
        ~Done() {
            self.setIsNotify(false);
            std::lock_guard<std::mutex> guard(self.state_);
            --self.sending_;
            self.changed_.notify_all();
        }
    } done{*this};

    // Throttle: at least reportThrottle between the starts of two sends.
    const auto throttle = Config::current().reportThrottle;
    {
        std::unique_lock<std::mutex> state(state_);
        if (lastTime) {
            changed_.wait_until(state, *lastTime + throttle, [&] { return stopping_ || epoch_ != epoch; });
            if (stopping_ || epoch_ != epoch) return false;
        }
        lastTime = Steady::now();
        // The list is built after this point: a change from now on needs a send of its own.
        pending_ = false;
    }

    if (!mayReport()) return false;
    if (!Utils::isAppRunning(pcsuiteAppName)) return false;

    const std::string body = buildBody();
    std::string response;
    const bool posted = Utils::httpMsgSend(body, url, "POST", response);
    afterPost(body);
    return posted;
}

void DeviceListReporter::cancel() {
    std::unique_lock<std::mutex> state(state_);
    pending_ = false;
    ++epoch_;
    changed_.notify_all();
    changed_.wait(state, [this] { return sending_ == 0; });
}

void DeviceListReporter::stop() {
    {
        std::lock_guard<std::mutex> guard(state_);
        stopping_ = true;
        pending_ = false;
        ++epoch_;
    }
    changed_.notify_all();
    if (worker_.joinable() && worker_.get_id() != std::this_thread::get_id()) worker_.join();
    std::unique_lock<std::mutex> state(state_);
    changed_.wait(state, [this] { return sending_ == 0; });
}

bool DeviceListReporter::waitIdle(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> state(state_);
    return changed_.wait_for(state, timeout, [this] { return !pending_ && sending_ == 0; });
}

// ---- WlanReportDevices ----------------------------------------------------------------------

WlanReportDevices::WlanReportDevices() : WlanReportDevices(SsdpDeviceManager::instance()) {}

WlanReportDevices::WlanReportDevices(SsdpDeviceManager& manager)
    : manager_(manager) {}

// Stopped here, while the whole object still exists: the thread calls the overrides.
WlanReportDevices::~WlanReportDevices() { stop(); }

std::string WlanReportDevices::reportUrl() const { return Utils::pcsuiteHttpServerSSDPQuerryAllUrl(); }

bool WlanReportDevices::mayReport() {
    const auto snapshot = Utils::getNetworkCorrespondAddress();
    if (snapshot.find("Ethernet") == snapshot.end() && !Utils::SsidWifiCondition()) {
        Utils::mPrintlog("[WlanReportDevices::sendDevices] Network is useless, don't send wlan devices");
        return false;
    }
    return true;
}

std::string WlanReportDevices::buildBody() {
    return listText(manager_.getAllDevices(), [](const SsdpDevice& device) { return device.toJson(); });
}

// ---- ReportDevicesV2 ------------------------------------------------------------------------

ReportDevicesV2& ReportDevicesV2::instance() {
    static ReportDevicesV2* report = new ReportDevicesV2();
    return *report;
}

ReportDevicesV2::ReportDevicesV2() : ReportDevicesV2(DeviceWaitForPreConnectManager::instance()) {}

ReportDevicesV2::ReportDevicesV2(DeviceWaitForPreConnectManager& registry)
    : registry_(registry) {}

ReportDevicesV2::~ReportDevicesV2() { stop(); }

std::string ReportDevicesV2::reportUrl() const { return Utils::pcsuiteHttpServerPushGattClientListUrl(); }

std::string ReportDevicesV2::buildBody() {
    return listText(registry_.getAllDevices(),
                    [](const IDeviceWaitForPreConnect& entry) { return entry.getPcsuiteDeviceInfo(); });
}

void ReportDevicesV2::afterPost(const std::string& body) {
    Utils::mPrintlog("[ReportDevicesV2::sendDevices] [INTERACTION][CONNSERVER_TO_PCSUITE] SendDevices content: " +
                     RequestBase::maskForLog(body));
}

}  // namespace kesu
