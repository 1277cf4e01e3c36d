// The steps catalogue (every entry's code and result numbers), the steps strings built from
// it, and the raw values of the connection vocabularies.
#include "connect/Step.h"

#include <gtest/gtest.h>

#include <sstream>
#include <thread>
#include <vector>

#include "connect/ConnectCodes.h"
#include "connect/StepsConfig.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

// Entry key, code, then result name:number pairs; the wire data the PC suite decodes.
const char* const kSteps[] = {
    "BLE_GET_CONNECT_STATE CI OK:0 FAILED:-1",
    "BLE_FIND_DEVICES NF OK:0 FAILED:-1 CANCEL:-90 BLE_ERROR:-91",
    "BLE_CONNECT_BLUETOOTH_ADDRESS BC OK:0 FAILED:-1 CANCEL:-90 BLE_ERROR:-91",
    "BLE_GET_GATTSERVICE GS OK:0 STATE_ERROR:-1 CANCEL:-90 BLE_ERROR:-91",
    "BLE_GET_CHARACTERISTICS GC OK:0 RECEIVER_EXTRACHARACTERISTICS_ERROR:-1 CONFIGURATIONDESCRIPTOR_ERROR:-2 "
    "REQUEST_CHARACTERISTICS_ERROR:-3 CANCEL:-90 BLE_ERROR:-91",
    "BLE_GET_WIFI_DIRECTMAC AA OK:0 MACISEMPTY:-1",
    "BLE_CREATE_AP AP OK:0 FAILED:-1",
    "BLE_SEND_AP_INFO PC OK:0 FAILED:-1 CANCEL:-90 BLE_ERROR:-91",
    "BLE_RECV_RESPONSE TO OK:0 TIMEOUT:-1 BUSY:-2 REJECT:-3 CANCEL:-90 BLE_ERROR:-91",
    "BLE_RECV_PHONE_IP NI OK:0 FAILED:-1 PHONECANCEL:-2 CANCEL:-90 BLE_ERROR:-91",
    "WLAN_GET_CONNECT_STATE WI OK:0 FAILED:-1",
    "WLAN_FIND_DEVICES WF OK:0 FAILED:-1 CANCEL:-90",
    "WLAN_CONNECT_SERVER TF OK:0 FAILED:-1",
    "WLAN_RECV_RESPONSE WO OK:0 TIMEOUT:-1 BUSY:-2 REJECT:-3 CANCEL:-90",
};

// As above; a trailing "+" marks a result that carries the further code "-1".
const char* const kOs4Steps[] = {
    "BT_CONNECT_BLUETOOTH_ADDRESS BCB OK:0 FAILED:-1",
    "BT_SEND_DEVICE_INFO BSD OK:0 FAILED:-1",
    "BT_RECV_DEVICE_INFO BRD OK:0 FAILED:-1",
    "BT_PARSER_DEVICE_INFO BPD OK:0 FAILED:-1",
    "WLAN_PING_ADDRESS WPI OK:0 FAILED:-1",
    "WLAN_TELNET_ADDRESS WTN OK:0 FAILED:-1",
    "WLAN_CONNECT_ADDRESS WCA OK:0 FAILED:-1",
    "WLAN_SEND_DEVICE_INFO WSD OK:0 FAILED:-1",
    "WLAN_RECV_DEVICE_INFO WRD OK:0 FAILED:-1",
    "WLAN_PARSER_DEVICE_INFO WPD OK:0 FAILED:-1",
    "BT_FIND_DEVICES BFD OK:0 FAILED:-1 CANCEL:-90+ PRECONNECT_ERROR:-10",
    "BT_CREATE_WIFIP2P BCW OK:0 FAILED:-1 CANCEL:-90+ OPEN_AP:-21+ OPEN_WIFI_ERROR:-20",
    "BT_SEND_WIFIP2P_INFO BSW OK:0 FAILED:-1 CANCEL:-90+",
    "BT_RECV_RESPONSE BRR OK:0 FAILED:-1 CANCEL:-90+",
    "BT_PARSER_RESPONSE BPR OK:0 FAILED:-1 CANCEL:-90+ BUSY:-2+ REJECT:-3+",
    "BT_GET_WIFIP2P_IP BGW OK:0 FAILED:-1 CANCEL:-90+",
    "WLAN_FIND_DEVICES WFD OK:0 FAILED:-1 CANCEL:-90+ PRECONNECT_ERROR:-10",
    "WLAN_SEND_REQUEST WSR OK:0 FAILED:-1 CANCEL:-90+",
    "WLAN_RECV_RESPONSE WRR OK:0 FAILED:-1 CANCEL:-90+",
    "WLAN_PARSER_RESPONSE WPR OK:0 FAILED:-1 CANCEL:-90+ BUSY:-2+ REJECT:-3+",
};

