// The connection steps catalogue: one StepStruct per step a connection can go through, and
// the texts ("_WF", ":-90", ...) that make up the "connection_steps" string of a reply.
#pragma once

#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

#include "core/ConnectCodes.h"

namespace kesu {

struct StepStruct {
    std::string code;        // short step code, e.g. "WF"
    std::string descriptor;  // human-readable description
    std::string name;
    // result name -> [numeric result as text, description(, further code)]
    nlohmann::json result = nlohmann::json::object();
};

class Step {
public:
    // Built from the two built-in catalogues.
    Step();
    // Built from the given catalogue texts (an empty `stepsJson` counts as missing).
    Step(std::string_view stepsJson, std::string_view os4StepsJson);

    // "_" + code; "" when the catalogue was not parsed.
    std::string getConnectCode(const StepStruct& stepStruct) const;
    // ":" + the numeric result stored under `result`; "" when the catalogue was not parsed
    // or the step has no such result.
    std::string getConnectResult(const StepStruct& stepStruct, const std::string& result) const;
    std::string getConnectResult(const StepStruct& stepStruct, Result result) const;
    // The bare code; "" when the catalogue was not parsed.
    std::string getConnectCodeV2(const StepStruct& stepStruct) const;

    bool getIsParserConfigSucc() const { return m_bIsParserConfigSucc; }
    void setIsParserConfigSucc(bool bIsParserConfigSucc) { m_bIsParserConfigSucc = bIsParserConfigSucc; }

    bool m_bIsParserConfigSucc = false;
    std::string stepStr;

    StepStruct BLE_GET_CONNECT_STATE;
    StepStruct BLE_FIND_DEVICES;
    StepStruct BLE_CONNECT_BLUETOOTH_ADDRESS;
    StepStruct BLE_GET_GATTSERVICE;
    StepStruct BLE_GET_CHARACTERISTICS;
    StepStruct BLE_GET_WIFI_DIRECTMAC;
    StepStruct BLE_CREATE_AP;
    StepStruct BLE_SEND_AP_INFO;
    StepStruct BLE_RECV_RESPONSE;
    StepStruct BLE_RECV_PHONE_IP;
    StepStruct WLAN_GET_CONNECT_STATE;
    StepStruct WLAN_FIND_DEVICES;
    StepStruct WLAN_CONNECT_SERVER;
    StepStruct WLAN_RECV_RESPONSE;

    StepStruct OS4_WLAN_PING_ADDRESS;
    StepStruct OS4_WLAN_CONNECT_ADDRESS;
    StepStruct OS4_WLAN_SEND_DEVICE_INFO;
    StepStruct OS4_WLAN_RECV_DEVICE_INFO;
    StepStruct OS4_WLAN_PARSER_DEVICE_INFO;
    StepStruct OS4_WLAN_FIND_DEVICES;
    StepStruct OS4_WLAN_SEND_REQUEST;
    StepStruct OS4_WLAN_RECV_RESPONSE;
    StepStruct OS4_WLAN_PARSER_RESPONSE;

private:
    void init(std::string_view stepsJson, std::string_view os4StepsJson);
    bool configParser(std::string_view stepsJson, std::string_view os4StepsJson);
    static void stepParser(StepStruct& step, const std::string& stepName, const nlohmann::json& stepJson);
};

// The process-wide catalogue, built from the built-in texts on first use.
const Step& sharedStep();

}  // namespace kesu
