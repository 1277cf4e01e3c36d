#include "preconnect/PreConnectionThread.h"

#include <asio/co_spawn.hpp>
#include <asio/experimental/as_tuple.hpp>
#include <asio/use_awaitable.hpp>

#include <cstdio>
#include <random>

#include "core/UdpSocketBase.h"
#include "core/Config.h"
#include "core/EventLoop.h"
#include "core/Log.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"
#include "core/WallClock.h"
#include "platform/SystemInfo.h"
#include "pcsuite/BuryPoint.h"
#include "preconnect/PreConnectionStatus.h"

namespace kesu {

namespace {

// A random (version 4) UUID in its upper-case text form.
std::string newUuid() {
    static thread_local std::mt19937_64 random{std::random_device{}()};
    std::uint8_t bytes[16];
    for (int i = 0; i < 16; i += 8) {
        const std::uint64_t r = random();
        for (int j = 0; j < 8; ++j) bytes[i + j] = static_cast<std::uint8_t>(r >> (8 * j));
    }
    bytes[6] = static_cast<std::uint8_t>((bytes[6] & 0x0f) | 0x40);
    bytes[8] = static_cast<std::uint8_t>((bytes[8] & 0x3f) | 0x80);
    std::string text;
    char hex[3];
    for (int i = 0; i < 16; ++i) {
        if (i == 4 || i == 6 || i == 8 || i == 10) text += '-';
        std::snprintf(hex, sizeof hex, "%02X", bytes[i]);
        text += hex;
    }
    return text;
}

struct AttemptReport {
    FarawayDevice::Info device;
    std::string uuid;
    long long duration = 0;
    bool ok = false;
    std::string steps;
};

// One pre-connect record as a datagram to the telemetry collector. Reads the PC's network
// state, so it runs on the loop's pool.
void sendAttemptRecord(const AttemptReport& attempt, const char* eventId, bool withDuration, const std::string& logPrefix) {
    BuryPoint::Record params;
    params["market_name"] = attempt.device.name;
    params["device_type"] = attempt.device.type == "pad" ? 2 : 1;
    params["connect_unique_id"] = attempt.uuid;
    if (withDuration) params["duration"] = attempt.duration;
    params["connect_result"] = attempt.ok ? 1 : 0;
    params["fail_reason"] = attempt.steps;
    params["pc_ssid"] = SystemInfo::SsidWifiName();
    params["is_vpn"] = SystemInfo::isVpnOn() ? 1 : 0;
    std::string addresses;
    for (const auto& [name, address] : SystemInfo::getNetworkCorrespondAddress()) addresses += address + "#";
    params["pc_ip"] = addresses;
    params["pc_blue"] = 0;
    params["wifi"] = SystemInfo::SsidWifiCondition() ? 1 : 0;
    params["firewall"] = SystemInfo::getFirewallState().value_or(false) ? 1 : 0;
    params["hotspot_fre"] = "";
    params["hotspot_share"] = "";
    params["projection_com"] = 0;
    const BuryPoint::Record record = BuryPoint::datagramRecord(eventId, std::move(params));
    std::string text;
    try {
        text = record.dump();
    } catch (const std::exception& e) {
        Log::mPrintlog("[PreConnectionThread::run] Error occur as: " + std::string(e.what()));
        return;
    }
    Log::mPrintlog(logPrefix + text);
    UdpSocketBase::sendToLocalPort(Config::current().telemetryUdpPort, text);
}

}  // namespace

PreConnectionThread::PreConnectionThread(EventLoop& loop, DeviceWaitForPreConnectManager& registry)
    : loop_(loop), registry_(registry), strategyDevicePreconnect_(registry) {}

PreConnectionThread::~PreConnectionThread() { stop(); }

void PreConnectionThread::run() {
    loop_.call([this] {
        if (stopped_ && !*stopped_) return;
        stopped_ = std::make_shared<std::atomic<bool>>(false);
        timer_.emplace(loop_.executor());
        ended_ = std::make_shared<std::promise<void>>();
        // An empty registry needs no ticks: the scheduler sleeps until a device is added.
        registry_.setDevicesAddedHandler([this, &loop = loop_, stopped = stopped_] {
            loop.post([this, stopped] {
                if (!*stopped && timer_) timer_->cancel();
            });
        });
        asio::co_spawn(loop_.executor(), schedule(stopped_),
                       [ended = ended_](const std::exception_ptr&) { ended->set_value(); });
    });
}

void PreConnectionThread::stop() {
    std::future<void> ended;
    loop_.call([&] {
        if (!stopped_ || *stopped_) return;
        *stopped_ = true;
        registry_.setDevicesAddedHandler({});
        if (timer_) timer_->cancel();
        if (current_)
            if (const auto record = current_->getFarawayDevice()) record->destroyClient();
        ended = ended_->get_future();
    });
    if (ended.valid() && loop_.running()) ended.wait_for(std::chrono::seconds(10));
}

asio::awaitable<void> PreConnectionThread::schedule(std::shared_ptr<std::atomic<bool>> stopped) {
    while (!*stopped) {
        co_await attempt();
        if (*stopped) break;
        if (registry_.getDevicesSize() == 0)
            timer_->expires_at(asio::steady_timer::time_point::max());
        else
            timer_->expires_after(Config::current().preconnectPeriod);
        co_await timer_->async_wait(asio::experimental::as_tuple(asio::use_awaitable));
    }
}

asio::awaitable<void> PreConnectionThread::attempt() {
    const auto entry = strategyDevicePreconnect_.pickupWaitforPreconnectDevice();
    if (!entry) co_return;
    current_ = entry;
    const double start = WallClock::currentTimeStamp();
    AttemptReport report;
    report.uuid = newUuid();
    entry->setPreConnectStep("");
    report.ok = co_await entry->startPreConnect();
    current_.reset();

    // The registry may have dropped the device while its handshake ran (a new cloud list, a
    // sign-out): a link made for it is closed, not held for an entry nothing reaches any more.
    DeviceWaitForPreConnectManager::Entry listed;
    if (!registry_.lookupDevices(entry->getDeviceId(), listed) || listed != entry) {
        Log::mPrintlog("[PreConnectionThread::run] " + entry->getDeviceId() +
                       " left the registry during its pre-connect, its link is closed");
        if (const auto record = entry->getFarawayDevice()) record->destroyClient();
        entry->setConnectType("");
        co_return;
    }

    const std::string key = entry->getDeviceId();
    const auto record = entry->getFarawayDevice();
    if (!report.ok) {
        Log::mPrintlog("[PreConnectionThread::run] preConnect result is failed, id " + key);
        entry->addConnectCount();
        entry->setConnectType("");
        if (record) record->destroyClient();
        if (entry->getFarawayWlanConnectCount() >= CONN_MAX) {
            ReportPreconnectResult::instance().notify(key, "failed");
            DeviceWaitForPreConnectManager::instance().notifyListChanged();
        }
    } else {
        report.duration = static_cast<long long>((WallClock::currentTimeStamp() - start) * 1000);
        Log::mPrintlog("[PreConnectionThread::run] preConnect result is success, id " + key);
        entry->setIsConnected(true);
        DeviceWaitForPreConnectManager::instance().notifyListChanged();
        ReportPreconnectResult::instance().notify(key, "success");
    }
    entry->addPreconnectTryNumber();

    const bool first = entry->getFirstConnect();
    if (first) entry->setFirstConnect(false);
    if (record) report.device = record->info();
    report.steps = entry->getPreConnectStep();
    loop_.offload([entry, report = std::move(report), first] {
        if (report.ok || entry->isPcSameWlan())
            sendAttemptRecord(report, "W688|10253", true,
                              "[PreConnectionThread::run] ReportPreConnect sendBuryPoint, buryPointStr is: ");
        if (first)
            sendAttemptRecord(report, "W688|10254", false,
                              "[PreConnectionThread::run] ReportFirstConnect sendBuryPoint, buryPointStr is: ");
    });
}

}  // namespace kesu
