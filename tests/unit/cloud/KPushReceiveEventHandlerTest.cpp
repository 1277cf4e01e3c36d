// Push messages relayed by the PC suite, through the dispatcher, against a stub connect center
// and PC suite on loopback and a real bus subscriber: the client id, the notices for the bus,
// a phone's connect request (an unknown phone's pre-connect, or a connection by the PC suite)
// and what goes back to the center, and messages of the wrong shape.
#include "cloud/KPushReceiveEventHandler.h"
#include "preconnect/FarawayDevice.h"
#include "unit/cloud/CloudFixture.h"
#include "unit/events/EventRecorder.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

const Json kSuccess = {{"error", 0}, {"error_message", "kpush success"}};

Json message(const std::string& cmd, const Json& exdata) { return {{"data", {{"cmd", cmd}, {"exdata", exdata}}}}; }

// A phone-connect notice of `eventId` for the phone of `businessId`.
Json phoneConnect(const std::string& eventId, const std::string& businessId, const std::string& connectType) {
    return message("MQTT_SUBSCRIBE_MSG_ARRIVED",
                   {{"type", 4}, {"eventId", eventId}, {"ext", {{"businessId", businessId}, {"connectType", connectType}}}});
}

Json report(const std::string& eventId, int status, int retCode, const std::string& retMsg,
            const std::string& userId = "open-1") {
    return {{"userId", userId}, {"ext", {{"eventId", eventId}}}, {"eventId", eventId},
            {"status", status}, {"retCode", retCode},             {"retMsg", retMsg}};
}

class KPushTest : public test::CloudAccountTest {
protected:
    void SetUp() override {
        CloudAccountTest::SetUp();
        env.config().httpRequestTimeout = 5s;
        center.setDefaultAnswer({200, R"({"code":0})"});
        EventPublisher::instance().clearObservers();
        EventPublisher::instance().addObserver(events);
    }
    void TearDown() override {
        EventPublisher::instance().clearObservers();
        CloudAccountTest::TearDown();
    }

    static Json push(const Json& params) { return test::control("kpush", params); }
    // The bodies the center received as event reports, in order.
    std::vector<Json> reports() const {
        std::vector<Json> out;
        for (const auto& request : center.requestsTo("/event/report")) out.push_back(Json::parse(request.body));
        return out;
    }

    std::shared_ptr<test::EventRecorder> events = std::make_shared<test::EventRecorder>();
};

TEST_F(KPushTest, ClientIdComesFromBothCommands) {
    EXPECT_EQ(push(message("QUERY_CLIENT_ID", {{"clientId", "abc"}})), kSuccess);
    EXPECT_EQ(dataInstance().get(&databaseParam::clientId), "abc");
    EXPECT_TRUE(test::logged("[KPushReceiveEventHandler][kpushInfoHandler] clientId: abc"));
    EXPECT_EQ(push(message("MQTT_CONNECT_SERVER_SUCCESS", {{"clientId", "def"}})), kSuccess);
    EXPECT_EQ(dataInstance().get(&databaseParam::clientId), "def");

    // No "exdata" object: nothing to take. An id that is missing or not text: the channel has none.
    EXPECT_EQ(push(message("QUERY_CLIENT_ID", Json::array({"x"}))), kSuccess);
    EXPECT_EQ(dataInstance().get(&databaseParam::clientId), "def");
    EXPECT_EQ(push(message("QUERY_CLIENT_ID", {{"clientId", 7}})), kSuccess);
    EXPECT_EQ(dataInstance().get(&databaseParam::clientId), "");
}

TEST_F(KPushTest, ListAndReportNoticesReachTheBusOtherTypesAreOnlyLogged) {
    EXPECT_EQ(push(message("MQTT_SUBSCRIBE_MSG_ARRIVED", {{"type", 1}})), kSuccess);
    EXPECT_EQ(push(message("MQTT_SUBSCRIBE_MSG_ARRIVED", {{"type", 3}})), kSuccess);
    EXPECT_EQ(push(message("MQTT_SUBSCRIBE_MSG_ARRIVED", {{"type", 2}})), kSuccess);
    EXPECT_EQ(push(message("SOMETHING_ELSE", {{"type", 1}})), kSuccess);
    EXPECT_EQ(events->events(), (test::EventRecorder::Events{"DeviceListUpdate", "DeviceInfoReport"}));
    EXPECT_TRUE(test::logged("[KPushReceiveEventHandler][kpushInfoHandler] MQTT_SUBSCRIBE_MSG_ARRIVED eventType: 3"));
    EXPECT_EQ(center.requestCount(), 0u);
}

