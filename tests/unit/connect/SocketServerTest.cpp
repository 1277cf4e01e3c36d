// The server for phone-initiated connections with real loopback links: test phones send
// request frames, the allow window is a script that reports its arguments, the user's answer
// comes through the control API, and the PC suite's listener is a stub HTTP server. The
// unanswered window and the launch of an unreachable PC suite are covered end to end
// (ConnectE2E).
#include "connect/SocketServer.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <future>
#include <mutex>

#include "connect/AllowWindow.h"
#include "phonesim/PhoneSimulator.h"
#include "support/StubPcSuite.h"
#include "unit/UnitHelpers.h"
#include "unit/connect/ConnectFixture.h"
#include "connect/ConnectionState.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using test::control;
using Phone = phonesim::Link;

constexpr auto kLong = 120s;
constexpr auto kWait = 60s;  // how long a test phone waits for an answer

class PhoneServer : public test::PcIdentityTest {
protected:
    void SetUp() override {
        PcIdentityTest::SetUp();
        loop.start();
        allowWindowAnswers().drain();
        dataInstance().set(&databaseParam::storageDir, "/data/recv");
        Config& config = env.config();
        config.phoneServerHost = "127.0.0.1";
        config.phoneServerPort = 0;
        config.allowWindowTimeout = kLong;
        config.phoneLinkReadTimeout = kLong;
        config.httpWaitTimeout = 10s;
        pcsuite.pointPcsuiteHere(config);
        window = std::make_unique<test::LaunchRecorder>(rootedPath(config.connectStatusExecutable));
    }
    // Once the test has set its configuration (the server's threads read it).
    void startServer() {
        if (server.port() > 0) return;
        ASSERT_TRUE(ServerWorkAct(server).ServerAccept());
        ASSERT_GT(server.port(), 0);
    }
    void TearDown() override {
        server.stop();
        allowWindowAnswers().drain();
        PcIdentityTest::TearDown();
    }

    static Json request(const std::string& service, int deviceType, const std::string& name = "My Phone",
                        const std::string& openId = "openid-of-pc", const std::string& port = "") {
        Json extra = {{"deviceType", deviceType}};
        if (!port.empty()) extra["port"] = port;
        return {{"bytes", {0}},          {"target_id", "ABCDEFGH"}, {"account", "13812345678"},
                {"deviceName", name},    {"open_Id", openId},       {"service_id", service},
                {"extra_info", extra.dump()}};
    }
    // A test phone with its link to the server.
    std::unique_ptr<Phone> dial() {
        startServer();
        std::string error;
        auto phone = Phone::dial("127.0.0.1", server.port(), error);
        EXPECT_TRUE(phone) << error;
        return phone;
    }
    std::unique_ptr<Phone> send(const Bytes& frame) {
        auto phone = dial();
        EXPECT_TRUE(phone && phone->send(frame));
        return phone;
    }
    std::unique_ptr<Phone> send(const Json& body) { return send(buildPhoneFrame(body.dump())); }
    // The server's answer on the link (its raw body in `raw`); null when none came.
    static Json answer(Phone& phone, std::string* raw = nullptr) {
        std::string body;
        if (phone.read(body, kWait) != Phone::Got::Frame) return Json();
        if (raw) *raw = body;
        return Json::parse(body);
    }
    // True when the server closed the link (with nothing more to read).
    static bool closedByServer(Phone& phone) { return phone.closedByPeer(kWait); }

    test::StubPcSuite pcsuite;
    std::unique_ptr<test::LaunchRecorder> window;
    SocketServer server{loop};
};

