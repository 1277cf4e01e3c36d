#include "control/RequestEvent.h"

namespace kesu {

namespace {
constexpr std::array<std::string_view, 29> kNames = {
    "queryAll",
    "queryAdapter",
    "SSDPQueryAll",
    "startSSDPScan",
    "stopSSDPScan",
    "cancelSSDPConnect",
    "openWifi",
    "connectSSDP",
    "QtAgree",
    "QtRefuse",
    "HeartBeat",
    "LaunchSuccess",
    "AlreadyStart",
    "open",
    "preconnect_enterConnectCenter",
    "preconnect_startScan",
    "preconnect_connect",
    "preconnect_preconnect",
    "preconnect_disconnect",
    "preconnect_cancel",
    "connectCenterEventReport",
    "connectCenterEventCreate",
    "kpush",
    "enable",
    "accountChange",
    "getSystemStatus",
    "unknown",
    "preconnect_preconnect-connect",
    "historyPhoneChange",
};
}  // namespace

const std::array<RequestEvent, 29>& allValues() {
    static const std::array<RequestEvent, 29> values = [] {
        std::array<RequestEvent, 29> v{};
        for (std::size_t i = 0; i < v.size(); ++i) v[i] = static_cast<RequestEvent>(i);
        return v;
    }();
    return values;
}

std::string_view rawValue(RequestEvent event) {
    auto index = static_cast<std::size_t>(event);
    return index < kNames.size() ? kNames[index] : std::string_view("unknown");
}

RequestEvent requestEventFrom(std::string_view name) {
    for (RequestEvent event : allValues())
        if (rawValue(event) == name) return event;
    return RequestEvent::unknown;
}

}  // namespace kesu