template <std::size_t N>
void expectCatalogue(std::string_view text, const char* const (&expected)[N]) {
    const auto catalogue = nlohmann::json::parse(text);
    ASSERT_EQ(catalogue.size(), N);
    for (const char* line : expected) {
        std::istringstream in(line);
        std::string key, code, result;
        in >> key >> code;
        SCOPED_TRACE(key);
        ASSERT_TRUE(catalogue.contains(key));
        const auto& entry = catalogue[key];
        EXPECT_EQ(entry["code"], code);
        EXPECT_FALSE(entry["descriptor"].get<std::string>().empty());
        EXPECT_EQ(entry["name"], entry["descriptor"]);
        std::size_t results = 0;
        while (in >> result) {
            ++results;
            const bool further = result.back() == '+';
            if (further) result.pop_back();
            const auto colon = result.find(':');
            const auto& values = entry["result"][result.substr(0, colon)];
            ASSERT_TRUE(values.is_array()) << result;
            EXPECT_EQ(values[0], result.substr(colon + 1)) << result;
            EXPECT_TRUE(values[1].is_string()) << result;
            EXPECT_EQ(values.size(), further ? 3u : 2u) << result;
            if (further) {
                EXPECT_EQ(values[2], "-1") << result;
            }
        }
        EXPECT_EQ(entry["result"].size(), results);
    }
}

TEST(StepCatalogue, BuiltInCataloguesCarryEveryCodeAndResult) {
    expectCatalogue(stepsConfig, kSteps);
    expectCatalogue(os4StepsConfig, kOs4Steps);
}

