// The connect-center client against a real stub center on loopback: the signed requests of
// each operation, the cases where nothing may go out, the replies that do not count, a center
// that is down, slow or throttling, and the account's tokens kept out of the log.
#include <cstdlib>

#include "cloud/ConnectCenterRequest.h"
#include "unit/cloud/CloudFixture.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using test::CannedAnswer;
using test::kLastToken;
using test::kToken;

class ConnectCenterRequestTest : public test::CloudAccountTest {
protected:
    void SetUp() override {
        CloudAccountTest::SetUp();
        env.config().httpRequestTimeout = 2s;
        env.config().http429Pause = 20ms;
    }
    int status = -1;
    std::string msg = "caller";
};

TEST_F(ConnectCenterRequestTest, SendsSignedRequestsAndReturnsAcceptedReplies) {
    const Json list = Json::parse(R"({"code":0,"msg":"ok","data":[{"deviceId":"d1","type":1}]})");
    center.setAnswer("/device/list", {200, list.dump()});
    center.setDefaultAnswer({200, R"({"code":0})"});

    EXPECT_EQ(ConnectCenterRequest::getDeviceList(status, msg), list);  // returned whole
    EXPECT_EQ(status, 0);
    EXPECT_EQ(msg, "ok");
    auto sent = center.requests();
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].method, "GET");
    EXPECT_EQ(sent[0].target, "/device/list");  // no doubled slash after the base URL's own
    EXPECT_EQ(sent[0].header("userId"), "open-1");
    EXPECT_EQ(sent[0].header("token"), kToken);
    EXPECT_EQ(sent[0].header("source"), "2");
    EXPECT_EQ(sent[0].header("version"), "1.2.3");
    EXPECT_EQ(sent[0].header("deviceId"), "pc-1");

    // Ids go into the query encoded, so that none can add parameters of its own.
    center.clearRequests();
    EXPECT_TRUE(ConnectCenterRequest::getDeviceInfo("abc", status, msg));
    EXPECT_TRUE(ConnectCenterRequest::getEvent("e 1&x=2", status, msg));
    sent = center.requests();
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].target, "/device/info?deviceId=abc");
    EXPECT_EQ(sent[1].path, "/event/get");
    EXPECT_EQ(sent[1].param("eventId"), "e 1&x=2");
    EXPECT_EQ(sent[1].param("x"), "");

    // Bodies: the event object and the device array as compact JSON; without a version of
    // its own the service's version is sent.
    dataInstance().set(&databaseParam::version, "");
    center.clearRequests();
    const Json event{{"eventType", static_cast<int>(ConnectCenterEventType::PhoneConnect)}, {"status", 1}};
    EXPECT_TRUE(ConnectCenterRequest::createEvent(event, status, msg));
    EXPECT_TRUE(ConnectCenterRequest::reportEvent(event, status, msg));
    EXPECT_TRUE(ConnectCenterRequest::reportDevice(Json::array({{{"deviceId", "pc-1"}}}), status, msg));
    sent = center.requests();
    ASSERT_EQ(sent.size(), 3u);
    EXPECT_EQ(sent[0].path + sent[1].path + sent[2].path, "/event/create/event/report/device/report");
    for (const auto& request : sent) EXPECT_EQ(request.method, "POST");
    EXPECT_EQ(sent[0].body, event.dump());
    EXPECT_EQ(sent[2].body, R"([{"deviceId":"pc-1"}])");
    EXPECT_EQ(sent[2].header("version"), Log::versionCode);
}

TEST_F(ConnectCenterRequestTest, PassedHeadersWinAndUnbindSignsAsThePreviousAccount) {
    center.setDefaultAnswer({200, R"({"code":0})"});
    EXPECT_TRUE(ConnectCenterRequest::requestIntercept("/device/list", std::nullopt, MethodType::get,
                                                       {{"userid", "someone"}}, status, msg));
    EXPECT_TRUE(ConnectCenterRequest::unBindDevice({"pc-1"}, status, msg));
    const auto sent = center.requests();
    ASSERT_EQ(sent.size(), 2u);
    EXPECT_EQ(sent[0].header("userId"), "someone");
    EXPECT_EQ(sent[0].headers.count("userId"), 1u);  // replaced, not sent twice
    EXPECT_EQ(sent[1].method + sent[1].path, "POST/device/unBind");
    EXPECT_EQ(sent[1].body, R"(["pc-1"])");
    EXPECT_EQ(sent[1].header("userId"), "open-0");
    EXPECT_EQ(sent[1].header("token"), kLastToken);
}

