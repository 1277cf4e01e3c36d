// Every request the service sends to the PC suite (and the HeartBeat to its own control
// server), against a real stub server: method, path, body and framing, how each answer is
// judged, and what a PC suite that is down or hung gives.
#include <gtest/gtest.h>

#include "core/Text.h"
#include "pcsuite/PcsuiteRequest.h"
#include "unit/pcsuite/StubFixture.h"
#include "core/Endpoints.h"
#include "pcsuite/PcsuiteClient.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
class PcsuiteRequestTest : public test::StubPcsuiteTest {
protected:
    // The one request to `path`; a failure (and an empty request) unless there is exactly one.
    test::RecordedRequest only(const std::string& path) const {
        const auto requests = stub.requestsTo(path);
        EXPECT_EQ(requests.size(), 1u) << path;
        return requests.size() == 1 ? requests[0] : test::RecordedRequest{};
    }
};

// The JSON inside an "N#json" body, after checking that N counts its characters.
Json unframed(const std::string& body) {
    const auto hash = body.find('#');
    EXPECT_NE(hash, std::string::npos) << body;
    if (hash == std::string::npos) return Json();
    const std::string json = body.substr(hash + 1);
    EXPECT_EQ(body.substr(0, hash), std::to_string(text::graphemeCount(json))) << body;
    return Json::parse(json);
}

TEST_F(PcsuiteRequestTest, PcDeviceInfoAndConnectDeviceAcceptOnlyTheTextCode) {
    stub.setAnswer("/pcDeviceInfo", {200, R"({"code":"000000","data":{"deviceId":"PC-1","version":"3.7.0"}})"});
    auto info = PcsuiteRequest::getPcDeviceInfo();
    ASSERT_TRUE(info.has_value());
    EXPECT_EQ(json::str(json::object(*info, "data"), "deviceId"), "PC-1");
    EXPECT_EQ(only("/pcDeviceInfo").method, "POST");

    stub.setAnswer("/connectDevice", {200, R"({"code":"000000"})"});
    const std::map<std::string, std::string> request{
        {"requestSource", "preconnect"}, {"eventId", "12345678"}, {"deviceId", "a1b2"}};
    EXPECT_TRUE(PcsuiteRequest::startConnectPreDevice(request).has_value());
    EXPECT_EQ(Json::parse(only("/connectDevice").body),
              Json::parse(R"({"requestSource":"preconnect","eventId":"12345678","deviceId":"a1b2"})"));

    // Anything but the six-character text is a refusal: the number 0, another code, no code,
    // an answer that is not JSON.
    for (const char* body : {R"({"code":0,"data":{"deviceId":"PC-1"}})", R"({"code":"000001"})",
                                   R"({"code":"0"})", R"({"data":{}})", "000000"}) {
        stub.setAnswer("/pcDeviceInfo", {200, body});
        EXPECT_FALSE(PcsuiteRequest::getPcDeviceInfo().has_value()) << body;
    }
}

TEST_F(PcsuiteRequestTest, BuryPointIsPostedUnframedAndJudgedByItsCode) {
    const std::string record = R"([{"type":1,"eventId":"W688|10308","params":{"net_type":1,"state":0}}])";
    EXPECT_TRUE(PcsuiteClient::sendBuryPoint(record));
    EXPECT_EQ(only("/buryPoint").body, record);
    for (const char* body : {R"({"code":"000001","data":"unknown event"})", R"({"code":0})", ""}) {
        stub.setAnswer("/buryPoint", {200, body});
        EXPECT_FALSE(PcsuiteClient::sendBuryPoint(record)) << body;
    }
}