TEST_F(PhoneServer, UserAgreesAndThePcSuiteGetsThePhone) {
    auto phone = send(request("com.kesu.pcsuite.SERVICE", 1, "My Pad"));
    const auto shown = window->next(kLong);
    ASSERT_TRUE(shown);
    EXPECT_EQ(*shown, (std::vector<std::string>{"1", "My Pad", "41424344", "138****678", "1", "pad"}));
    EXPECT_FALSE(ConnectionState::getIsCanConnectDevice());  // held while the request is handled
    EXPECT_EQ(ConnectionState::getConnectingDeviceType(), "pad");

    EXPECT_EQ(control("QtAgree", {"true"}), (Json{{"error", 0}, {"error_message", "Close"}}));
    std::string raw;
    EXPECT_EQ(answer(*phone, &raw), pcAnswer(3));
    EXPECT_NE(raw.find('\n'), std::string::npos);  // pretty-printed
    EXPECT_TRUE(closedByServer(*phone));
    ASSERT_TRUE(server.waitForNoLinks(kLong));
    EXPECT_TRUE(ConnectionState::getIsCanConnectDevice());

    // The PC suite was asked first, then got the phone.
    const auto busyCheck = pcsuite.requestsTo("/isConnectBusy");
    ASSERT_EQ(busyCheck.size(), 1u);
    EXPECT_EQ(busyCheck[0].param("deviceType"), "pad");
    const auto handOver = pcsuite.requestsTo("/");
    ASSERT_EQ(handOver.size(), 1u);
    const std::string& posted = handOver[0].body;
    const auto hash = posted.find('#');
    ASSERT_NE(hash, std::string::npos);
    const Json message = Json::parse(posted.substr(hash + 1));
    EXPECT_EQ(message, (Json{{"event", "nfcConection"},
                             {"args", {"127.0.0.1", "My Pad", "WLAN", "41424344", "0", "true", "138****678", "pad", "1"}}}));
    EXPECT_EQ(posted.substr(hash + 1), message.dump());  // compact after the count
}

TEST_F(PhoneServer, OtherPhonesAreBusyWhileOneIsHandled) {
    auto first = send(request("com.kesu.pcsuite.SERVICE", 0));
    ASSERT_TRUE(window->next(kLong));  // the first request waits for the user

    auto samePhone = send(request("com.kesu.pcsuite.SERVICE", 0, "Second Phone"));
    EXPECT_EQ(answer(*samePhone)["bytes"], Json::array({11}));
    EXPECT_TRUE(closedByServer(*samePhone));
    auto pad = send(request("com.kesu.pcsuite.SERVICE", 1, "A Pad"));
    EXPECT_EQ(answer(*pad), pcAnswer(12));
    EXPECT_TRUE(closedByServer(*pad));

    EXPECT_EQ(control("QtRefuse"), (Json{{"error", 0}, {"error_message", "Refuse"}}));
    EXPECT_EQ(answer(*first)["bytes"], Json::array({4}));
    EXPECT_TRUE(closedByServer(*first));
    ASSERT_TRUE(server.waitForNoLinks(kLong));
    EXPECT_TRUE(pcsuite.requestsTo("/").empty());  // a refused phone is not handed over
    EXPECT_EQ(pcsuite.requestsTo("/isConnectBusy").size(), 1u);

    // Neither the refusal nor the busy answers used up a sequence number: the first
    // hand-over is still number 0.
    auto agreed = send(request("com.kesu.pcsuite.SERVICE", 0));
    ASSERT_TRUE(window->next(kLong));
    EXPECT_EQ(control("QtAgree", {"false"})["error"], 0);
    EXPECT_EQ(answer(*agreed)["bytes"], Json::array({3}));
    const auto handOver = pcsuite.waitForRequest([](const test::RecordedRequest& r) { return r.path == "/"; }, kLong);
    ASSERT_TRUE(handOver);
    const Json message = Json::parse(handOver->body.substr(handOver->body.find('#') + 1));
    EXPECT_EQ(message["args"][4], "0");
}