TEST_F(ConnectCenterRequestTest, NothingGoesOutWithoutAccountOrPcId) {
    // No previous account to unbind from (its description, tokens and all, is logged).
    dataInstance().set(&databaseParam::lastOpenId, "");
    EXPECT_FALSE(ConnectCenterRequest::unBindDevice({"pc-1"}, status, msg));
    EXPECT_TRUE(test::logged("[ConnectCenterRequest][unBindDevice] Unable to unbind device. dataInstance: "));

    // Not signed in.
    dataInstance().set(&databaseParam::openid, "");
    EXPECT_FALSE(ConnectCenterRequest::getDeviceList(status, msg));
    EXPECT_TRUE(test::logged("[ConnectCenterRequest][responseIntercept] path: /device/list, openid is empty \n"));
    EXPECT_EQ(pcsuite.requestCount(), 0u);  // not even the PC suite was asked for the PC's id

    // Signed in, but neither the record nor the PC suite (nor its config.json) knows the PC.
    dataInstance().update([](databaseParam& p) {
        p.openid = "open-1";
        p.pcDeviceId = "";
    });
    pcsuite.setAnswer("/pcDeviceInfo", {200, R"({"code":"000000","data":{}})"});
    EXPECT_FALSE(ConnectCenterRequest::getDeviceList(status, msg));
    EXPECT_EQ(pcsuite.requestCount(), 1u);

    // A token that would end the header block is not sent either.
    dataInstance().update([](databaseParam& p) {
        p.pcDeviceId = "pc-1";
        p.token = std::string(kToken) + "\r\nX-Injected: 1";
    });
    EXPECT_FALSE(ConnectCenterRequest::getDeviceList(status, msg));
    EXPECT_EQ(center.requestCount(), 0u);

    // When the PC suite knows the PC's id, that id signs the request.
    dataInstance().update([](databaseParam& p) {
        p.pcDeviceId = "";
        p.token = kToken;
    });
    pcsuite.setAnswer("/pcDeviceInfo", {200, R"({"code":"000000","data":{"deviceId":"pc-suite","version":"9"}})"});
    center.setDefaultAnswer({200, R"({"code":0})"});
    EXPECT_TRUE(ConnectCenterRequest::getDeviceList(status, msg));
    ASSERT_EQ(center.requestCount(), 1u);
    EXPECT_EQ(center.requests()[0].header("deviceId"), "pc-suite");
}

TEST_F(ConnectCenterRequestTest, OnlyAnIntegerZeroCodeIsAccepted) {
    env.config().httpMaxAnswerBody = 4096;
    struct Case {
        CannedAnswer answer;
        int status;  // as the caller sees it afterwards
    };
    const std::vector<Case> cases{
        {{200, R"({"code":"0","data":[]})"}, 0},  // a text "0" is not success
        {{200, R"({"code":120000,"msg":"token invalid","token":"tok-7f3a9c21e8d4b6"})"}, 120000},
        {{200, R"({"code":0.5})"}, 0},
        {{200, R"([{"code":0}])"}, 0},
        {{200, R"({"data":[]})"}, 0},
        {{500, "server error token=tok-7f3a9c21e8d4b6", "text/plain"}, 500},
        {{200, R"({"code":0,"data":[)"}, 200},                                      // cut short
        {{200, R"({"code":0,"pad":")" + std::string(8192, 'x') + "\"}"}, -1},      // too large
        {{200, std::string(100, '[') + std::string(100, ']')}, 200},                // too deep
    };
    for (const auto& c : cases) {
        center.setAnswer("/device/list", c.answer);
        status = -1;
        EXPECT_FALSE(ConnectCenterRequest::getDeviceList(status, msg)) << c.answer.body.substr(0, 40);
        EXPECT_EQ(status, c.status) << c.answer.body.substr(0, 40);
    }
    EXPECT_TRUE(test::logged(R"([ConnectCenterRequest][responseIntercept] path: /device/list, request err: {"code":120000,)"));
}