TEST_F(KPushTest, PreConnectOfAnUnknownPhoneReportsFailure) {
    EXPECT_EQ(push(phoneConnect("ev-1", "ZZZZ9", "PreConnect")), kSuccess);
    EXPECT_EQ(reports(), std::vector<Json>{report("ev-1", 2, 20000, "Preconnect failed")});
    EXPECT_TRUE(pcsuite.requestsTo("/connectDevice").empty());

    // A center that refuses the report: logged, not retried.
    center.setAnswer("/event/report", {200, R"({"code":60700,"msg":"no such event"})"});
    push(phoneConnect("ev-2", "ZZZZ", "PreConnect"));
    EXPECT_EQ(reports().size(), 2u);
    EXPECT_TRUE(test::logged("[KPushReceiveEventHandler][passivePreConnect] Connect center event report failed \n"));
}

TEST_F(KPushTest, UserConnectionIsAskedOfThePcSuiteAndItsOutcomeReported) {
    pcsuite.setAnswer("/connectDevice", {200, R"({"code":"000000","data":{"code":0,"reason":"ok"}})"});
    EXPECT_EQ(push(phoneConnect("ev-3", "ABCDEF", "UserConnect")), kSuccess);
    const auto asked = pcsuite.requestsTo("/connectDevice");
    ASSERT_EQ(asked.size(), 1u);
    EXPECT_EQ(Json::parse(asked[0].body),
              Json({{"requestSource", "kpush"}, {"eventId", "ev-3"}, {"deviceId", deviceKeyOf("ABCD")}}));
    EXPECT_EQ(reports().back(), report("ev-3", 1, 0, "ok"));

    // The PC suite's refusal keeps its code and reason; no PC suite reports the unknown failure.
    pcsuite.setAnswer("/connectDevice", {200, R"({"code":"000000","data":{"code":3,"reason":"busy"}})"});
    push(phoneConnect("ev-4", "ABCD", "UserConnect"));
    EXPECT_EQ(reports().back(), report("ev-4", 2, 3, "busy"));
    env.config().pcsuitePort = test::freeTcpPort();
    push(phoneConnect("ev-6", "ABCD", "UserConnect"));
    EXPECT_EQ(reports().back(), report("ev-6", 2, 20000, "UNKNOWN"));
    EXPECT_TRUE(test::logged("[KPushReceiveEventHandler][passivePreConnect] connect device failed \n"));
}

TEST_F(KPushTest, MalformedMessagesAreTakenAsAbsentAndAnsweredCleanly) {
    const Json nil = {{"error", -10000}, {"error_message", "kpush data nil"}};
    // The dispatcher hands over objects, arrays and texts; the handler may see anything.
    EXPECT_EQ(push(Json("text")), nil);
    EXPECT_EQ(push(Json::array({1})), nil);
    EXPECT_EQ(Json::parse(KPushReceiveEventHandler::instance().kpushInfoHandler(Json())), nil);

    const std::vector<Json> ignored = {
        Json::object(),
        {{"data", "MQTT_SUBSCRIBE_MSG_ARRIVED"}},
        message("MQTT_SUBSCRIBE_MSG_ARRIVED", Json::array({Json{{"type", 1}}})),
        message("MQTT_SUBSCRIBE_MSG_ARRIVED", {{"type", "1"}}),
        message("MQTT_SUBSCRIBE_MSG_ARRIVED", {{"type", 1.0}}),
        message("MQTT_SUBSCRIBE_MSG_ARRIVED", {{"type", 18446744073709551615ull}}),
    };
    for (const Json& params : ignored) EXPECT_EQ(push(params), kSuccess) << params;
    EXPECT_TRUE(events->events().empty());
    EXPECT_TRUE(test::logged("[KPushReceiveEventHandler][kpushInfoHandler] \"type\" is not an integer \n"));

    // A phone-connect notice that names no phone asks nobody and reports a failure; a token in
    // it does not reach the log.
    const std::vector<Json> nameless = {
        {{"type", 4}, {"eventId", "ev-7"}},
        {{"type", 4}, {"eventId", "ev-7"}, {"ext", {{"businessId", 1234}, {"connectType", "PreConnect"}}}},
        {{"type", 4}, {"eventId", "ev-7"}, {"ext", {{"accessToken", test::kToken}, {"connectType", 5}}}},
    };
    for (const Json& exdata : nameless)
        EXPECT_EQ(push(message("MQTT_SUBSCRIBE_MSG_ARRIVED", exdata)), kSuccess) << exdata;
    EXPECT_TRUE(pcsuite.requestsTo("/connectDevice").empty());
    const auto sent = reports();
    ASSERT_EQ(sent.size(), nameless.size());
    EXPECT_EQ(sent[1], report("ev-7", 2, 20000, "Preconnect failed"));
    EXPECT_EQ(sent[2], report("ev-7", 2, 20000, "UNKNOWN"));
    EXPECT_TRUE(test::logged("[KPushReceiveEventHandler][passivePreConnect] \"businessId\" is not a string \n"));
}

}  // namespace
}  // namespace kesu
