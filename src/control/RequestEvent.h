// The control API's request vocabulary and the decoded request.
#pragma once

#include <array>
#include <optional>
#include <string>
#include <string_view>

#include "core/Json.h"

namespace kesu {

enum class RequestEvent {
    queryAll,
    queryAdapter,
    SSDPQueryAll,
    startSSDPScan,
    stopSSDPScan,
    cancelSSDPConnect,
    openWifi,
    connectSSDP,
    QtAgree,
    QtRefuse,
    HeartBeat,
    LaunchSuccess,
    AlreadyStart,
    open,
    preconnect_enterConnectCenter,
    preconnect_startScan,
    preconnect_connect,
    preconnect_preconnect,
    preconnect_disconnect,
    preconnect_cancel,
    connectCenterEventReport,
    connectCenterEventCreate,
    kpush,
    enable,
    accountChange,
    getSystemStatus,
    unknown,
    preconnect_preconnect_connect,
    historyPhoneChange,
};

// Every case in declaration order (the order used for matching names).
const std::array<RequestEvent, 29>& allValues();
// The name of the event on the wire.
std::string_view rawValue(RequestEvent event);
// The event whose wire name equals `name` exactly (case-sensitive); unknown otherwise.
RequestEvent requestEventFrom(std::string_view name);

// A decoded control request.
struct requestObj {
    RequestEvent event = RequestEvent::unknown;
    std::optional<std::string> source;  // the sender's application ("app")
    Json params = Json::array();        // object, array or string; [] when unusable
};

}  // namespace kesu
