// The steps catalogue behind the "connection_steps" strings (the PC-initiated ones are checked
// end to end in ActiveConnectTest), and the parsing of the connection vocabularies.
#include "connect/Step.h"

#include <gtest/gtest.h>

#include <thread>
#include <vector>

#include "connect/ConnectCodes.h"
#include "connect/StepsConfig.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

TEST(StepCatalogue, EveryStepHasACodeAndTheSharedCatalogueIsBuiltOnce) {
    test::HermeticEnv env;
    const Step& s = sharedStep();
    ASSERT_TRUE(s.getIsParserConfigSucc());
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
    // The pre-connection steps come from the second catalogue, keys without "OS4_".
    EXPECT_EQ(s.getConnectCode(s.OS4_WLAN_FIND_DEVICES) + s.getConnectResult(s.OS4_WLAN_FIND_DEVICES, "PRECONNECT_ERROR"),
              "_WFD:-10");
    EXPECT_EQ(s.getConnectCodeV2(s.OS4_WLAN_SEND_REQUEST), "WSR");
    // A result the step does not have adds nothing rather than a malformed ":".
    EXPECT_EQ(s.getConnectResult(s.WLAN_CONNECT_SERVER, Result::BUSY), "");

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

TEST(ConnectCodes, ParsingMapsBackAndRefusesUnknownValues) {
    for (int raw = -10020; raw <= -9995; ++raw) {
        if (const auto code = parseErrorCode(raw)) {
            EXPECT_EQ(rawValue(*code), raw);
        }
    }
    for (int raw = -5; raw <= 40; ++raw) {
        if (const auto tag = parseConnectTag(raw)) {
            EXPECT_EQ(rawValue(*tag), raw);
        }
    }
    EXPECT_EQ(parseErrorCode(-10011), std::nullopt);
    EXPECT_EQ(parseConnectTag(13), std::nullopt);
    EXPECT_EQ(parseAppSource(3), std::nullopt);
    EXPECT_EQ(parseServiceId("com.kesu.share.CONNECT_PC"), serviceId::shareId);
    EXPECT_EQ(parseServiceId("com.kesu.pcsuite"), std::nullopt);
    EXPECT_EQ(parseResult("REJECT"), Result::REJECT);
    EXPECT_EQ(parseResult("ok"), std::nullopt);
}

}  // namespace
}  // namespace kesu
