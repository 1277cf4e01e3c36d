#include "pcsuite/PcsuiteClient.h"

#include <cctype>
#include <charconv>
#include <cstdint>
#include <vector>

#include "core/Config.h"
#include "core/Json.h"
#include "core/Text.h"
#include "core/Endpoints.h"
#include "core/Log.h"
#include "pcsuite/PcsuiteRequest.h"
#include "pcsuite/RequestBase.h"

namespace kesu {

namespace {

using Ordered = nlohmann::ordered_json;

// One POST that waits for the answer at most the client's default time-out. The body goes
// as the client's default form type, as the PC suite has always received it.
RequestBase::Answer waitForAnswer(const std::string& url, const std::string& body,
                                  std::chrono::milliseconds timeout,
                                  const std::string& method = rawValue(MethodType::post)) {
    return RequestBase::exchange(url, method, body, {{"Content-Type", rawValue(ContentType::form)}}, timeout);
}

std::string answerText(const RequestBase::Answer& answer) {
    return text::asciiToString(std::vector<std::uint8_t>(answer.body.begin(), answer.body.end()));
}

// An event request framed "N#json" ("" when it cannot be framed).
std::string framedEvent(const Ordered& event) {
    std::string framed;
    PcsuiteClient::RebuildEventData(event.dump(-1, ' ', false, Ordered::error_handler_t::replace), framed);
    return framed;
}

// Query-parameter encoding: unreserved characters stay, everything else becomes %XX.
std::string queryEncoded(const std::string& value) {
    static const char* digits = "0123456789ABCDEF";
    std::string out;
    for (unsigned char c : value) {
        if (std::isalnum(c) || c == '-' || c == '_' || c == '.' || c == '~') {
            out.push_back(static_cast<char>(c));
        } else {
            out.push_back('%');
            out.push_back(digits[c >> 4]);
            out.push_back(digits[c & 0x0F]);
        }
    }
    return out;
}

// A whole text as a decimal integer ("+" or "-" allowed, blanks around it ignored).
std::optional<int> strictInteger(const std::string& raw) {
    std::string s = text::trim(raw);
    if (!s.empty() && s.front() == '+') {
        s.erase(0, 1);
        if (s.empty() || !std::isdigit(static_cast<unsigned char>(s.front()))) return std::nullopt;
    }
    int value = 0;
    const auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), value);
    if (ec != std::errc() || end != s.data() + s.size()) return std::nullopt;
    return value;
}

bool isSuccessCode(const Json& answer) { return json::str(answer, "code") == rawValue(PcsuiteResCode::Success); }

}  // namespace

bool PcsuiteClient::RebuildEventData(const std::string& str, std::string& finalStr) {
    if (str.empty()) return false;
    finalStr = text::lengthPrefixed(str);
    return true;
}

bool PcsuiteClient::sendBuryPoint(const std::string& data) {
    const RequestBase::Answer answer =
        waitForAnswer(Endpoints::pcsuiteHttpServerUrl() + "buryPoint", data, Config::current().httpWaitTimeout);
    if (!answer.responded) {
        Log::mPrintlog("[sendBuryPoint] http client respond data is empty! \n");
        return false;
    }
    Log::mPrintlog("[sendBuryPoint] http client have respond data! \n");
    const std::string text = answerText(answer);
    if (text.empty()) return false;
    const Json reply = json::parse(text).value_or(Json());
    if (isSuccessCode(reply)) return true;
    Log::mPrintlog("[sendBuryPoint] bury point error message: " + json::text(reply.is_object() ? reply.value("data", Json())
                                                                                          : Json()) +
              " \n");
    return false;
}

bool PcsuiteClient::isDeviceConnectable(const std::string& deviceType, std::string& respondDeviceType,
                                std::string& connectStatus) {
    Ordered event = Ordered::object();
    event["event"] = "DeviceConnectable";
    event["deviceType"] = Ordered::array({deviceType});
    const RequestBase::Answer answer = waitForAnswer(Endpoints::pcsuiteHttpIsConnectBusyUrl() + queryEncoded(deviceType),
                                                     framedEvent(event), Config::current().httpWaitTimeout);
    if (!answer.responded) {
        // A PC suite that is not there does not hold a connection back.
        Log::mPrintlog("[isDeviceConnectable] http client respond data is empty! \n");
        return true;
    }
    Log::mPrintlog("[isDeviceConnectable] http client have respond data! \n");
    const std::string text = answerText(answer);
    if (text.empty()) return true;
    const Json reply = json::parse(text).value_or(Json());
    if (isSuccessCode(reply)) {
        const Json data = json::object(reply, "data");
        if (!json::boolean(data, "isConnectBusy")) {
            connectStatus = "unconnect";
            respondDeviceType.clear();
            return true;
        }
        Log::mPrintlog("[isDeviceConnectable] current pc is connect busy! \n");
        connectStatus = json::str(data, "connectStatus");
        respondDeviceType = json::str(data, "deviceType");
        return false;
    }
    Log::mPrintlog("[isDeviceConnectable] pc have reject to connect as " +
              json::text(reply.is_object() ? reply.value("data", Json()) : Json()) + " \n");
    return false;
}

bool PcsuiteClient::isConnectToPhoneAlready(int& responseCode) {
    Ordered event = Ordered::object();
    event["event"] = "checkCurrentPhone";
    event["args"] = Ordered::array({0});
    const RequestBase::Answer answer =
        waitForAnswer(Endpoints::pcsuiteHttpServerUrl(), framedEvent(event), Config::current().httpWaitTimeout);
    if (!answer.responded) {
        Log::mPrintlog("[isConnectToPhoneAlready] http client respond data is empty! \n");
        return false;
    }
    Log::mPrintlog("[isConnectToPhoneAlready] http client have respond data! \n");
    const std::string text = answerText(answer);
    const auto hash = text.find('#');
    if (text.empty() || hash == std::string::npos) return false;
    const auto code = strictInteger(text.substr(hash + 1));
    if (!code) return false;
    responseCode = *code;
    return true;
}

bool PcsuiteClient::isHttpAlive() {
    Ordered event = Ordered::object();
    event["event"] = "HeartBeat";
    event["args"] = Ordered::array({0});
    const RequestBase::Answer answer =
        waitForAnswer(Endpoints::kesuConnHttpServerUrl(), framedEvent(event), Config::current().httpAliveTimeout);
    if (answer.responded) {
        Log::mPrintlog("[isHttpAlive] http client have respond data, http service is alive! \n");
        return true;
    }
    Log::mPrintlog("[isHttpAlive] http client respond data is empty, http control service is stopped! \n");
    return false;
}

bool PcsuiteClient::httpMsgSend(const std::string& data, const std::string& url, const std::string& method,
                        std::string& /*response*/) {
    Log::mPrintlog("[Utils::httpMsgSend] Send http request url: " + url + ", body: " + RequestBase::maskForLog(data) +
              "\n");
    const RequestBase::Answer answer = waitForAnswer(url, data, Config::current().httpWaitTimeout, method);
    if (answer.responded) return true;
    Log::mPrintlog("[Utils::httpMsgSend] httpMsgSend but no response return\n");
    return false;
}

}  // namespace kesu
