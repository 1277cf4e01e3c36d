#include "pcsuite/PcsuiteRequest.h"

#include "core/Endpoints.h"
#include "core/Log.h"

namespace kesu {

std::string rawValue(PCSUITE_HTTP_PATH path) {
    switch (path) {
        case PCSUITE_HTTP_PATH::GET_PC_DEVICE_INFO: return "pcDeviceInfo";
        case PCSUITE_HTTP_PATH::START_CONNECT_PRE_DEVICE: return "connectDevice";
    }
    return {};
}

std::string rawValue(PcsuiteResCode) { return "000000"; }

std::optional<Json> PcsuiteRequest::requestIntercept(const std::string& path, const std::optional<Json>& body,
                                                     MethodType method,
                                                     const std::optional<RequestBase::Headers>& header) {
    std::optional<std::string> bodyText;
    if (body) bodyText = json::compact(*body);
    int status = 0;
    std::string msg;
    const Json answer = RequestBase::http(Endpoints::pcsuiteHttpServerUrl(), path, bodyText, method,
                                          header.value_or(RequestBase::Headers{}), status, msg);
    return responseIntercept(answer, path);
}

std::optional<Json> PcsuiteRequest::responseIntercept(const Json& answer, const std::string& path) {
    const std::string answerText = RequestBase::maskForLog(json::compact(answer));
    // Only the six-character text counts: a numeric 0 is some other server's idea of success.
    if (answer.is_object() && !answer.empty() && answer.contains("code") && answer["code"].is_string() &&
        answer["code"].get<std::string>() == rawValue(PcsuiteResCode::Success)) {
        Log::mPrintlog("[PcsuiteRequest][responseIntercept] [INTERACTION][PCSUITE_TO_CONNSERVER] path: " + path +
                         ", response: " + answerText + " \n");
        return answer;
    }
    Log::mPrintlog("[PcsuiteRequest][responseIntercept] path: " + path + " request err: " + answerText + " \n");
    return std::nullopt;
}

std::optional<Json> PcsuiteRequest::getPcDeviceInfo() {
    return requestIntercept(rawValue(PCSUITE_HTTP_PATH::GET_PC_DEVICE_INFO));
}

std::optional<Json> PcsuiteRequest::startConnectPreDevice(const std::map<std::string, std::string>& data) {
    Json body = Json::object();
    for (const auto& [key, value] : data) body[key] = value;
    return requestIntercept(rawValue(PCSUITE_HTTP_PATH::START_CONNECT_PRE_DEVICE), body);
}

std::optional<ConnectDeviceOutcome> PcsuiteRequest::connectDeviceOutcome(const Json& answer) {
    const Json data = json::object(answer, "data");
    const auto code = json::exactInteger(data, "code");
    const auto reason = data.find("reason");
    if (!code || reason == data.end() || !reason->is_string()) return std::nullopt;
    return ConnectDeviceOutcome{*code, reason->get<std::string>()};
}

}  // namespace kesu
