#include "reports/DeviceListReporter.h"

#include <asio/steady_timer.hpp>

#include <algorithm>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <optional>

#include "core/EventLoop.h"

#include "core/Config.h"
#include "core/Json.h"
#include "core/Endpoints.h"
#include "core/Log.h"
#include "pcsuite/PcsuiteClient.h"
#include "platform/SystemInfo.h"
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

// The scheduling state, shared with the timers and the pool work so that none of them
// outlives what it touches. Guarded by `mutex`; the timer objects are used on the loop only.
struct DeviceListReporter::Core : std::enable_shared_from_this<Core> {
    using Steady = std::chrono::steady_clock;

    explicit Core(DeviceListReporter& o) : owner(o) {}

    // Queues the arming of the send timer for the pending list (lock held, not sending).
    void scheduleLocked() {
        Steady::time_point at = due;
        if (lastStart) at = std::max(at, *lastStart + Config::current().reportThrottle);
        loop->post([self = shared_from_this(), on = loop, at, round = epoch] { self->arm(*on, at, round); });
    }
    // Loop.
    void arm(EventLoop& on, Steady::time_point at, std::uint64_t round) {
        auto t = std::make_shared<asio::steady_timer>(on.context(), at);
        {
            std::lock_guard<std::mutex> lock(mutex);
            if (round != epoch || loop != &on) return;
            timer = t;
        }
        t->async_wait([self = shared_from_this(), &on, round](const std::error_code& error) {
            if (!error) self->fire(on, round);
        });
    }
    // Loop: the list is built from here on, so a change after this needs a send of its own.
    void fire(EventLoop& on, std::uint64_t round) {
        std::string target;
        {
            std::lock_guard<std::mutex> lock(mutex);
            if (round != epoch || loop != &on || !pending || sending) return;
            pending = false;
            sending = true;
            lastStart = Steady::now();
            timer.reset();
            target = url;
        }
        // The send ends when the work has run, or when the pool dropped it at its stop.
        std::shared_ptr<void> ended(nullptr, [self = shared_from_this()](void*) { self->sent(); });
        on.offload([self = shared_from_this(), target, ended = std::move(ended)]() mutable {
            self->owner.send(target);
            ended.reset();
        });
    }
    // Pool (or wherever the send's work is dropped).
    void sent() {
        std::lock_guard<std::mutex> lock(mutex);
        sending = false;
        changed.notify_all();
        if (pending && loop) scheduleLocked();
    }
    // Drops the waiting report and its timer (lock held).
    void dropLocked() {
        pending = false;
        ++epoch;
        if (timer && loop) loop->post([t = std::move(timer)] { t->cancel(); });
        timer.reset();
    }

    DeviceListReporter& owner;
    std::mutex mutex;
    std::condition_variable changed;
    EventLoop* loop = nullptr;                // set while started
    bool pending = false;                     // a list is wanted that has not been built yet
    bool sending = false;                     // a list is being built and posted
    std::uint64_t epoch = 0;                  // bumped by cancel(): older timers do nothing
    Steady::time_point due;                   // first notify of the pending list + reportDelay
    std::string url;
    std::optional<Steady::time_point> lastStart;  // start of the previous send
    std::shared_ptr<asio::steady_timer> timer;    // the armed send timer (touched on the loop)
};

DeviceListReporter::DeviceListReporter() : core_(std::make_shared<Core>(*this)) {}

DeviceListReporter::~DeviceListReporter() { stop(); }

void DeviceListReporter::start(EventLoop& loop) {
    std::lock_guard<std::mutex> lock(core_->mutex);
    core_->loop = &loop;
}

void DeviceListReporter::notify() {
    const std::string url = reportUrl();
    const auto delay = Config::current().reportDelay;
    std::lock_guard<std::mutex> lock(core_->mutex);
    if (!core_->loop) return;
    if (core_->pending) return;  // the list still to be built carries this change too
    core_->pending = true;
    core_->due = Core::Steady::now() + delay;  // the pause lets a burst go as one list
    core_->url = url;
    if (!core_->sending) core_->scheduleLocked();  // else the end of that post schedules it
}

bool DeviceListReporter::send(const std::string& url) {
    if (!mayReport()) return false;
    if (!SystemInfo::isAppRunning(pcsuiteAppName)) return false;

    const std::string body = buildBody();
    std::string response;
    const bool posted = PcsuiteClient::httpMsgSend(body, url, "POST", response);
    afterPost(body);
    return posted;
}

void DeviceListReporter::cancel() {
    std::unique_lock<std::mutex> lock(core_->mutex);
    core_->dropLocked();
    core_->changed.wait(lock, [this] { return !core_->sending; });
}

void DeviceListReporter::stop() {
    std::unique_lock<std::mutex> lock(core_->mutex);
    core_->dropLocked();
    core_->loop = nullptr;
    core_->changed.wait(lock, [this] { return !core_->sending; });
}

bool DeviceListReporter::waitIdle(std::chrono::milliseconds timeout) {
    std::unique_lock<std::mutex> lock(core_->mutex);
    return core_->changed.wait_for(lock, timeout, [this] { return !core_->pending && !core_->sending; });
}

// ---- WlanReportDevices ----------------------------------------------------------------------

WlanReportDevices::WlanReportDevices() : WlanReportDevices(SsdpDeviceManager::instance()) {}

WlanReportDevices::WlanReportDevices(SsdpDeviceManager& manager)
    : manager_(manager) {}

// Stopped here, while the whole object still exists: a send under way calls the overrides.
WlanReportDevices::~WlanReportDevices() { stop(); }

std::string WlanReportDevices::reportUrl() const { return Endpoints::pcsuiteHttpServerSSDPQueryAllUrl(); }

bool WlanReportDevices::mayReport() {
    const auto snapshot = SystemInfo::getNetworkCorrespondAddress();
    if (snapshot.find("Ethernet") == snapshot.end() && !SystemInfo::SsidWifiCondition()) {
        Log::mPrintlog("[WlanReportDevices::sendDevices] Network is useless, don't send wlan devices");
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

std::string ReportDevicesV2::reportUrl() const { return Endpoints::pcsuiteHttpServerPushGattClientListUrl(); }

std::string ReportDevicesV2::buildBody() {
    return listText(registry_.getAllDevices(),
                    [](const IDeviceWaitForPreConnect& entry) { return entry.getPcsuiteDeviceInfo(); });
}

void ReportDevicesV2::afterPost(const std::string& body) {
    Log::mPrintlog("[ReportDevicesV2::sendDevices] [INTERACTION][CONNSERVER_TO_PCSUITE] SendDevices content: " +
                     RequestBase::maskForLog(body));
}

}  // namespace kesu