// The wait for the user's answer holds no worker: both pool workers meet while a window is
// open. Unanswered, the window ends at its time-out as a refusal, and an answer that comes
// too late does not agree to the next window.
TEST_F(PhoneServer, AllowWindowWaitHoldsNoWorkerAndEndsAtItsTimeOut) {
    auto first = send(request("com.kesu.pcsuite.SERVICE", 0));
    ASSERT_TRUE(window->next(kLong));
    std::mutex m;
    std::condition_variable cv;
    int arrived = 0;
    auto meet = [&] {
        std::unique_lock<std::mutex> lock(m);
        ++arrived;
        cv.notify_all();
        return cv.wait_for(lock, 10s, [&] { return arrived == 2; });
    };
    std::promise<bool> a, b;
    loop.offload([&] { a.set_value(meet()); });
    loop.offload([&] { b.set_value(meet()); });
    EXPECT_TRUE(a.get_future().get());
    EXPECT_TRUE(b.get_future().get());
    EXPECT_EQ(control("QtAgree", {"false"})["error"], 0);
    EXPECT_EQ(answer(*first)["bytes"], Json::array({3}));
    ASSERT_TRUE(server.waitForNoLinks(kLong));

    env.config().allowWindowTimeout = 200ms;
    for (int round = 0; round < 2; ++round) {
        auto phone = send(request("com.kesu.pcsuite.SERVICE", 0));
        ASSERT_TRUE(window->next(kLong));
        EXPECT_EQ(answer(*phone)["bytes"], Json::array({4}));
        ASSERT_TRUE(server.waitForNoLinks(kLong));
        EXPECT_EQ(control("QtAgree", {"false"})["error"], 0);  // too late
    }
    EXPECT_NE(test::todaysLog().find("[startAllowedWindow]allow window event timedOut"), std::string::npos);
    EXPECT_EQ(pcsuite.requestsTo("/").size(), 1u);  // only the agreed phone was handed over
}

TEST_F(PhoneServer, BusyPcSuiteAnswersByDeviceType) {
    pcsuite.setAnswer("/isConnectBusy",
                      {200, R"({"code":"000000","data":{"isConnectBusy":true,"deviceType":"phone","connectStatus":"connected"}})"});
    auto phone = send(request("com.kesu.pcsuite.SERVICE", 0));
    EXPECT_EQ(answer(*phone)["bytes"], Json::array({11}));
    auto pad = send(request("com.kesu.pcsuite.SERVICE", 1));
    EXPECT_EQ(answer(*pad)["bytes"], Json::array({12}));
    ASSERT_TRUE(server.waitForNoLinks(kLong));
    EXPECT_TRUE(ConnectionState::getIsCanConnectDevice());
    EXPECT_EQ(test::todaysLog().find("[startAllowedWindow]"), std::string::npos);  // no window for a busy PC suite
}

TEST_F(PhoneServer, SharingRequestsSkipTheAllowWindow) {
    auto phone = send(request("com.kesu.share.CONNECT_PC", 1, "My Pad", "openid-of-pc", "7000"));
    EXPECT_EQ(answer(*phone), pcAnswer(3, "com.kesu.share.CONNECT_PC"));
    EXPECT_TRUE(closedByServer(*phone));
    const auto shown = window->next(kLong);
    ASSERT_TRUE(shown);
    EXPECT_EQ(*shown, (std::vector<std::string>{"2", "My Pad", "41424344", "127.0.0.1:7000", "1", "/data/recv", "0",
                                                "/data/recv"}));
    EXPECT_TRUE(pcsuite.requestsTo("/isConnectBusy").empty());

    // The receive folder follows the account; the one before it is handed on too, and a
    // missing one is replaced by the default folder.
    dataInstance().set(&databaseParam::storageDir, "/data/other");
    auto second = send(request("com.kesu.share.CONNECT_PC", 0));
    EXPECT_EQ(answer(*second)["bytes"], Json::array({3}));
    auto next = window->next(kLong);
    ASSERT_TRUE(next);
    ASSERT_EQ(next->size(), 8u);
    EXPECT_EQ((*next)[5], "/data/other");
    EXPECT_EQ((*next)[7], "/data/recv");
    dataInstance().set(&databaseParam::storageDir, "");
    auto third = send(request("com.kesu.share.CONNECT_PC", 0));
    EXPECT_EQ(answer(*third)["bytes"], Json::array({3}));
    next = window->next(kLong);
    ASSERT_TRUE(next);
    EXPECT_EQ((*next)[5], rootedPath("/Users/recvFile"));
    EXPECT_EQ((*next)[7], "/data/other");
    ASSERT_TRUE(server.waitForNoLinks(kLong));
    EXPECT_TRUE(ConnectionState::getIsCanConnectDevice());  // sharing never holds the connection slot
}

