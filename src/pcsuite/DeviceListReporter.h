// The two device lists pushed to the PC suite: the LAN list (WlanReportDevices) and the
// pre-connect list (ReportDevicesV2), and the throttled, coalescing send they share.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <thread>

namespace kesu {

class SsdpDeviceManager;
class DeviceWaitForPreConnectManager;

// One reporter: notify() asks for the list to be sent; a thread of the reporter's own sends
// it reportDelay later, at least reportThrottle after its previous list, when the PC suite's
// application runs. Changes that arrive before the list is built ride along with that send
// (dropped, never queued); a change that arrives while a built list is being posted leaves
// exactly one follow-up send, so the PC suite always ends up with the current list.
class DeviceListReporter {
public:
    // The application whose presence the reports depend on.
    static inline const std::string pcsuiteAppName = "kesu办公套件";

    virtual ~DeviceListReporter();
    DeviceListReporter(const DeviceListReporter&) = delete;
    DeviceListReporter& operator=(const DeviceListReporter&) = delete;

    // Any thread, never blocks for long. The target URL is taken from the configuration now.
    void notify();
    // One throttled send on the calling thread (the waits end early on stop() or cancel());
    // true when the list was posted and the PC suite answered.
    bool send(const std::string& url);

    // True while a send runs (between taking the send lock and the end of the post).
    bool getIsNotify() const { return m_isNotify.load(); }
    void setIsNotify(bool is) { m_isNotify.store(is); }

    // Drops a report that is waiting, ends throttle waits, and waits for a post in progress
    // to finish. Later notify() calls work as before.
    void cancel();
    // cancel(), then ends the reporter's thread for good; notify() does nothing afterwards.
    void stop();
    // Waits until no report is waiting or being sent; false at the time-out.
    bool waitIdle(std::chrono::milliseconds timeout);

protected:
    DeviceListReporter() = default;

    // The URL the list goes to, from the current configuration.
    virtual std::string reportUrl() const = 0;
    // Checks of this kind of list made before the application test; false skips the send.
    virtual bool mayReport() { return true; }
    // The list as a JSON array text: "[" + element texts joined by ", " + "]".
    virtual std::string buildBody() = 0;
    // After the post (logging).
    virtual void afterPost(const std::string& /*body*/) {}

private:
    using Steady = std::chrono::steady_clock;

    void run();
    bool sendRound(const std::string& url, std::uint64_t epoch);

    std::atomic<bool> m_isNotify{false};
    std::mutex lock;  // serialises sends of this reporter

    // Everything below is guarded by state_.
    std::mutex state_;
    std::condition_variable changed_;
    bool pending_ = false;            // a list is wanted that has not been built yet
    Steady::time_point pendingSince_;
    std::chrono::milliseconds pendingDelay_{0};
    std::string pendingUrl_;
    std::uint64_t epoch_ = 0;         // bumped by cancel(): waits of older rounds give up
    bool stopping_ = false;
    int sending_ = 0;                 // sends under way (worker or direct)
    std::optional<Steady::time_point> lastTime;  // start of the previous send
    std::thread worker_;
};

// The devices heard on the LAN, posted to "/SSDPQueryAll". Held by the service manager and
// registered with the observers of the discovered-device table.
class WlanReportDevices final : public DeviceListReporter {
public:
    // Reports the table of SsdpDeviceManager::instance().
    WlanReportDevices();
    explicit WlanReportDevices(SsdpDeviceManager& manager);
    ~WlanReportDevices() override;

protected:
    std::string reportUrl() const override;
    // Needs an Ethernet adapter or Wi-Fi switched on.
    bool mayReport() override;
    std::string buildBody() override;

private:
    SsdpDeviceManager& manager_;
};

// The devices waiting for (or holding) a pre-connection, posted to
// "/RH2RF_PUSH_GATT_CLIENT_LIST".
class ReportDevicesV2 final : public DeviceListReporter {
public:
    // Reports the registry of DeviceWaitForPreConnectManager::instance(); never destroyed.
    static ReportDevicesV2& instance();

    ReportDevicesV2();
    explicit ReportDevicesV2(DeviceWaitForPreConnectManager& registry);
    ~ReportDevicesV2() override;

protected:
    std::string reportUrl() const override;
    std::string buildBody() override;
    void afterPost(const std::string& body) override;

private:
    DeviceWaitForPreConnectManager& registry_;
};

}  // namespace kesu
