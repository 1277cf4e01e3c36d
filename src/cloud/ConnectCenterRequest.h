// Client of the cloud connect center: one request per operation, signed with the account's
// credentials in headers, and the reply handed back only when the center accepted it.
//
// Every operation blocks its thread for the whole HTTP exchange (up to three attempts while
// the center answers 429, each bounded by Config::httpRequestTimeout). Callers on the event
// loop run them on the loop's pool (EventLoop::offload, or `co_await loop.runBlocking(...)`),
// never on the loop thread itself.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "core/Json.h"
#include "pcsuite/RequestBase.h"

namespace kesu {

enum class CENTER_HTTP_PATH {
    BIND_DEVICE,  // declared for completeness; nothing sends it
    UN_BIND_DEVICE,
    REPORT_DEVICE,
    GET_DEVICE_INFO,
    GET_DEVICE_LIST,
    CREATE_EVENT,
    REPORT_EVENT,
    GET_EVENT,
};
std::string rawValue(CENTER_HTTP_PATH path);  // "/device/bind", ...

// The "code" of the center's replies.
enum class ConnectCenterResCode : int {
    Success = 0,
    ServiceException = 10000,
    ServiceThrottling = 10005,
    ParameterMissing = 20000,
    UnsupporteMethod = 20405,
    DataStorageException = 50100,
    UnsupportedDeviceType = 50400,
    EventException = 60000,
    EventParameterError = 60100,
    UnsupportedEventType = 60400,
    UnsupportedEventStatus = 60401,
    EventExists = 60600,
    EventNotExists = 60700,
    EventFlowEnd = 60800,
    EventReportStatusError = 60900,
    EventFailureShouldReportReason = 61000,
    AccountServiceError = 110000,
    TokenInvalid = 120000,
    TokenExpired = 120002,
};

enum class ConnectCenterEventType : int { DeviceListUpdate = 1, InfoReport = 2, Diagnostic = 3, PhoneConnect = 4 };

enum class ConnectCenterEventStatus : int { Initial = 0, Success = 1, Failure = 2 };

// All operations share the last two parameters: `status` and `msg` as RequestBase::http
// leaves them (the reply's "code" and "msg" when a JSON reply came, else the HTTP status or
// the caller's values). The result is the reply when its "code" is the integer 0, else none.
class ConnectCenterRequest {
public:
    using Headers = RequestBase::Headers;

    // Sends `params` (as JSON, when given) to the center's `path` with the account headers
    // "userId", "token", "source", "version" and "deviceId"; `requestHeader` replaces headers of
    // the same name. Nothing is sent without an open id or without a PC device id.
    static std::optional<Json> requestIntercept(const std::string& path, const std::optional<Json>& params,
                                                MethodType method, const Headers& requestHeader, int& status,
                                                std::string& msg);

    // Unbinds the devices `data` (ids) from the account signed in before the current one,
    // with that account's open id and token.
    static std::optional<Json> unBindDevice(const std::vector<std::string>& data, int& status, std::string& msg);
    // Reports devices (a JSON array of device reports).
    static std::optional<Json> reportDevice(const Json& data, int& status, std::string& msg);
    static std::optional<Json> getDeviceInfo(const std::string& deviceId, int& status, std::string& msg);
    static std::optional<Json> getDeviceList(int& status, std::string& msg);
    static std::optional<Json> createEvent(const Json& data, int& status, std::string& msg);
    static std::optional<Json> reportEvent(const Json& data, int& status, std::string& msg);
    static std::optional<Json> getEvent(const std::string& eventId, int& status, std::string& msg);

    // The reply when it is an object whose "code" is the integer 0; otherwise logs it and
    // gives none.
    static std::optional<Json> responseIntercept(const std::optional<Json>& json, const std::string& path);
};

}  // namespace kesu
