#include "core/ConnectCodes.h"

#include <array>
#include <utility>

namespace kesu {

namespace {

constexpr std::array kErrorCodes = {
    ErrorCode::UNKNOWN,         ErrorCode::STATE_BUSY,       ErrorCode::NOT_FOUND,
    ErrorCode::BLE_COMM,       ErrorCode::REJECT,           ErrorCode::CANCEL,
    ErrorCode::CREATE_GO_FAILED, ErrorCode::TIMEOUT,        ErrorCode::IS_CANCELING,
    ErrorCode::API_NOT_FOUND,  ErrorCode::CREATE_AP_FAIL,   ErrorCode::PC_CANCELING,
    ErrorCode::PC_CONN_PHONE_BUSY, ErrorCode::PC_CONN_PAD_BUSY,
};

constexpr std::array kConnectTags = {
    ConnectTag::CONNECT,
    ConnectTag::PHONEAGREE,
    ConnectTag::PHONEREJECT,
    ConnectTag::AGREE,
    ConnectTag::REJECT,
    ConnectTag::BUSY,
    ConnectTag::DIFFDEVICEBUSY,
    ConnectTag::DEVICEINFOREQUEST,
    ConnectTag::DEVICEINFORESPONSE,
    ConnectTag::MOBILECONNECTPCREQUEST,
    ConnectTag::MOBILECONNECTPCRESPONSE,
    ConnectTag::PARSERMOBILEMSGFAILED,
    ConnectTag::MOBILECONNECTPCRESULT,
    ConnectTag::TIMEOUT,
};

constexpr std::array<std::pair<Result, std::string_view>, 13> kResults = {{
    {Result::OK, "OK"},
    {Result::FAILED, "FAILED"},
    {Result::CANCEL, "CANCEL"},
    {Result::BLE_ERROR, "BLE_ERROR"},
    {Result::STATE_ERROR, "STATE_ERROR"},
    {Result::RECEIVER_EXTRACHARACTERISTICS_ERROR, "RECEIVER_EXTRACHARACTERISTICS_ERROR"},
    {Result::CONFIGURATIONDESCRIPTOR_ERROR, "CONFIGURATIONDESCRIPTOR_ERROR"},
    {Result::REQUEST_CHARACTERISTICS_ERROR, "REQUEST_CHARACTERISTICS_ERROR"},
    {Result::MACISEMPTY, "MACISEMPTY"},
    {Result::TIMEOUT, "TIMEOUT"},
    {Result::BUSY, "BUSY"},
    {Result::REJECT, "REJECT"},
    {Result::PHONECANCEL, "PHONECANCEL"},
}};

constexpr std::array<std::pair<serviceId, std::string_view>, 2> kServiceIds = {{
    {serviceId::pcsuiteId, "com.kesu.pcsuite.SERVICE"},
    {serviceId::shareId, "com.kesu.share.CONNECT_PC"},
}};

template <class Enum, std::size_t N>
std::optional<Enum> findIntCase(const std::array<Enum, N>& cases, int raw) {
    for (Enum e : cases) {
        if (static_cast<int>(e) == raw) return e;
    }
    return std::nullopt;
}

}  // namespace

int rawValue(ErrorCode code) { return static_cast<int>(code); }
int rawValue(ConnectTag tag) { return static_cast<int>(tag); }
int rawValue(AppSource source) { return static_cast<int>(source); }

std::string rawValue(Result result) {
    for (const auto& [r, name] : kResults) {
        if (r == result) return std::string(name);
    }
    return {};
}

std::string rawValue(serviceId id) {
    for (const auto& [s, name] : kServiceIds) {
        if (s == id) return std::string(name);
    }
    return {};
}

std::optional<ErrorCode> parseErrorCode(int raw) { return findIntCase(kErrorCodes, raw); }
std::optional<ConnectTag> parseConnectTag(int raw) { return findIntCase(kConnectTags, raw); }

std::optional<Result> parseResult(std::string_view raw) {
    for (const auto& [r, name] : kResults) {
        if (name == raw) return r;
    }
    return std::nullopt;
}

std::optional<AppSource> parseAppSource(int raw) {
    if (raw == 1) return AppSource::pcsuite;
    if (raw == 2) return AppSource::kesuShare;
    return std::nullopt;
}

std::optional<serviceId> parseServiceId(std::string_view raw) {
    for (const auto& [s, name] : kServiceIds) {
        if (name == raw) return s;
    }
    return std::nullopt;
}

}  // namespace kesu