TEST_F(PhoneServer, BadInputIsDroppedAndEveryLinkIsClosed) {
    env.config().phoneLinkReadTimeout = 300ms;
    env.config().phoneFrameMaxBody = 1024;
    const std::vector<Bytes> frames = {
        buildPhoneFrame(std::string(2000, ' ')),                                                 // a body above the limit
        buildPhoneFrame(""),                                       // 14 bytes: no body
        buildPhoneFrame("{\"bytes\":[0],\"x\":\"\xff\xfe\"}"),     // not UTF-8
        buildPhoneFrame("[0]"),                                    // not an object
        buildPhoneFrame(R"({"bytes":[1]})"),                       // not a request
        buildPhoneFrame(request("com.example.OTHER", 0).dump()),  // nobody's service
        Bytes{'P', 'A', 'Y', '_', 'L', 'O', 'A', 'D', '_', '1', 0, 0, 0},  // a cut header, then silence
        Bytes(2000, 'x'),                                          // not a frame at all
    };
    for (const Bytes& frame : frames) {
        auto phone = send(frame);
        EXPECT_TRUE(closedByServer(*phone)) << frame.size();
    }
    auto silent = dial();
    EXPECT_TRUE(closedByServer(*silent));  // after the read time-out
    ASSERT_TRUE(server.waitForNoLinks(kLong));
    EXPECT_TRUE(ConnectionState::getIsCanConnectDevice());
    EXPECT_TRUE(pcsuite.requests().empty());
}

TEST_F(PhoneServer, LinksAreBoundedAndStopEndsThem) {
    env.config().phoneServerMaxLinks = 2;
    auto waiting = send(request("com.kesu.pcsuite.SERVICE", 0));
    ASSERT_TRUE(window->next(kLong));  // held in the allow window
    auto silent = dial();
    // Two links are open: a third is closed at once, long before any time-out.
    auto extra = dial();
    EXPECT_TRUE(closedByServer(*extra));
    EXPECT_EQ(server.linkCount(), 2u);

    // Stopping ends the window wait and the silent read at once.
    auto stopped = std::async(std::launch::async, [this] { server.stop(); });
    ASSERT_EQ(stopped.wait_for(60s), std::future_status::ready);
    EXPECT_TRUE(closedByServer(*waiting));
    EXPECT_TRUE(closedByServer(*silent));
    EXPECT_EQ(server.linkCount(), 0u);
    EXPECT_EQ(server.port(), 0);
    EXPECT_TRUE(ConnectionState::getIsCanConnectDevice());

    // The server opens again; a second server on its port reports the port in use.
    ASSERT_TRUE(server.ConnectStatusGet());
    auto again = send(request("com.kesu.share.CONNECT_PC", 0));
    EXPECT_EQ(answer(*again)["bytes"], Json::array({3}));
    ASSERT_TRUE(window->next(kLong));
    env.config().phoneServerPort = server.port();
    SocketServer second{loop};
    EXPECT_FALSE(second.ConnectStatusGet());
    EXPECT_EQ(second.port(), 0);
}

}  // namespace
}  // namespace kesu
