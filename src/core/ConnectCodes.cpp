#include "core/ConnectCodes.h"

#include <array>
#include <utility>

namespace kesu {

namespace {

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

}  // namespace kesu
