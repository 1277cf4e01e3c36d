// Every control event's answer and side effects: the PC suite is a stub HTTP server, the
// push client a UDP socket on loopback, the platform a fake.
#include <gtest/gtest.h>

#include "account/DataInstance.h"
#include "connect/AllowWindow.h"
#include "discovery/StateCheck.h"
#include "platform/fake/FakePlatform.h"
#include "support/StubPcSuite.h"
#include "support/UdpCatcher.h"
#include "unit/UnitHelpers.h"
#include "unit/events/EventRecorder.h"
#include "connect/ConnectionState.h"
#include "core/Log.h"
#include "support/TestSupport.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using test::control;
using Events = test::EventRecorder::Events;

class Dispatch : public ::testing::Test {
protected:
    void SetUp() override {
        test::resetSharedStateForTest();
        dataInstance().update([](databaseParam& p) { p = databaseParam(); });
        pcsuite.pointPcsuiteHere(env.config());
        env.config().pushClientUdpPort = push.port();
        env.config().preconnectScanWait = 50ms;
        env.config().httpWaitTimeout = 5s;
        EventPublisher::instance().addObserver(events);
    }
    void TearDown() override {
        EventPublisher::instance().clearObservers();
        test::resetSharedStateForTest();
        Log::closeLog();
    }
    static Json em(int error, const std::string& message) { return {{"error", error}, {"error_message", message}}; }

    test::HermeticEnv env;
    ScopedFakePlatform fake;
    test::StubPcSuite pcsuite;
    test::UdpCatcher push;
    std::shared_ptr<test::EventRecorder> events = std::make_shared<test::EventRecorder>();
};

TEST_F(Dispatch, SimpleAnswers) {
    for (const char* empty : {"queryAll", "stopSSDPScan", "openWifi", "unknown", "LaunchSuccess", "AlreadyStart", "noSuchEvent"})
        EXPECT_EQ(HttpService::handleBody(Json({{"event", empty}}).dump()), "") << empty;
    EXPECT_EQ(HttpService::handleBody(""), "");
    EXPECT_EQ(control("HeartBeat"), Json({{"error", 0}, {"error_message", ""}, {"data", "Alive"}}));
    EXPECT_EQ(control("startSSDPScan"), Json({{"error", 0}, {"error_message", ""}, {"data", ""}}));
    EXPECT_EQ(control("SSDPQueryAll"), Json({{"error", 0}, {"error_message", ""}, {"data", Json::array()}}));
    EXPECT_EQ(control("preconnect_enterConnectCenter"), em(0, "Preconnect_enterConnectCenter success"));
    EXPECT_EQ(control("preconnect_preconnect", {"nobody"}), em(-10002, "Preconnect_preconnect device not found"));
    EXPECT_TRUE(control("preconnect_preconnect").is_null());
    EXPECT_EQ(control("preconnect_startScan"),
              Json({{"error", 0}, {"error_message", "preconnect_startScan success"}, {"data", Json::array()}}));
    EXPECT_EQ(events->events(), (Events{"PcsuiteEvent", "DeviceListUpdate"}));
    EXPECT_EQ(control("preconnect_cancel"), em(0, "Preconnect_cancel success"));
    EXPECT_TRUE(StateCheck::instance().checkPrimaryConnectCancel());
}

TEST_F(Dispatch, PlatformBackedAnswers) {
    fake->setOpenNetworkSettingsResult(false);
    EXPECT_EQ(control("open"), em(-1, "open fail"));
    fake->setSwitchWifiOnResult(false, "no radio");
    EXPECT_EQ(control("enable"), em(0, "enable wifi failed"));

    fake->setFirewallGlobalState(std::string("1"));
    EXPECT_EQ(control("getSystemStatus")["data"],
              Json({{"firewall", true}, {"hotspot_fre", ""}, {"hotspot_share", ""},
                    {"projection_com", ""}, {"if_support_5g", -1}, {"wifi_info", Json::object()}}));
    fake->setFirewallGlobalState(std::nullopt);
    EXPECT_EQ(control("getSystemStatus")["data"]["firewall"], false);

    fake->setNetworkServices({{"Ethernet", "eth0", "aa:bb:cc:dd:ee:01"}, {"Wi-Fi", "wlan0", "aa:bb:cc:dd:ee:02"}});
    fake->setInterfaceAddresses(std::vector<InterfaceAddress>{{"eth0", "10.77.0.5", "255.255.255.0", true}});
    fake->setWifiPowerOn(true);
    const Json data = control("queryAdapter")["data"];
    EXPECT_EQ(data["mac"], "aabbccddee02");
    EXPECT_EQ(data["wiredNet"], true);
    EXPECT_EQ(data["pc_ip"], Json::array({"10.77.0.5"}));
}

