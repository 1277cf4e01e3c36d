#include "connect/ConnectMessage.h"

#include "account/DataInstance.h"
#include "connect/PhoneFrame.h"
#include "core/Text.h"
#include "core/Text.h"
#include "platform/SystemInfo.h"
#include "discovery/SsdpMessage.h"

namespace kesu {

namespace {

// The members the request and the answers share.
Json pcIdentity() {
    const databaseParam account = dataInstance().get();
    return Json{{"deviceName", SystemInfo::getLocalName()},
                {"channel", 0},
                {"id", kConnectMessageId},
                {"open_Id", account.openid},
                {"target_id", SystemInfo::getMacAddress()},
                {"account", account.Phone}};
}

}  // namespace

Json connectRequestBody() {
    Json body = pcIdentity();
    body["bytes"] = Json::array({rawValue(ConnectTag::CONNECT)});
    body["service_id"] = rawValue(serviceId::pcsuiteId);
    body["type"] = 1;
    return body;
}

Json connectAnswerBody(ConnectTag tag, serviceId id) {
    Json body = pcIdentity();
    body["bytes"] = Json::array({rawValue(tag)});
    body["service_id"] = rawValue(id);
    body["type"] = "1";
    return body;
}

std::optional<std::string> phoneAnswerText(const Bytes& frame) {
    std::string body = phoneFrameBody(frame);
    if (!text::isValidUtf8(body)) return std::nullopt;
    return body;
}

ConnectTag classifyPhoneAnswer(std::string_view text) {
    if (text::contains(text, "\"bytes\":[1]")) return ConnectTag::PHONEAGREE;
    if (text::contains(text, "\"bytes\":[2]")) return ConnectTag::PHONEREJECT;
    if (text::contains(text, "\"bytes\":[11]")) return ConnectTag::BUSY;
    return ConnectTag::TIMEOUT;
}

std::optional<PhoneConnectRequest> PhoneConnectRequest::parse(std::string_view body) {
    const auto message = json::parse(body);
    if (!message || !message->is_object()) return std::nullopt;
    const Json bytes = json::array(*message, "bytes");
    if (bytes.size() != 1 || !bytes[0].is_number_integer() || bytes[0].get<long long>() != 0) return std::nullopt;

    PhoneConnectRequest request;
    request.deviceId = SsdpMessage::deviceIdentifier(json::str(*message, "target_id"));
    request.account = text::paramAddMask(json::str(*message, "account"));
    request.serviceId = json::str(*message, "service_id");
    request.deviceName = json::str(*message, "deviceName");
    request.openId = json::str(*message, "open_Id");
    request.deviceType = "phone";

    // "extra_info" is a JSON text inside the message.
    const std::string extraText = json::str(*message, "extra_info");
    if (!extraText.empty()) {
        const Json extra = json::parse(extraText).value_or(Json());
        if (extra.is_object()) {
            const auto port = extra.find("port");
            if (port != extra.end() && port->is_string()) request.port = port->get<std::string>();
            else if (port != extra.end() && port->is_number_integer()) request.port = std::to_string(port->get<long long>());
            if (json::integer(extra, "deviceType") == 1) request.deviceType = "pad";
        }
    }
    return request;
}

ConnectTag busyAnswerFor(const std::string& connectingType, const std::string& requestType) {
    return connectingType == requestType ? ConnectTag::BUSY : ConnectTag::DIFFDEVICEBUSY;
}

std::string sameAccountFlag(const std::string& phoneOpenId, const std::string& accountOpenId) {
    return !phoneOpenId.empty() && phoneOpenId == accountOpenId ? "1" : "0";
}

std::string describeList(const std::vector<std::string>& items) {
    std::string out = "[";
    for (std::size_t i = 0; i < items.size(); ++i) {
        if (i > 0) out += ", ";
        out += json::compact(Json(items[i]));
    }
    return out + "]";
}

}  // namespace kesu
