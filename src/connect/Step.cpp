#include "connect/Step.h"

#include "connect/StepsConfig.h"
#include "core/Log.h"

namespace kesu {

namespace {

// A JSON value as it reads in a steps string: strings without their quotes.
std::string valueText(const nlohmann::json& value) {
    if (value.is_string()) return value.get<std::string>();
    return value.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

std::string stringMember(const nlohmann::json& object, const char* key) {
    if (!object.is_object()) return {};
    auto it = object.find(key);
    if (it == object.end() || !it->is_string()) return {};
    return it->get<std::string>();
}

}  // namespace

Step::Step() { init(stepsConfig, os4StepsConfig); }

Step::Step(std::string_view stepsJson, std::string_view os4StepsJson) { init(stepsJson, os4StepsJson); }

void Step::init(std::string_view stepsJson, std::string_view os4StepsJson) {
    if (configParser(stepsJson, os4StepsJson)) {
        setIsParserConfigSucc(true);
    } else {
        Log::mPrintlog("[Step::init]: stepsConfig.json file content parser failed! Init step failed ...\r\n");
    }
}

bool Step::configParser(std::string_view stepsJson, std::string_view os4StepsJson) {
    if (stepsJson.empty()) {
        Log::mPrintlog(
            "[Step::configParser]: stepsConfig.json file content is nil or read stepsConfig.json file failed!\r\n");
        return false;
    }
    // A text that does not parse leaves every field of its catalogue empty.
    const auto steps = nlohmann::json::parse(stepsJson, nullptr, false);
    const auto os4Steps = nlohmann::json::parse(os4StepsJson, nullptr, false);

    stepParser(BLE_GET_CONNECT_STATE, "BLE_GET_CONNECT_STATE", steps);
    stepParser(BLE_FIND_DEVICES, "BLE_FIND_DEVICES", steps);
    stepParser(BLE_CONNECT_BLUETOOTH_ADDRESS, "BLE_CONNECT_BLUETOOTH_ADDRESS", steps);
    stepParser(BLE_GET_GATTSERVICE, "BLE_GET_GATTSERVICE", steps);
    stepParser(BLE_GET_CHARACTERISTICS, "BLE_GET_CHARACTERISTICS", steps);
    stepParser(BLE_GET_WIFI_DIRECTMAC, "BLE_GET_WIFI_DIRECTMAC", steps);
    stepParser(BLE_CREATE_AP, "BLE_CREATE_AP", steps);
    stepParser(BLE_SEND_AP_INFO, "BLE_SEND_AP_INFO", steps);
    stepParser(BLE_RECV_RESPONSE, "BLE_RECV_RESPONSE", steps);
    stepParser(BLE_RECV_PHONE_IP, "BLE_RECV_PHONE_IP", steps);
    stepParser(WLAN_GET_CONNECT_STATE, "WLAN_GET_CONNECT_STATE", steps);
    stepParser(WLAN_FIND_DEVICES, "WLAN_FIND_DEVICES", steps);
    stepParser(WLAN_CONNECT_SERVER, "WLAN_CONNECT_SERVER", steps);
    stepParser(WLAN_RECV_RESPONSE, "WLAN_RECV_RESPONSE", steps);

    stepParser(OS4_WLAN_PING_ADDRESS, "WLAN_PING_ADDRESS", os4Steps);
    stepParser(OS4_WLAN_CONNECT_ADDRESS, "WLAN_CONNECT_ADDRESS", os4Steps);
    stepParser(OS4_WLAN_SEND_DEVICE_INFO, "WLAN_SEND_DEVICE_INFO", os4Steps);
    stepParser(OS4_WLAN_RECV_DEVICE_INFO, "WLAN_RECV_DEVICE_INFO", os4Steps);
    stepParser(OS4_WLAN_PARSER_DEVICE_INFO, "WLAN_PARSER_DEVICE_INFO", os4Steps);
    stepParser(OS4_WLAN_FIND_DEVICES, "WLAN_FIND_DEVICES", os4Steps);
    stepParser(OS4_WLAN_SEND_REQUEST, "WLAN_SEND_REQUEST", os4Steps);
    stepParser(OS4_WLAN_RECV_RESPONSE, "WLAN_RECV_RESPONSE", os4Steps);
    stepParser(OS4_WLAN_PARSER_RESPONSE, "WLAN_PARSER_RESPONSE", os4Steps);
    return true;
}

void Step::stepParser(StepStruct& step, const std::string& stepName, const nlohmann::json& stepJson) {
    nlohmann::json entry;
    if (stepJson.is_object()) {
        if (auto it = stepJson.find(stepName); it != stepJson.end()) entry = *it;
    }
    step.code = stringMember(entry, "code");
    step.descriptor = stringMember(entry, "descriptor");
    step.name = stringMember(entry, "name");
    step.result = nlohmann::json::object();
    if (entry.is_object()) {
        if (auto it = entry.find("result"); it != entry.end()) step.result = *it;
    }
}

std::string Step::getConnectCode(const StepStruct& stepStruct) const {
    if (!m_bIsParserConfigSucc) return {};
    return "_" + stepStruct.code;
}

std::string Step::getConnectResult(const StepStruct& stepStruct, const std::string& result) const {
    if (!m_bIsParserConfigSucc || !stepStruct.result.is_object()) return {};
    auto it = stepStruct.result.find(result);
    if (it == stepStruct.result.end() || !it->is_array() || it->empty()) return {};
    return ":" + valueText((*it)[0]);
}

std::string Step::getConnectResult(const StepStruct& stepStruct, Result result) const {
    return getConnectResult(stepStruct, rawValue(result));
}

std::string Step::getConnectCodeV2(const StepStruct& stepStruct) const {
    if (!m_bIsParserConfigSucc) return {};
    return stepStruct.code;
}

const Step& sharedStep() {
    static const Step* step = new Step();
    return *step;
}

}  // namespace kesu
