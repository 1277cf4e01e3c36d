// The two device lists pushed to the PC suite: the LAN list (WlanReportDevices) and the
// pre-connect list (ReportDevicesV2), and the throttled, coalescing send they share.
#pragma once

#include <chrono>
#include <memory>
#include <string>

namespace kesu {

class EventLoop;
class SsdpDeviceManager;
class DeviceWaitForPreConnectManager;

// One reporter: notify() asks for the list to be sent; reportDelay later (a timer on the
// loop), at least reportThrottle after the start of its previous send, and when the PC
// suite's application runs, the list is built and posted on the loop's worker pool. Changes
// that arrive before the list is built ride along with that send (never queued twice); a
// change that arrives while a built list is being posted leaves exactly one follow-up send,
// so the PC suite always ends up with the current list. No thread of its own.
class DeviceListReporter {
public:
    // The application whose presence the reports depend on.
    static inline const std::string pcsuiteAppName = "kesu办公套件";

    virtual ~DeviceListReporter();  // stop()
    DeviceListReporter(const DeviceListReporter&) = delete;
    DeviceListReporter& operator=(const DeviceListReporter&) = delete;

    // Reports on `loop` from now on (again after stop()).
    void start(EventLoop& loop);
    // Any thread, never blocks for long; does nothing unless started. The target URL is
    // taken from the configuration now.
    void notify();
    // One send on the calling thread, without delay or throttle: the network and application
    // tests, then the post. True when the list was posted and the PC suite answered.
    bool send(const std::string& url);

    // Drops a report that is waiting and waits for a post in progress to finish. Later
    // notify() calls work as before.
    void cancel();
    // cancel(), and notify() does nothing until the next start().
    void stop();
    // Waits until no report is waiting or being sent; false at the time-out.
    bool waitIdle(std::chrono::milliseconds timeout);

protected:
    DeviceListReporter();

    // The URL the list goes to, from the current configuration.
    virtual std::string reportUrl() const = 0;
    // Checks of this kind of list made before the application test; false skips the send.
    virtual bool mayReport() { return true; }
    // The list as a JSON array text: "[" + element texts joined by ", " + "]".
    virtual std::string buildBody() = 0;
    // After the post (logging).
    virtual void afterPost(const std::string& /*body*/) {}

private:
    struct Core;
    std::shared_ptr<Core> core_;
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
