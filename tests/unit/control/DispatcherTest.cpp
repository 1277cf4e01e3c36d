// Every control event's answer and side effects: the PC suite is a stub HTTP server, the
// push client a UDP socket on loopback, the platform a fake.
#include <gtest/gtest.h>

#include <future>

#include "account/DataInstance.h"
#include "connect/AllowWindow.h"
#include "control/HttpService.h"
#include "control/ResponseHandler.h"
#include "core/Utils.h"
#include "discovery/StateCheck.h"
#include "events/EventPublisher.h"
#include "platform/fake/FakePlatform.h"
#include "support/StubPcSuite.h"
#include "support/TestSupport.h"
#include "support/UdpCatcher.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

class EventLog : public IEventSubscriber {
public:
    EventLog() : IEventSubscriber({}) {}
    void notify(const std::string& eventName) override {
        std::lock_guard<std::mutex> l(m_);
        events_.push_back(eventName);
    }
    bool eventNotify(const std::string&) override { return true; }
    std::vector<std::string> events() {
        std::lock_guard<std::mutex> l(m_);
        return events_;
    }

private:
    std::mutex m_;
    std::vector<std::string> events_;
};

class Dispatch : public ::testing::Test {
protected:
    void SetUp() override {
        Utils::resetStateForTest();
        dataInstance().update([](databaseParam& p) { p = databaseParam(); });
        pcsuite.pointPcsuiteHere(env.config());
        env.config().pushClientUdpPort = push.port();
        env.config().preconnectScanWait = 50ms;
        env.config().httpWaitTimeout = 5s;
        EventPublisher::instance().addObserver(events);
    }
    void TearDown() override {
        EventPublisher::instance().clearObservers();
        Utils::resetStateForTest();
    }
    // Sends one request through the whole control path and returns the JSON answer (null
    // for an empty answer), checking the length prefix on the way.
    Json call(const Json& envelope) {
        const std::string answer = HttpService::handleBody(envelope.dump());
        if (answer.empty()) return Json();
        const auto hash = answer.find('#');
        EXPECT_NE(hash, std::string::npos);
        return Json::parse(answer.substr(hash + 1));
    }
    static Json ev(const std::string& name, Json args = Json::array()) {
        return {{"event", name}, {"args", std::move(args)}};
    }
    static Json em(int error, const std::string& message) { return {{"error", error}, {"error_message", message}}; }

    test::HermeticEnv env;
    ScopedFakePlatform fake;
    test::StubPcSuite pcsuite;
    test::UdpCatcher push;
    std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
};

TEST_F(Dispatch, SimpleAnswers) {
    for (const char* empty : {"queryAll", "stopSSDPScan", "openWifi", "unknown", "LaunchSuccess", "AlreadyStart"})
        EXPECT_TRUE(call(ev(empty)).is_null()) << empty;
    EXPECT_EQ(call(ev("HeartBeat")), Json({{"error", 0}, {"error_message", ""}, {"data", "Alive"}}));
    EXPECT_EQ(call(ev("startSSDPScan")), Json({{"error", 0}, {"error_message", ""}, {"data", ""}}));
    EXPECT_EQ(call(ev("SSDPQueryAll")), Json({{"error", 0}, {"error_message", ""}, {"data", Json::array()}}));
    EXPECT_EQ(call(ev("preconnect_enterConnectCenter")), em(0, "Preconnect_enterConnectCenter success"));
    EXPECT_EQ(call(ev("preconnect_disconnect", {"nobody"})), em(0, "Preconnect_disconnect success"));
    EXPECT_EQ(call(ev("preconnect_preconnect", {"nobody"})),
              em(-10002, "Preconnect_preconnect device not found"));
    EXPECT_TRUE(call(ev("preconnect_preconnect")).is_null());
    EXPECT_EQ(call(ev("preconnect_startScan")),
              Json({{"error", 0}, {"error_message", "preconnect_startScan success"}, {"data", Json::array()}}));
    EXPECT_EQ(events->events(), (std::vector<std::string>{"PcsuiteEvent", "DeviceListUpdate"}));

    EXPECT_EQ(call(ev("preconnect_cancel")), em(0, "Preconnect_cancel success"));
    EXPECT_TRUE(StateCheck::instance().checkPrimaryConnectCancel());
}