TEST(StepCatalogue, StepsStringsOfConnections) {
    test::HermeticEnv env;
    const Step& s = sharedStep();
    ASSERT_TRUE(s.getIsParserConfigSucc());

    // A PC-initiated connection that succeeds, one the phone refuses, one cancelled early.
    std::string ok = s.getConnectCode(s.WLAN_GET_CONNECT_STATE) + s.getConnectResult(s.WLAN_GET_CONNECT_STATE, Result::OK);
    ok += s.getConnectCode(s.WLAN_FIND_DEVICES) + s.getConnectResult(s.WLAN_FIND_DEVICES, Result::OK);
    ok += s.getConnectCode(s.WLAN_CONNECT_SERVER) + s.getConnectResult(s.WLAN_CONNECT_SERVER, "OK");
    std::string rejected = ok, busy = ok;
    ok += s.getConnectCode(s.WLAN_RECV_RESPONSE) + s.getConnectResult(s.WLAN_RECV_RESPONSE, Result::OK);
    EXPECT_EQ(ok, "_WI:0_WF:0_TF:0_WO:0");
    rejected += s.getConnectCode(s.WLAN_RECV_RESPONSE) + s.getConnectResult(s.WLAN_RECV_RESPONSE, Result::REJECT);
    EXPECT_EQ(rejected, "_WI:0_WF:0_TF:0_WO:-3");
    busy += s.getConnectCode(s.WLAN_RECV_RESPONSE) + s.getConnectResult(s.WLAN_RECV_RESPONSE, Result::BUSY);
    EXPECT_EQ(busy, "_WI:0_WF:0_TF:0_WO:-2");
    EXPECT_EQ(s.getConnectCode(s.WLAN_FIND_DEVICES) + s.getConnectResult(s.WLAN_FIND_DEVICES, Result::CANCEL),
              "_WF:-90");

    // The pre-connection steps come from the second catalogue, keys without "OS4_".
    EXPECT_EQ(s.getConnectCode(s.OS4_WLAN_FIND_DEVICES), "_WFD");
    EXPECT_EQ(s.getConnectResult(s.OS4_WLAN_FIND_DEVICES, "PRECONNECT_ERROR"), ":-10");
    EXPECT_EQ(s.getConnectCodeV2(s.OS4_WLAN_SEND_REQUEST), "WSR");
    EXPECT_EQ(s.getConnectCode(s.OS4_WLAN_PING_ADDRESS) + s.getConnectResult(s.OS4_WLAN_PING_ADDRESS, Result::FAILED),
              "_WPI:-1");
    EXPECT_EQ(s.getConnectResult(s.OS4_WLAN_PARSER_RESPONSE, Result::REJECT), ":-3");
    const std::vector<const StepStruct*> all = {
        &s.BLE_GET_CONNECT_STATE, &s.BLE_FIND_DEVICES, &s.BLE_CONNECT_BLUETOOTH_ADDRESS, &s.BLE_GET_GATTSERVICE,
        &s.BLE_GET_CHARACTERISTICS, &s.BLE_GET_WIFI_DIRECTMAC, &s.BLE_CREATE_AP, &s.BLE_SEND_AP_INFO,
        &s.BLE_RECV_RESPONSE, &s.BLE_RECV_PHONE_IP, &s.WLAN_GET_CONNECT_STATE, &s.WLAN_FIND_DEVICES,
        &s.WLAN_CONNECT_SERVER, &s.WLAN_RECV_RESPONSE, &s.OS4_WLAN_PING_ADDRESS, &s.OS4_WLAN_CONNECT_ADDRESS,
        &s.OS4_WLAN_SEND_DEVICE_INFO, &s.OS4_WLAN_RECV_DEVICE_INFO, &s.OS4_WLAN_PARSER_DEVICE_INFO,
        &s.OS4_WLAN_FIND_DEVICES, &s.OS4_WLAN_SEND_REQUEST, &s.OS4_WLAN_RECV_RESPONSE, &s.OS4_WLAN_PARSER_RESPONSE};
    for (const StepStruct* step : all) {
        EXPECT_FALSE(step->code.empty());
        EXPECT_EQ(s.getConnectResult(*step, Result::OK), ":0") << step->code;
    }
    // A result the step does not have adds nothing rather than a malformed ":".
    EXPECT_EQ(s.getConnectResult(s.WLAN_CONNECT_SERVER, Result::BUSY), "");

    // One catalogue for the whole process, also when first asked from several threads.
    std::vector<const Step*> seen(4);
    std::vector<std::thread> threads;
    for (auto& p : seen) threads.emplace_back([&p] { p = &sharedStep(); });
    for (auto& t : threads) t.join();
    for (const Step* p : seen) EXPECT_EQ(p, &s);
}

TEST(StepCatalogue, MissingOrBrokenCatalogue) {
    test::HermeticEnv env;
    const Step missing("", os4StepsConfig);
    EXPECT_FALSE(missing.getIsParserConfigSucc());
    EXPECT_EQ(missing.getConnectCode(missing.WLAN_FIND_DEVICES), "");
    EXPECT_EQ(missing.getConnectResult(missing.WLAN_FIND_DEVICES, Result::OK), "");
    EXPECT_EQ(missing.getConnectCodeV2(missing.OS4_WLAN_SEND_REQUEST), "");

    // Text that does not parse leaves its fields empty but counts as parsed.
    const Step broken("{\"WLAN_FIND_DEVICES\":", os4StepsConfig);
    EXPECT_TRUE(broken.getIsParserConfigSucc());
    EXPECT_EQ(broken.getConnectCode(broken.WLAN_FIND_DEVICES), "_");
    EXPECT_EQ(broken.getConnectResult(broken.WLAN_FIND_DEVICES, Result::OK), "");
    EXPECT_EQ(broken.getConnectCode(broken.OS4_WLAN_FIND_DEVICES), "_WFD");

    // A numeric first element is printed as a number too.
    const Step numeric(R"({"WLAN_CONNECT_SERVER":{"code":"TF","result":{"OK":[0,"x"]}}})", "");
    EXPECT_EQ(numeric.getConnectResult(numeric.WLAN_CONNECT_SERVER, Result::OK), ":0");
}