TEST_F(PcsuiteRequestTest, DeviceConnectableAsksWithTheFramedEventAndReadsTheBusyState) {
    std::string respondType = "before", status = "before";
    stub.setAnswer("/isConnectBusy", {200, R"({"code":"000000","data":{"isConnectBusy":false}})"});
    EXPECT_TRUE(PcsuiteClient::isDeviceConnectable("phone", respondType, status));
    EXPECT_EQ(status, "unconnect");
    EXPECT_EQ(respondType, "");
    const auto request = only("/isConnectBusy");
    EXPECT_EQ(request.target, "/isConnectBusy?deviceType=phone");
    EXPECT_EQ(unframed(request.body), Json::parse(R"({"event":"DeviceConnectable","deviceType":["phone"]})"));
    EXPECT_EQ(request.body.find("{\"event\""), 3u);  // "event" first, as the PC suite reads it

    stub.setAnswer("/isConnectBusy",
                   {200, R"({"code":"000000","data":{"isConnectBusy":true,"connectStatus":"connected","deviceType":"pad"}})"});
    EXPECT_FALSE(PcsuiteClient::isDeviceConnectable("pad", respondType, status));
    EXPECT_EQ(status, "connected");
    EXPECT_EQ(respondType, "pad");
    stub.setAnswer("/isConnectBusy", {200, R"({"code":"000002","data":"no license"})"});
    EXPECT_FALSE(PcsuiteClient::isDeviceConnectable("phone", respondType, status));

    // An empty answer does not hold the connection back.
    stub.setAnswer("/isConnectBusy", {200, ""});
    EXPECT_TRUE(PcsuiteClient::isDeviceConnectable("phone", respondType, status));

    // A device type is a query value, never part of the request line.
    EXPECT_TRUE(PcsuiteClient::isDeviceConnectable("a b&c", respondType, status));
    EXPECT_EQ(stub.requestsTo("/isConnectBusy").back().param("deviceType"), "a b&c");
}

TEST_F(PcsuiteRequestTest, ConnectToPhoneAlreadyReadsTheNumberAfterTheHash) {
    int code = -5;
    stub.setAnswer("/", {200, "1#2", "text/plain"});
    EXPECT_TRUE(PcsuiteClient::isConnectToPhoneAlready(code));
    EXPECT_EQ(code, 2);
    EXPECT_EQ(only("/").body, R"(40#{"event":"checkCurrentPhone","args":[0]})");

    for (const char* body : {"12", "", "1#", "3#abc", "15#{\"code\":1}", "1#99999999999999999999"}) {
        code = -5;
        stub.setAnswer("/", {200, body, "text/plain"});
        EXPECT_FALSE(PcsuiteClient::isConnectToPhoneAlready(code)) << body;
        EXPECT_EQ(code, -5) << body;
    }
}

TEST_F(PcsuiteRequestTest, HttpAliveSendsTheHeartBeatToTheControlServer) {
    test::StubPcSuite control;
    control.pointControlHere(env.config());
    control.setAnswer("/", {200, R"(34#{"code":0,"msg":"","data":"Alive"})", "text/plain"});
    EXPECT_TRUE(PcsuiteClient::isHttpAlive());
    ASSERT_EQ(control.requestCount(), 1u);
    EXPECT_EQ(control.requests()[0].body, R"(32#{"event":"HeartBeat","args":[0]})");
    EXPECT_EQ(stub.requestCount(), 0u);  // nothing went to the PC suite
    control.stop();
    EXPECT_FALSE(PcsuiteClient::isHttpAlive());
}

// A PC suite that is not running, or hangs without answering: nothing waits longer than
// the request's limit, connections are allowed, everything else fails.
TEST_F(PcsuiteRequestTest, PcSuiteDownOrHungGivesTheFailureAnswers) {
    auto checkAll = [](const char* what) {
        std::string respondType = "t", status = "s", response;
        int code = -5;
        EXPECT_TRUE(PcsuiteClient::isDeviceConnectable("phone", respondType, status)) << what;
        EXPECT_EQ(respondType, "t") << what;
        EXPECT_EQ(status, "s") << what;
        EXPECT_FALSE(PcsuiteClient::sendBuryPoint("[{}]")) << what;
        EXPECT_FALSE(PcsuiteClient::isConnectToPhoneAlready(code)) << what;
        EXPECT_EQ(code, -5) << what;
        EXPECT_FALSE(PcsuiteClient::httpMsgSend("{}", Endpoints::pcsuiteHttpServerSSDPQueryAllUrl(), "POST", response)) << what;
        EXPECT_FALSE(PcsuiteRequest::getPcDeviceInfo().has_value()) << what;
        EXPECT_FALSE(PcsuiteRequest::startConnectPreDevice({{"deviceId", "d"}}).has_value()) << what;
        EXPECT_FALSE(RequestBase::urlSessionPost("{}", Endpoints::pcsuiteHttpServerUrl())) << what;
    };

    // Hung: every answer would come (as a success) only after the limits.
    env.config().httpRequestTimeout = 150ms;
    env.config().httpWaitTimeout = 150ms;
    stub.setDefaultAnswer({200, R"({"code":"000000","data":{"isConnectBusy":true}})", "application/json", 60s});
    stub.setAnswer("/", {200, "1#1", "text/plain", 60s});
    checkAll("hung");
    EXPECT_TRUE(stub.waitForRequests(7, 10s));  // they all reached the PC suite

    // Down.
    stub.stop();
    checkAll("down");
}

}  // namespace
}  // namespace kesu