TEST_F(Dispatch, PlatformBackedAnswers) {
    fake->setOpenNetworkSettingsResult(false);
    EXPECT_EQ(call(ev("open")), em(-1, "open fail"));
    fake->setOpenNetworkSettingsResult(true);
    EXPECT_EQ(call(ev("open")), em(0, "open success"));

    fake->setSwitchWifiOnResult(false, "no radio");
    EXPECT_EQ(call(ev("enable")), em(0, "enable wifi failed"));
    fake->setSwitchWifiOnResult(true);
    EXPECT_EQ(call(ev("enable")), em(0, "enable wifi success"));

    fake->setFirewallGlobalState(std::string("1"));
    Json status = call(ev("getSystemStatus"));
    EXPECT_EQ(status["data"], Json({{"firewall", true}, {"hotspot_fre", ""}, {"hotspot_share", ""},
                                    {"projection_com", ""}, {"if_support_5g", -1}, {"wifi_info", Json::object()}}));
    fake->setFirewallGlobalState(std::nullopt);
    EXPECT_EQ(call(ev("getSystemStatus"))["data"]["firewall"], false);

    fake->setNetworkServices({{"Ethernet", "eth0", "aa:bb:cc:dd:ee:01"}, {"Wi-Fi", "wlan0", "aa:bb:cc:dd:ee:02"}});
    fake->setInterfaceAddresses(std::vector<InterfaceAddress>{{"eth0", "10.77.0.5", "255.255.255.0", true}});
    fake->setWifiSsid("home");
    fake->setWifiPowerOn(true);
    const Json adapter = call(ev("queryAdapter"));
    EXPECT_EQ(adapter["error"], 0);
    const Json& data = adapter["data"];
    EXPECT_EQ(data["mac"], "aabbccddee02");
    EXPECT_EQ(data["ssid"], "home");
    EXPECT_EQ(data["wiredNet"], true);
    EXPECT_EQ(data["wiredNet_enable"], true);
    EXPECT_EQ(data["wlan"], true);
    EXPECT_EQ(data["wlan_enable"], true);
    EXPECT_EQ(data["pc_ip"], Json::array({"10.77.0.5"}));
    EXPECT_EQ(data["if_same_wlan"], -1);
    EXPECT_EQ(data.size(), 14u);
}

TEST_F(Dispatch, AccountChangeSignInAndSignOut) {
    EXPECT_EQ(call(ev("accountChange", {"open-1", "tok-123456789", "13812345678", "/store"})),
              em(0, "accountChange request success"));
    const databaseParam p = dataInstance().get();
    EXPECT_EQ(p.openid, "open-1");
    EXPECT_EQ(p.token, "tok-123456789");
    EXPECT_EQ(p.Phone, "138****678");
    EXPECT_EQ(p.storageDir, "/store");
    EXPECT_EQ(p.lastOpenId, "open-1");
    EXPECT_EQ(p.lastToken, "tok-123456789");
    const auto datagram = push.receive(5s);
    ASSERT_TRUE(datagram);
    EXPECT_EQ(Json::parse(*datagram), Json({{"cmd", "QUERY_CLIENT_ID"}, {"openId", "open-1"}}));
    EXPECT_EQ(events->events(), (std::vector<std::string>{"PcsuiteEvent", "DeviceInfoReport"}));

    // Sign-out: only the account-change event, no datagram; the last account is kept.
    EXPECT_EQ(call(ev("accountChange", {"", "", "", ""})), em(0, "accountChange request success"));
    EXPECT_EQ(dataInstance().get(&databaseParam::openid), "");
    EXPECT_EQ(dataInstance().get(&databaseParam::lastOpenId), "open-1");
    EXPECT_FALSE(push.receive(200ms));
    EXPECT_EQ(events->events().back(), "AccountChangeEvent");

    // Too few parameters or the wrong shape: nothing changes, still a success answer.
    dataInstance().set(&databaseParam::openid, "kept");
    for (const Json& args : {Json::array({"x", "y"}), Json("text"), Json({{"a", 1}}), Json::array()}) {
        EXPECT_EQ(call(ev("accountChange", args)), em(0, "accountChange request success"));
        EXPECT_EQ(dataInstance().get(&databaseParam::openid), "kept") << args;
    }
    EXPECT_EQ(events->events().size(), 3u);
}

TEST_F(Dispatch, TokensAreNotLoggedInClear) {
    call(ev("accountChange", {"open-1", "secret-token-value", "13812345678", "/store"}));
    Utils::closeLog();
    const std::string log = test::readAll(Utils::logFilePath(Utils::now()));
    EXPECT_NE(log.find("user info: "), std::string::npos);
    EXPECT_EQ(log.find("secret-token-value"), std::string::npos) << log;
}

TEST_F(Dispatch, HistoryPhoneChange) {
    EXPECT_EQ(call(ev("historyPhoneChange", {"ble-phone", "phone"})), em(0, "historyPhoneChange request success"));
    EXPECT_EQ(call(ev("historyPhoneChange", {"ble-pad", "pad"})), em(0, "historyPhoneChange request success"));
    EXPECT_EQ(call(ev("historyPhoneChange", {"ble-watch", "watch"})), em(0, "historyPhoneChange request success"));
    EXPECT_EQ(call(ev("historyPhoneChange", {"a", "phone", "extra"})), em(0, "historyPhoneChange request success"));
    EXPECT_EQ(dataInstance().get(&databaseParam::historyPhoneId), "ble-phone");
    EXPECT_EQ(dataInstance().get(&databaseParam::historyPadId), "ble-pad");
    EXPECT_EQ(call(ev("historyPhoneChange")), em(-10000, "UNKNOWN"));
    EXPECT_EQ(call(ev("historyPhoneChange", Json{{"k", "v"}})), em(-10000, "UNKNOWN"));
    EXPECT_EQ(call(ev("historyPhoneChange", Json::array({Json{{"k", "v"}}}))),
              em(0, "historyPhoneChange request success"));
}

