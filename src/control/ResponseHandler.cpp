#include "control/ResponseHandler.h"

#include "account/DataInstance.h"
#include "cloud/ConnectCenterRequest.h"
#include "cloud/KPushReceiveEventHandler.h"
#include "connect/AllowWindow.h"
#include "core/ConnectCodes.h"
#include "connect/PcsuiteInterface.h"
#include "connect/Step.h"
#include "core/UdpSocketBase.h"
#include "core/Config.h"
#include "core/Text.h"
#include "connect/ConnectionState.h"
#include "core/Log.h"
#include "core/Text.h"
#include "pcsuite/PcsuiteClient.h"
#include "pcsuite/RequestBase.h"
#include "platform/SystemInfo.h"
#include "discovery/SsdpDeviceManager.h"
#include "discovery/StateCheck.h"
#include "events/EventPublisher.h"
#include "reports/DeviceReports.h"
#include "preconnect/ConnectFlow.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"
#include "preconnect/StrategyDevicePreconnect.h"

namespace kesu {

std::string ResponseHandler::switchUint8ArrToString(std::string_view body) {
    std::string text;
    text.reserve(body.size());
    for (char c : body)
        if (static_cast<unsigned char>(c) != 0xFF) text.push_back(c);
    if (!text::isValidUtf8(text)) return {};
    return text;
}

Json ResponseHandler::responseObject(int error, const std::string& message) {
    return Json{{"error", error}, {"error_message", message}};
}

std::string ResponseHandler::response(int error, const std::string& message) {
    return json::pretty(responseObject(error, message));
}

namespace {

using Handler = std::string (*)(const requestObj&);

std::string pretty(const Json& j) { return json::pretty(j); }

// Positional parameters: the array shape of `params`, or none.
const Json& positional(const requestObj& request) {
    static const Json none = Json::array();
    return request.params.is_array() ? request.params : none;
}

std::string paramText(const Json& params, std::size_t i) {
    return i < params.size() ? json::text(params[i]) : std::string();
}

std::string paramString(const Json& params, std::size_t i) {
    return i < params.size() && params[i].is_string() ? params[i].get<std::string>() : std::string();
}

std::string busyConnectionReply() {
    const Step& step = sharedStep();
    Json reply = ResponseHandler::responseObject(rawValue(ErrorCode::STATE_BUSY), "STATE_BUSY");
    reply["connection_steps"] = step.getConnectCode(step.WLAN_GET_CONNECT_STATE) +
                                step.getConnectResult(step.WLAN_GET_CONNECT_STATE, Result::FAILED);
    return pretty(reply);
}

std::string connectSSDP(const requestObj& request) {
    Log::mPrintlog("Start the SSDP connect ...");
    const Json& params = positional(request);
    if (params.empty()) return {};
    // Taking the slot is one atomic step: two simultaneous requests cannot both pass.
    if (!ConnectionState::tryClaimConnectDevice()) return busyConnectionReply();
    const std::string id = paramText(params, 0);
    Log::mPrintlog("SSDP connect to " + id + " ...");
    const std::string result = PcsuiteInterface().ActiveConnect(id);
    ConnectionState::setIsCanConnectDevice(true);
    Log::mPrintlog("SSDP connect to " + id + " end ...");
    return result;
}

std::string allowWindowAnswer(const requestObj& request, bool agree) {
    Log::mPrintlog(agree ? "QtWindow Agree Connect \n" : "QtWindow Refuse Connect \n");
    const Json& params = positional(request);
    if (agree && !params.empty()) ConnectionState::setThisPhoneAutoConnect(paramText(params, 0) == "true");
    ConnectionState::setIsAllowWindow(agree);
    allowWindowAnswers().signal();
    const Json record = {{"type", 1}, {"eventId", "W688|10160"}, {"params", {{"click", 1}}}};
    const std::string buryPointStr = "[" + pretty(record) + "]";
    Log::mPrintlog("[launchService] sendBuryPoint buryPointStr is: " + buryPointStr + " \n");
    if (PcsuiteClient::sendBuryPoint(buryPointStr)) Log::mPrintlog("[launchService] sendBuryPoint success \n");
    return ResponseHandler::response(0, agree ? "Close" : "Refuse");
}

std::string primaryBusyReply() {
    const int error = ConnectionState::getPrimaryConnectDeviceType() == "pad" ? rawValue(ErrorCode::PC_CONN_PAD_BUSY)
                                                                    : rawValue(ErrorCode::PC_CONN_PHONE_BUSY);
    return ResponseHandler::response(error, "PC_STATE_BUSY");
}

// The connection over a pre-connection, with the busy slot held for its whole length. The
// third parameter says whether the PC suite connects on its own ("isAutoConnect" to the
// phone); the type of the device being connected is known to a busy answer as soon as the
// flow has found the device.
std::string connectPreconnected(const Json& params, const std::string& id) {
    const std::string autoConnectType = params.size() >= 3 ? paramText(params, 2) : std::string();
    std::string deviceType = ConnectionState::getPrimaryConnectDeviceType();
    ConnectFlow flow([](const std::string& type) { ConnectionState::setPrimaryConnectDeviceType(type); });
    const std::string result = flow.start(id, deviceType, autoConnectType);
    ReportDevicesV2::instance().notify();
    ConnectionState::setIsCanPrimaryConnectDevice(true);
    return result;
}

std::string preconnectConnect(const requestObj& request) {
    Log::mPrintlog("[INTERACTION][PCSUITE_TO CONNSERVER] preconnect_connect Request ...");
    const Json& params = positional(request);
    if (!ConnectionState::getIsCanPrimaryConnectDevice()) return primaryBusyReply();
    if (params.empty()) return {};
    if (!ConnectionState::tryClaimPrimaryConnectDevice()) return primaryBusyReply();
    const std::string id = paramText(params, 0);
    Log::mPrintlog("preconnect_connect device id " + id);
    const std::string result = connectPreconnected(params, id);
    Log::mPrintlog("[RequestEvent::preconnect_connect] [INTERACTION][CONNSERVER_TO_PCSUITE] Connect " + id +
                     " end, strData is:  " + result);
    return result;
}

std::string preconnectPreconnectConnect(const requestObj& request) {
    Log::mPrintlog("preconnect_preconnect-connect Request ...");
    const Json& params = positional(request);
    if (params.empty()) return {};
    const std::string id = paramText(params, 0);
    StrategyDevicePreconnect::preconnectDeviceByDeviceId(id);
    if (!ConnectionState::tryClaimPrimaryConnectDevice()) return primaryBusyReply();
    const std::string result = connectPreconnected(params, id);
    Log::mPrintlog("[RequestEvent::preconnect_connect] Connect " + id + " end, strData is:  " + result);
    return result;
}

std::string preconnectStartScan(const requestObj&) {
    Log::mPrintlog("preconnect_startScan Request ...");
    EventPublisher::instance().notifySubscribers(ServiceEvent::DeviceListUpdate);
    auto& registry = DeviceWaitForPreConnectManager::instance();
    registry.waitForDevices(Config::current().preconnectScanWait);  // ends as soon as one is there
    Json list = Json::array();
    for (const auto& device : registry.getAllDevices())
        if (device->getIsFarawayDiscovered()) list.push_back(device->getPcsuiteDeviceInfo());
    Json answer = ResponseHandler::responseObject(0, "preconnect_startScan success");
    answer["data"] = list;
    return pretty(answer);
}

std::string preconnectPreconnect(const requestObj& request) {
    Log::mPrintlog("preconnect_preconnect Request ...");
    const Json& params = positional(request);
    if (params.empty()) return {};
    const std::string id = paramString(params, 0);
    DeviceWaitForPreConnectManager::Entry device;
    if (!DeviceWaitForPreConnectManager::instance().lookupDevices(id, device))
        return ResponseHandler::response(rawValue(ErrorCode::NOT_FOUND), "Preconnect_preconnect device not found");
    if (device->getIsConnected()) {
        Log::mPrintlog(
            "[StrategyDevicePreconnect::preconnectDeviceByDeviceId] This device is already preconnect success");
        return ResponseHandler::response(0, "This device is already preconnect");
    }
    return StrategyDevicePreconnect::preconnectDeviceByDeviceId(id)
               ? ResponseHandler::response(0, "Preconnect_preconnect success")
               : ResponseHandler::response(rawValue(ErrorCode::UNKNOWN), "Preconnect_preconnect failed");
}

std::string preconnectDisconnect(const requestObj& request) {
    Log::mPrintlog("preconnect_disconnect Request ...");
    const Json& params = positional(request);
    if (!params.empty()) {
        DeviceWaitForPreConnectManager::Entry device;
        if (DeviceWaitForPreConnectManager::instance().lookupDevices(paramString(params, 0), device) &&
            device->getIsConnected())
            device->setIsDisconnectNow(true);
    }
    return ResponseHandler::response(0, "Preconnect_disconnect success");
}

std::string connectCenterEvent(const requestObj& request, bool create) {
    Log::mPrintlog(create ? "connectCenterEventCreate Request ..." : "connectCenterEventReport Request ...");
    if (!request.params.is_object()) return ResponseHandler::response(rawValue(ErrorCode::UNKNOWN), "Parameter error");
    Json data = request.params;
    data["userId"] = dataInstance().get(&databaseParam::openid);
    int status = 0;
    std::string msg;
    if (!create) {
        ConnectCenterRequest::reportEvent(data, status, msg);
        return ResponseHandler::response(0, "connectCenterEventReport success");
    }
    return ConnectCenterRequest::createEvent(data, status, msg)
               ? ResponseHandler::response(0, "ConnectCenterEventCreate success")
               : ResponseHandler::response(rawValue(ErrorCode::UNKNOWN), "Created failed");
}

void sendClientIdQuery(const std::string& openid) {
    UdpSocketBase::sendToLocalPort(Config::current().pushClientUdpPort,
                                   pretty(Json{{"cmd", "QUERY_CLIENT_ID"}, {"openId", openid}}));
}

std::string accountChange(const requestObj& request) {
    Log::mPrintlog("account change ... \n");
    // The parameters hold the access token: it is logged masked.
    Json shown = request.params;
    if (shown.is_array() && shown.size() > 1) shown[1] = text::paramAddMask(json::text(shown[1]));
    Log::mPrintlog("user info: " + json::compact(shown) + " \n");
    const Json& params = positional(request);
    if (params.size() >= 4) {
        const std::string openid = paramText(params, 0);
        dataInstance().update([&](databaseParam& p) {
            p.openid = openid;
            p.token = paramText(params, 1);
            p.Phone = text::paramAddMask(paramText(params, 2));
            p.storageDir = paramText(params, 3);
            if (!openid.empty()) {
                p.lastOpenId = p.openid;
                p.lastToken = p.token;
            }
        });
        if (!openid.empty()) {
            sendClientIdQuery(openid);
            EventPublisher::instance().notifySubscribers(ServiceEvent::Pcsuite);
            EventPublisher::instance().notifySubscribers(ServiceEvent::DeviceInfoReport);
        } else {
            EventPublisher::instance().notifySubscribers(ServiceEvent::AccountChange);
        }
    } else if (!params.empty()) {
        Log::mPrintlog("account change param error, nothing changed \n");
    }
    return ResponseHandler::response(0, "accountChange request success");
}

std::string historyPhoneChange(const requestObj& request) {
    Log::mPrintlog("historyPhoneChange ... \n");
    Log::mPrintlog("history device info: " + json::compact(request.params) + " \n");
    const Json& params = positional(request);
    if (params.empty()) return ResponseHandler::response(rawValue(ErrorCode::UNKNOWN), "UNKNOWN");
    if (params.size() == 2) {
        const std::string kind = paramText(params, 1);
        if (kind == "phone") dataInstance().set(&databaseParam::historyPhoneId, paramText(params, 0));
        else if (kind == "pad") dataInstance().set(&databaseParam::historyPadId, paramText(params, 0));
    } else {
        Log::mPrintlog("historyPhoneChange param error! \n");
    }
    return ResponseHandler::response(0, "historyPhoneChange request success");
}

std::string withData(int error, const std::string& message, Json data) {
    Json answer = ResponseHandler::responseObject(error, message);
    answer["data"] = std::move(data);
    return pretty(answer);
}

}  // namespace

std::string ResponseHandler::structureQueryAdapterRes() {
    const auto addresses = SystemInfo::getNetworkCorrespondAddress();
    Json ips = Json::array();
    for (const auto& [name, ip] : addresses)
        if (!ip.empty()) ips.push_back(ip);
    const Json data = {
        {"ble", false},
        {"ble_enable", false},
        {"mac", SystemInfo::getMacAddress()},
        {"ssid", SystemInfo::SsidWifiName()},
        {"wiredNet", SystemInfo::MacEthernetNetworkAvailability()},
        {"wiredNet_enable", addresses.count("Ethernet") > 0 && !addresses.at("Ethernet").empty()},
        {"wlan", SystemInfo::MacWifiNetworkAvailability()},
        {"wlan_enable", SystemInfo::SsidWifiCondition()},
        {"vpn", SystemInfo::isVpnOn()},
        {"pc_ip", ips},
        {"ble_model", ""},
        {"ble_version", ""},
        {"wlan_model", ""},
        {"if_same_wlan", -1},
    };
    Log::mPrintlog(json::compact(data));
    return withData(0, "", data);
}

std::string ResponseHandler::querySystemStatus() {
    const Json data = {
        {"firewall", SystemInfo::getFirewallState().value_or(false)},
        {"hotspot_fre", ""},
        {"hotspot_share", ""},
        {"projection_com", ""},
        {"if_support_5g", -1},
        {"wifi_info", Json::object()},
    };
    Log::mPrintlog(json::compact(data));
    return withData(0, "", data);
}

std::string ResponseHandler::create(const requestObj& request) {
    switch (request.event) {
        case RequestEvent::queryAll:
        case RequestEvent::stopSSDPScan:
        case RequestEvent::openWifi:
        case RequestEvent::unknown:
            return {};
        case RequestEvent::queryAdapter:
            Log::mPrintlog("Query adapter info ...");
            return structureQueryAdapterRes();
        case RequestEvent::SSDPQueryAll: {
            Log::mPrintlog("SSDPQueryAll");
            std::string res;
            SsdpDeviceManager::instance().getQueryAll(res);
            return res;
        }
        case RequestEvent::startSSDPScan:
            Log::mPrintlog("startSSDPScan ");
            WlanDetectedDeviceCompare::instance().notifySubscribers();
            return withData(0, "", "");
        case RequestEvent::cancelSSDPConnect:
            SSDPcancel() = true;
            Log::mPrintlog("cancelSSDPConnect end ...");
            return response(0, "");
        case RequestEvent::connectSSDP:
            return connectSSDP(request);
        case RequestEvent::QtAgree:
            return allowWindowAnswer(request, true);
        case RequestEvent::QtRefuse:
            return allowWindowAnswer(request, false);
        case RequestEvent::HeartBeat:
            Log::mPrintlog("http HeartBeat \n");
            return withData(0, "", "Alive");
        case RequestEvent::LaunchSuccess:
            Log::mPrintlog("http LaunchSuccess: launch connectstatus windows success! \n");
            return {};
        case RequestEvent::AlreadyStart:
            Log::mPrintlog("http AlreadyStart: connectstatus windows has already exist! \n");
            return {};
        case RequestEvent::open:
            Log::mPrintlog("Open wifi setting ... \n");
            return SystemInfo::openWlanSetting();
        case RequestEvent::preconnect_enterConnectCenter:
            Log::mPrintlog("preconnect_enterConnectCenter Request ...");
            EventPublisher::instance().notifySubscribers(ServiceEvent::Pcsuite);
            return response(0, "Preconnect_enterConnectCenter success");
        case RequestEvent::preconnect_startScan:
            return preconnectStartScan(request);
        case RequestEvent::preconnect_connect:
            return preconnectConnect(request);
        case RequestEvent::preconnect_preconnect:
            return preconnectPreconnect(request);
        case RequestEvent::preconnect_disconnect:
            return preconnectDisconnect(request);
        case RequestEvent::preconnect_cancel:
            Log::mPrintlog("preconnect_cancel Request ...");
            StateCheck::instance().setPrimaryConnectCancel(true);
            return response(0, "Preconnect_cancel success");
        case RequestEvent::connectCenterEventReport:
            return connectCenterEvent(request, false);
        case RequestEvent::connectCenterEventCreate:
            return connectCenterEvent(request, true);
        case RequestEvent::kpush:
            Log::mPrintlog("kpush Request ...");
            Log::mPrintlog("kpush data is " + RequestBase::maskForLog(json::compact(request.params)));
            return KPushReceiveEventHandler::instance().kpushInfoHandler(request.params);
        case RequestEvent::enable:
            Log::mPrintlog("enable request, open wifi switch ... \n");
            return response(0, SystemInfo::openWifi() ? "enable wifi success" : "enable wifi failed");
        case RequestEvent::accountChange:
            return accountChange(request);
        case RequestEvent::getSystemStatus:
            Log::mPrintlog("getSystemStatus Request ... \n");
            return querySystemStatus();
        case RequestEvent::preconnect_preconnect_connect:
            return preconnectPreconnectConnect(request);
        case RequestEvent::historyPhoneChange:
            return historyPhoneChange(request);
    }
    return {};
}

}  // namespace kesu
