// The events of the service's bus: what changed on the PC (network, Wi-Fi, screen lock,
// account) or what the PC suite asked for. Each kind has one name, used in the log.
#pragma once

#include <cstdint>
#include <initializer_list>

namespace kesu {

enum class ServiceEvent : std::uint8_t {
    NetworkChange,
    WifiOpen,
    WifiClose,
    WlanNetConnect,
    WlanNetDisconnect,
    WiredNetConnect,
    WiredNetDisconnect,
    LogOn,
    LogOut,
    AccountChange,
    Pcsuite,
    DeviceListUpdate,
    DeviceInfoReport,
};

// "NetworkChangeEvent", "LogOnEvent", "DeviceListUpdate", ...
const char* eventName(ServiceEvent event);

// A set of event kinds (what a subscriber takes, what is pending for it).
class EventSet {
public:
    constexpr EventSet() = default;
    constexpr EventSet(std::initializer_list<ServiceEvent> events) {
        for (ServiceEvent e : events) add(e);
    }
    constexpr bool contains(ServiceEvent e) const { return (bits_ & bit(e)) != 0; }
    constexpr void add(ServiceEvent e) { bits_ |= bit(e); }
    constexpr void remove(ServiceEvent e) { bits_ &= ~bit(e); }
    constexpr bool empty() const { return bits_ == 0; }

private:
    static constexpr std::uint32_t bit(ServiceEvent e) { return std::uint32_t(1) << static_cast<unsigned>(e); }
    std::uint32_t bits_ = 0;
};

}  // namespace kesu