TEST(ConnectCodes, RawValues) {
    // Every assigned value has a case that maps back to it; the gaps have none.
    for (int raw = -10016; raw <= -9999; ++raw) {
        const bool assigned = raw >= -10015 && raw <= -10000 && raw != -10011 && raw != -10012;
        const auto code = parseErrorCode(raw);
        EXPECT_EQ(code.has_value(), assigned) << raw;
        if (code) {
            EXPECT_EQ(rawValue(*code), raw);
        }
    }
    EXPECT_EQ(rawValue(ErrorCode::STATE_BUSY), -10001);
    EXPECT_EQ(rawValue(ErrorCode::NOT_FOUND), -10002);
    EXPECT_EQ(rawValue(ErrorCode::REJECT), -10004);
    EXPECT_EQ(rawValue(ErrorCode::CANCEL), -10005);
    EXPECT_EQ(rawValue(ErrorCode::TIMEOUT), -10007);
    EXPECT_EQ(rawValue(ErrorCode::PC_CONN_PAD_BUSY), -10015);

    for (int raw = -2; raw <= 30; ++raw) {
        const bool assigned = raw == -1 || (raw >= 0 && raw <= 4) || raw == 11 || raw == 12 || (raw >= 22 && raw <= 27);
        const auto tag = parseConnectTag(raw);
        EXPECT_EQ(tag.has_value(), assigned) << raw;
        if (tag) {
            EXPECT_EQ(rawValue(*tag), raw);
        }
    }
    EXPECT_EQ(rawValue(ConnectTag::PHONEAGREE), 1);
    EXPECT_EQ(rawValue(ConnectTag::BUSY), 11);
    EXPECT_EQ(rawValue(ConnectTag::DIFFDEVICEBUSY), 12);
    EXPECT_EQ(rawValue(ConnectTag::DEVICEINFOREQUEST), 22);
    EXPECT_EQ(rawValue(ConnectTag::MOBILECONNECTPCRESULT), 27);
    EXPECT_EQ(rawValue(ConnectTag::TIMEOUT), -1);

    EXPECT_EQ(parseAppSource(1), AppSource::pcsuite);
    EXPECT_EQ(parseAppSource(2), AppSource::kesuShare);
    EXPECT_EQ(parseAppSource(3), std::nullopt);
    EXPECT_EQ(rawValue(serviceId::pcsuiteId), "com.kesu.pcsuite.SERVICE");
    EXPECT_EQ(parseServiceId("com.kesu.share.CONNECT_PC"), serviceId::shareId);
    EXPECT_EQ(parseServiceId("com.kesu.pcsuite"), std::nullopt);

    // Result names are the keys of the catalogue's result objects.
    const char* const results[] = {"OK", "FAILED", "CANCEL", "BLE_ERROR", "STATE_ERROR",
                                   "RECEIVER_EXTRACHARACTERISTICS_ERROR", "CONFIGURATIONDESCRIPTOR_ERROR",
                                   "REQUEST_CHARACTERISTICS_ERROR", "MACISEMPTY", "TIMEOUT", "BUSY", "REJECT",
                                   "PHONECANCEL"};
    for (const char* name : results) {
        const auto r = parseResult(name);
        ASSERT_TRUE(r.has_value()) << name;
        EXPECT_EQ(rawValue(*r), name);
    }
    EXPECT_EQ(parseResult("ok"), std::nullopt);
}

}  // namespace
}  // namespace kesu
