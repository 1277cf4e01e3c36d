// The bodies of a connection handshake with a phone: the request the PC sends, the PC's
// answers to a phone's own request, how a phone's answer is classified, how a phone's request
// is read, and the busy answer a phone gets while another connection is handled.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/ConnectCodes.h"
#include "core/ISocketBase.h"
#include "core/Json.h"

namespace kesu {

// The fixed "id" of the PC's connection messages.
inline constexpr int kConnectMessageId = 87654321;

// The PC's connection request: "bytes" [0], this computer's (masked) name and MAC address,
// the signed-in account's open id and (masked) phone number, the PC suite's service id,
// "channel" 0, "id" 87654321 and the integer "type" 1.
Json connectRequestBody();

// The PC's answer to a phone's request: the request's members with `tag` as "bytes", the
// given service id and "type" as the string "1".
Json connectAnswerBody(ConnectTag tag, serviceId id);

// The text of a phone's answer frame: its body as UTF-8, or nullopt when it is not UTF-8.
std::optional<std::string> phoneAnswerText(const Bytes& frame);

// A phone's answer, by the literal "bytes" substrings, in this order: [1] PHONEAGREE, [2]
// PHONEREJECT, [11] BUSY; anything else is TIMEOUT (no answer).
ConnectTag classifyPhoneAnswer(std::string_view text);

// A phone's connection request, as read from the body of its frame.
struct PhoneConnectRequest {
    std::string deviceId;    // hex of the first 4 characters of "target_id"
    std::string account;     // masked
    std::string port;        // "port" of "extra_info", "" when none
    std::string deviceType;  // "pad" when "extra_info" says deviceType 1, else "phone"
    std::string serviceId;   // "service_id" as sent
    std::string deviceName;
    std::string openId;

    // nullopt unless the body is a JSON object whose "bytes" is exactly [0].
    static std::optional<PhoneConnectRequest> parse(std::string_view body);
};

// The busy answer for a phone of `requestType` while a device of `connectingType` is being
// connected: BUSY for the same type, DIFFDEVICEBUSY for the other.
ConnectTag busyAnswerFor(const std::string& connectingType, const std::string& requestType);

// "1" when the phone's open id is the signed-in account's (both non-empty), else "0".
std::string sameAccountFlag(const std::string& phoneOpenId, const std::string& accountOpenId);

// A list of texts for a log line: ["a", "b"].
std::string describeList(const std::vector<std::string>& items);

}  // namespace kesu
