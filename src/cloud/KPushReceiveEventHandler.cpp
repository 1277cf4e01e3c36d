#include "cloud/KPushReceiveEventHandler.h"

#include <map>
#include <optional>

#include "account/DataInstance.h"
#include "cloud/ConnectCenterRequest.h"
#include "core/ConnectCodes.h"
#include "core/Log.h"
#include "events/EventPublisher.h"
#include "pcsuite/PcsuiteRequest.h"
#include "pcsuite/RequestBase.h"
#include "preconnect/FarawayDevice.h"
#include "preconnect/StrategyDevicePreconnect.h"

namespace kesu {

namespace {

const std::string kHandlerTag = "[KPushReceiveEventHandler][kpushInfoHandler] ";
const std::string kNoticeTag = "[KPushReceiveEventHandler][passivePreConnect] ";

// The result code of a connect-center event report that failed for want of an outcome.
constexpr int kReportFailureCode = 20000;

// The members of a push message are read leniently: one that is missing or of another type
// is taken as absent, with a line in the log naming it.
void logAbsent(const std::string& tag, const Json& parent, const std::string& key, const char* kind) {
    const bool present = parent.is_object() && parent.contains(key);
    Log::mPrintlog(tag + "\"" + key + "\" " + (present ? std::string("is not ") + kind : std::string("is missing")) +
                   " \n");
}

std::optional<Json> objectMember(const std::string& tag, const Json& parent, const std::string& key) {
    if (parent.is_object()) {
        const auto it = parent.find(key);
        if (it != parent.end() && it->is_object()) return *it;
    }
    logAbsent(tag, parent, key, "an object");
    return std::nullopt;
}

std::optional<std::string> stringMember(const std::string& tag, const Json& parent, const std::string& key) {
    if (parent.is_object()) {
        const auto it = parent.find(key);
        if (it != parent.end() && it->is_string()) return it->get<std::string>();
    }
    logAbsent(tag, parent, key, "a string");
    return std::nullopt;
}

std::optional<long long> integerMember(const std::string& tag, const Json& parent, const std::string& key) {
    const auto value = json::exactInteger(parent, key);
    if (!value) logAbsent(tag, parent, key, "an integer");
    return value;
}

std::string reply(int error, const std::string& message) {
    return json::pretty(Json{{"error", error}, {"error_message", message}});
}

// The connect center's event report for `eventId`, failed until an outcome says otherwise.
Json eventReport(const std::string& eventId, int retCode, const std::string& retMsg) {
    return Json{{"userId", dataInstance().get(&databaseParam::openid)},
                {"ext", {{"eventId", eventId}}},
                {"eventId", eventId},
                {"status", static_cast<int>(ConnectCenterEventStatus::Failure)},
                {"retCode", retCode},
                {"retMsg", retMsg}};
}

bool sendReport(const Json& report) {
    int status = 0;
    std::string msg;
    return ConnectCenterRequest::reportEvent(report, status, msg).has_value();
}

}  // namespace

KPushReceiveEventHandler& KPushReceiveEventHandler::instance() {
    static KPushReceiveEventHandler* handler = new KPushReceiveEventHandler();
    return *handler;
}

std::string KPushReceiveEventHandler::kpushInfoHandler(const Json& params) {
    if (!params.is_object()) {
        Log::mPrintlog(kHandlerTag + "push message is not a JSON object \n");
        return reply(rawValue(ErrorCode::UNKNOWN), "kpush data nil");
    }
    const Json data = objectMember(kHandlerTag, params, "data").value_or(Json::object());
    const std::string cmd = stringMember(kHandlerTag, data, "cmd").value_or("");
    const std::optional<Json> exdata = objectMember(kHandlerTag, data, "exdata");

    if (cmd == "MQTT_CONNECT_SERVER_SUCCESS" || cmd == "QUERY_CLIENT_ID") {
        if (exdata) {
            const std::string clientId = stringMember(kHandlerTag, *exdata, "clientId").value_or("");
            dataInstance().set(&databaseParam::clientId, clientId);
            Log::mPrintlog(kHandlerTag + "clientId: " + clientId);
        }
    } else if (cmd == "MQTT_SUBSCRIBE_MSG_ARRIVED") {
        if (exdata) {
            if (const auto type = integerMember(kHandlerTag, *exdata, "type")) {
                switch (*type) {
                    case static_cast<int>(ConnectCenterEventType::PhoneConnect):
                        passivePreConnect(*exdata);
                        break;
                    case static_cast<int>(ConnectCenterEventType::DeviceListUpdate):
                        EventPublisher::instance().notifySubscribers(ServiceEvent::DeviceListUpdate);
                        break;
                    case static_cast<int>(ConnectCenterEventType::InfoReport):
                        EventPublisher::instance().notifySubscribers(ServiceEvent::DeviceInfoReport);
                        break;
                    default:
                        Log::mPrintlog(kHandlerTag + "MQTT_SUBSCRIBE_MSG_ARRIVED eventType: " + std::to_string(*type));
                }
            }
        }
    }
    return reply(0, "kpush success");
}

void KPushReceiveEventHandler::passivePreConnect(const Json& exdata) {
    Log::mPrintlog(kNoticeTag + "exdata: " + RequestBase::maskForLog(json::compact(exdata)) + " \n");
    const Json ext = objectMember(kNoticeTag, exdata, "ext").value_or(Json::object());
    const std::string businessId = stringMember(kNoticeTag, ext, "businessId").value_or("");
    const std::string key = deviceKeyOf(businessId);
    const std::string eventId = stringMember(kNoticeTag, exdata, "eventId").value_or("");
    Log::mPrintlog(kNoticeTag + "deviceId: " + key + ", eventId: " + eventId + " \n");

    if (stringMember(kNoticeTag, ext, "connectType") == "PreConnect") {
        Json report = eventReport(eventId, 0, "");
        Log::mPrintlog("[KPushReceiveEventHandler::passivePreConnect] Start preConnect by kpush message");
        Log::mPrintlog(
            "[KPushReceiveEventHandler::passivePreConnect] Preconnect device by user choose, device external id: " +
            businessId + ", internal id: " + key);
        // A notice that names no phone names no entry of the registry: nothing to wait for.
        const bool ok = !key.empty() && StrategyDevicePreconnect::preconnectDeviceByDeviceId(key);
        if (ok) {
            report["status"] = static_cast<int>(ConnectCenterEventStatus::Success);
        } else {
            report["retCode"] = kReportFailureCode;
            report["retMsg"] = "Preconnect failed";
        }
        if (!sendReport(report)) Log::mPrintlog(kNoticeTag + "Connect center event report failed \n");
        return;
    }

    // Any other connection type is the user's: the PC suite connects the phone.
    Json report = eventReport(eventId, kReportFailureCode, "UNKNOWN");
    if (key.empty()) {
        Log::mPrintlog(kNoticeTag + "no device to connect \n");
    } else {
        const std::map<std::string, std::string> request{
            {"requestSource", "kpush"}, {"eventId", eventId}, {"deviceId", key}};
        if (const auto answer = PcsuiteRequest::startConnectPreDevice(request)) {
            if (const auto outcome = PcsuiteRequest::connectDeviceOutcome(*answer)) {
                report["retCode"] = outcome->code;
                report["retMsg"] = outcome->reason;
                report["status"] = static_cast<int>(outcome->code == 0 ? ConnectCenterEventStatus::Success
                                                                         : ConnectCenterEventStatus::Failure);
            } else {
                Log::mPrintlog(kNoticeTag + "connect device answer carries no outcome \n");
            }
        } else {
            Log::mPrintlog(kNoticeTag + "connect device failed \n");
        }
    }
    if (!sendReport(report)) Log::mPrintlog("[ReceiveEventHandler][passivePreConnect] report event failed \n");
}

}  // namespace kesu