TEST_F(Dispatch, AllowWindowAnswersReleaseTheWaiterAndRecordABuryPoint) {
    EXPECT_EQ(call(ev("QtAgree", {"true"})), em(0, "Close"));
    EXPECT_TRUE(hAllowSemaphore().try_acquire_for(1s));
    EXPECT_TRUE(Utils::getIsAllowWindow());
    EXPECT_TRUE(Utils::getThisPhoneAutoConnect());

    EXPECT_EQ(call(ev("QtAgree", {"false"})), em(0, "Close"));
    EXPECT_TRUE(hAllowSemaphore().try_acquire_for(1s));
    EXPECT_FALSE(Utils::getThisPhoneAutoConnect());
    Utils::setThisPhoneAutoConnect(true);
    EXPECT_EQ(call(ev("QtAgree")), em(0, "Close"));  // no parameters: unchanged
    EXPECT_TRUE(hAllowSemaphore().try_acquire_for(1s));
    EXPECT_TRUE(Utils::getThisPhoneAutoConnect());

    EXPECT_EQ(call(ev("QtRefuse")), em(0, "Refuse"));
    EXPECT_TRUE(hAllowSemaphore().try_acquire_for(1s));
    EXPECT_FALSE(Utils::getIsAllowWindow());
    EXPECT_FALSE(hAllowSemaphore().try_acquire());  // exactly one signal per answer

    const auto bury = pcsuite.requestsTo("/buryPoint");
    ASSERT_EQ(bury.size(), 4u);
    EXPECT_NE(bury[0].body.find("W688|10160"), std::string::npos) << bury[0].body;
    EXPECT_NE(bury[0].body.find("\"click\""), std::string::npos);
}

TEST_F(Dispatch, ConnectionRequestsAndBusyAnswers) {
    // No parameters: empty answer, the busy flag untouched.
    EXPECT_TRUE(call(ev("connectSSDP")).is_null());
    EXPECT_TRUE(Utils::getIsCanConnectDevice());
    // An unknown phone.
    const Json unknown = call(ev("connectSSDP", {"no-such-id"}));
    EXPECT_EQ(unknown["error"], -10002);
    EXPECT_EQ(unknown["error_message"], "");
    EXPECT_EQ(unknown["errir_message"], "[ActiveConnect] address_ no-such-id find ssdp device error not find");
    EXPECT_EQ(unknown["connection_steps"], "_WI:0_WF:-1");
    EXPECT_TRUE(Utils::getIsCanConnectDevice());
    // While a connection runs: busy at once.
    Utils::setIsCanConnectDevice(false);
    const Json busy = call(ev("connectSSDP", {"x"}));
    EXPECT_EQ(busy["error"], -10001);
    EXPECT_EQ(busy["error_message"], "STATE_BUSY");
    EXPECT_EQ(busy["connection_steps"], "_WI:-1");
    Utils::setIsCanConnectDevice(true);

    EXPECT_EQ(call(ev("cancelSSDPConnect")), em(0, ""));

    // Pre-connected connections: busy by device type, empty with no parameters.
    Utils::setIsCanPrimaryConnectDevice(false);
    Utils::setPrimaryConnectDeviceType("pad");
    EXPECT_EQ(call(ev("preconnect_connect", {"d"})), em(-10015, "PC_STATE_BUSY"));
    Utils::setPrimaryConnectDeviceType("phone");
    EXPECT_EQ(call(ev("preconnect_connect", {"d"})), em(-10014, "PC_STATE_BUSY"));
    EXPECT_EQ(call(ev("preconnect_preconnect-connect", {"d"})), em(-10014, "PC_STATE_BUSY"));
    Utils::setIsCanPrimaryConnectDevice(true);
    EXPECT_TRUE(call(ev("preconnect_connect")).is_null());
    const Json notFound = call(ev("preconnect_connect", {"d", "x"}));
    EXPECT_EQ(notFound, Json({{"error", -10002}, {"error_message", "Preconnect device not find"}, {"data", ""},
                              {"connection_steps", "_WFD:-1"}}));
    EXPECT_TRUE(Utils::getIsCanPrimaryConnectDevice());
}

TEST_F(Dispatch, ConnectCenterEventsCheckTheirParameters) {
    EXPECT_EQ(call(ev("connectCenterEventReport", {"not", "an", "object"})), em(-10000, "Parameter error"));
    EXPECT_EQ(call(ev("connectCenterEventCreate", "text")), em(-10000, "Parameter error"));
    EXPECT_EQ(call(ev("connectCenterEventReport", {{"eventId", "1"}})), em(0, "connectCenterEventReport success"));
    // No connect center answered: creation failed.
    EXPECT_EQ(call(ev("connectCenterEventCreate", {{"eventId", "1"}})), em(-10000, "Created failed"));
}

}  // namespace
}  // namespace kesu