TEST_F(ConnectCenterRequestTest, SurvivesACenterThatIsDownSlowOrThrottling) {
    // Down: nothing answers on the port.
    Endpoints::setConnectCenterServerUrl("http://127.0.0.1:" + std::to_string(test::freeTcpPort()));
    EXPECT_FALSE(ConnectCenterRequest::getDeviceList(status, msg));
    EXPECT_EQ(status, -1);
    EXPECT_EQ(msg, "caller");

    // Slow: the answer comes after the request's time-out.
    Endpoints::setConnectCenterServerUrl(center.baseUrl());
    env.config().httpRequestTimeout = 200ms;
    center.setAnswer("/event/create", {200, R"({"code":0})", "application/json", 30s});
    EXPECT_FALSE(ConnectCenterRequest::createEvent(Json::object(), status, msg));

    // Throttled: three attempts at most, then no value; a 429 followed by an answer succeeds.
    env.config().httpRequestTimeout = 2s;
    center.setAnswer("/device/list", {429, R"({"code":10005})"});
    EXPECT_FALSE(ConnectCenterRequest::getDeviceList(status, msg));
    EXPECT_EQ(center.requestsTo("/device/list").size(), 3u);
    center.clearRequests();
    center.queueAnswer("/device/report", {429, R"({"code":10005})"});
    center.setAnswer("/device/report", {200, R"({"code":0})"});
    EXPECT_TRUE(ConnectCenterRequest::reportDevice(Json::array(), status, msg));
    EXPECT_EQ(center.requestCount(), 2u);
}

// https: the center's certificate is checked against the system's trust store (here a test CA
// handed to OpenSSL's default locations) and must name the host that was asked.
TEST_F(ConnectCenterRequestTest, HttpsTrustsTheSystemStoreAndChecksTheName) {
    const std::string dir = env.dir().str();
    const auto sh = [](const std::string& command) { return std::system((command + " >/dev/null 2>&1").c_str()) == 0; };
    const std::string ec = " -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes";
    bool made = sh("openssl req -x509" + ec + " -keyout " + dir + "/ca.key -out " + dir + "/ca.pem -days 2 -subj /CN=TestCA");
    for (const std::string name : {"good", "other"}) {
        const std::string san = name == "good" ? "IP:127.0.0.1" : "DNS:other.example";
        made = made && sh("openssl req" + ec + " -keyout " + dir + "/" + name + ".key -out " + dir + "/" + name +
                          ".csr -subj /CN=" + name) &&
               !env.dir().write(name + ".ext", "subjectAltName=" + san + "\n").empty() &&
               sh("openssl x509 -req -in " + dir + "/" + name + ".csr -CA " + dir + "/ca.pem -CAkey " + dir +
                  "/ca.key -CAcreateserial -days 2 -out " + dir + "/" + name + ".pem -extfile " + dir + "/" + name +
                  ".ext");
    }
    if (!made) GTEST_SKIP() << "openssl could not make the test certificates";
    test::ScopedEnv trustStore("SSL_CERT_FILE", dir + "/ca.pem");
    env.config().caCertPath.clear();

    test::StubPcSuite good(dir + "/good.pem", dir + "/good.key");
    good.setDefaultAnswer({200, R"({"code":0})"});
    Endpoints::setConnectCenterServerUrl(good.baseUrl());
    EXPECT_TRUE(ConnectCenterRequest::getDeviceList(status, msg));
    EXPECT_EQ(good.requestCount(), 1u);

    // Signed by the trusted CA, but for another name: refused before anything is sent.
    test::StubPcSuite other(dir + "/other.pem", dir + "/other.key");
    other.setDefaultAnswer({200, R"({"code":0})"});
    Endpoints::setConnectCenterServerUrl(other.baseUrl());
    EXPECT_FALSE(ConnectCenterRequest::getDeviceList(status, msg));
    EXPECT_EQ(other.requestCount(), 0u);
}

}  // namespace
}  // namespace kesu
