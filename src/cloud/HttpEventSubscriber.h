// Keeps the connect center and the pre-connect registry in step with the PC: on account,
// network, Wi-Fi, log-on and PC suite events it reports this PC to the center and fetches the
// account's device list into the registry; on an account change it first unbinds the PC from
// the previous account.
//
// Every request blocks only the worker that handles the event (the bus runs handlers on the
// loop's pool, one event at a time), never the loop: a center that is down, slow or refusing
// delays nothing but this subscriber's own next event.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>

#include "core/Json.h"
#include "core/SteadyClock.h"
#include "events/IEventSubscriber.h"

namespace kesu {

class DeviceWaitForPreConnectManager;

class HttpEventSubscriber : public IEventSubscriber {
public:
    // Events that repeat within this time of the last handled one are skipped.
    static constexpr std::chrono::milliseconds throttle{3000};
    // Most devices of one list that are merged; the rest are left out (and logged).
    static constexpr std::size_t maxListedDevices = 500;

    // Merges into `registry`; the throttle reads `clock` (tests move it by hand).
    explicit HttpEventSubscriber(EventLoop& loop);
    HttpEventSubscriber(EventLoop& loop, DeviceWaitForPreConnectManager& registry, const SteadyClock& clock);

    // An account change is noted at once (on the publisher's thread), so that a list still
    // being fetched for the previous account is not merged; then the event is queued.
    void notify(ServiceEvent event) override;
    // The throttle, then the action of the event.
    void eventNotify(ServiceEvent event) override;

    // The action of one event (no throttle).
    void dispatchEvent(ServiceEvent event);
    // Builds the PC report and sends it; true when the center accepted it.
    bool reportDeviceInfo();
    // Fetches the device list and merges it into the registry; true when a list was merged.
    bool getPreDeviceList(const std::string& triggerReason);
    // Unbinds this PC from the account signed in before; true when the center accepted it.
    bool unBindDevice();

    // The PC report not yet accepted by the center: [report], or [] when none is pending.
    Json lastReportDeviceInfo() const;

private:
    // True when the event passes the throttle; then it counts as the last handled one.
    bool passesThrottle(ServiceEvent event);

    DeviceWaitForPreConnectManager& registry_;
    const SteadyClock& clock_;

    std::optional<SteadyClock::time_point> lastTime_;  // only the handler touches it

    mutable std::mutex reportMutex_;
    Json lastReportDeviceInfo_ = Json::array();

    // Bumped on every account change; a list fetched under an older value is stale. The
    // merge holds mergeMutex_, so once notify() returns no stale merge is under way.
    std::mutex mergeMutex_;
    std::atomic<std::uint64_t> accountGeneration_{0};
};

}  // namespace kesu