TEST_F(Dispatch, AccountChangeSignInAndSignOut) {
    EXPECT_EQ(control("accountChange", {"open-1", "secret-token-value", "13812345678", "/store"}),
              em(0, "accountChange request success"));
    const databaseParam p = dataInstance().get();
    EXPECT_EQ(p.openid, "open-1");
    EXPECT_EQ(p.token, "secret-token-value");
    EXPECT_EQ(p.Phone, "138****678");
    EXPECT_EQ(p.storageDir, "/store");
    EXPECT_EQ(p.lastToken, "secret-token-value");
    const auto datagram = push.receive(5s);
    ASSERT_TRUE(datagram);
    EXPECT_EQ(Json::parse(*datagram), Json({{"cmd", "QUERY_CLIENT_ID"}, {"openId", "open-1"}}));
    EXPECT_EQ(events->events(), (Events{"PcsuiteEvent", "DeviceInfoReport"}));
    Log::closeLog();
    EXPECT_TRUE(test::logged("user info: "));
    EXPECT_EQ(test::todaysLog().find("secret-token-value"), std::string::npos);

    // Sign-out: only the account-change event, no datagram; the last account is kept.
    EXPECT_EQ(control("accountChange", {"", "", "", ""}), em(0, "accountChange request success"));
    EXPECT_EQ(dataInstance().get(&databaseParam::openid), "");
    EXPECT_EQ(dataInstance().get(&databaseParam::lastOpenId), "open-1");
    EXPECT_FALSE(push.receive(200ms));
    EXPECT_EQ(events->events().back(), "AccountChangeEvent");

    // Too few parameters or the wrong shape: nothing changes, still a success answer.
    dataInstance().set(&databaseParam::openid, "kept");
    for (const Json& args : {Json::array({"x", "y"}), Json("text"), Json({{"a", 1}}), Json::array()}) {
        EXPECT_EQ(control("accountChange", args), em(0, "accountChange request success"));
        EXPECT_EQ(dataInstance().get(&databaseParam::openid), "kept") << args;
    }
    EXPECT_EQ(events->events().size(), 3u);

    // The history devices: phone and pad kept apart, other kinds and bad shapes ignored.
    EXPECT_EQ(control("historyPhoneChange", {"ble-phone", "phone"}), em(0, "historyPhoneChange request success"));
    control("historyPhoneChange", {"ble-pad", "pad"});
    control("historyPhoneChange", {"ble-watch", "watch"});
    EXPECT_EQ(dataInstance().get(&databaseParam::historyPhoneId), "ble-phone");
    EXPECT_EQ(dataInstance().get(&databaseParam::historyPadId), "ble-pad");
    EXPECT_EQ(control("historyPhoneChange"), em(-10000, "UNKNOWN"));
    EXPECT_EQ(control("historyPhoneChange", Json{{"k", "v"}}), em(-10000, "UNKNOWN"));
}

TEST_F(Dispatch, AllowWindowAnswersReleaseTheWaiterOnceEach) {
    EXPECT_EQ(control("QtAgree", {"true"}), em(0, "Close"));
    EXPECT_TRUE(allowWindowAnswers().take());
    EXPECT_TRUE(ConnectionState::getIsAllowWindow());
    EXPECT_TRUE(ConnectionState::getThisPhoneAutoConnect());
    EXPECT_EQ(control("QtAgree", {"false"}), em(0, "Close"));
    EXPECT_TRUE(allowWindowAnswers().take());
    EXPECT_FALSE(ConnectionState::getThisPhoneAutoConnect());
    ConnectionState::setThisPhoneAutoConnect(true);
    EXPECT_EQ(control("QtAgree"), em(0, "Close"));  // no parameters: unchanged
    EXPECT_TRUE(allowWindowAnswers().take());
    EXPECT_TRUE(ConnectionState::getThisPhoneAutoConnect());
    EXPECT_EQ(control("QtRefuse"), em(0, "Refuse"));
    EXPECT_TRUE(allowWindowAnswers().take());
    EXPECT_FALSE(ConnectionState::getIsAllowWindow());
    EXPECT_FALSE(allowWindowAnswers().take());  // exactly one signal per answer

    const auto bury = pcsuite.requestsTo("/buryPoint");
    ASSERT_EQ(bury.size(), 4u);
    EXPECT_NE(bury[0].body.find("W688|10160"), std::string::npos) << bury[0].body;
}

TEST_F(Dispatch, ConnectionRequestsAndBusyAnswers) {
    EXPECT_EQ(control("connectSSDP", {"no-such-id"})["error"], -10002);
    EXPECT_TRUE(ConnectionState::getIsCanConnectDevice());  // the slot is given back (busy: ActiveConnectTest)

    // Pre-connected connections: busy by device type, empty with no parameters.
    ConnectionState::setIsCanPrimaryConnectDevice(false);
    ConnectionState::setPrimaryConnectDeviceType("pad");
    EXPECT_EQ(control("preconnect_connect", {"d"}), em(-10015, "PC_STATE_BUSY"));
    ConnectionState::setPrimaryConnectDeviceType("phone");
    EXPECT_EQ(control("preconnect_preconnect-connect", {"d"}), em(-10014, "PC_STATE_BUSY"));
    ConnectionState::setIsCanPrimaryConnectDevice(true);
    EXPECT_TRUE(control("preconnect_connect").is_null());
    EXPECT_EQ(control("preconnect_connect", {"d", "x"}),
              Json({{"error", -10002}, {"error_message", "Preconnect device not find"}, {"data", ""},
                    {"connection_steps", "_WFD:-1"}}));
    EXPECT_TRUE(ConnectionState::getIsCanPrimaryConnectDevice());

    EXPECT_EQ(control("connectCenterEventReport", {"not", "an", "object"}), em(-10000, "Parameter error"));
    EXPECT_EQ(control("connectCenterEventCreate", "text"), em(-10000, "Parameter error"));
    EXPECT_EQ(control("connectCenterEventReport", {{"eventId", "1"}}), em(0, "connectCenterEventReport success"));
    // No connect center answered: creation failed.
    EXPECT_EQ(control("connectCenterEventCreate", {{"eventId", "1"}}), em(-10000, "Created failed"));
}

}  // namespace
}  // namespace kesu
