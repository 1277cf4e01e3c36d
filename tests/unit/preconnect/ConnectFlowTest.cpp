// The connection over a held pre-connection, against a simulated phone on loopback: the
// request on the held link, the phone's answers, and the fallback to a fresh link.
#include <gtest/gtest.h>

#include <future>

#include "PreconnectFixture.h"
#include "connect/PcsuiteInterface.h"
#include "discovery/StateCheck.h"
#include "preconnect/ConnectFlow.h"
#include "preconnect/DeviceWaitForPreConnectManager.h"

namespace kesu::test {
namespace {

class ConnectFlowTest : public PreconnectTest {
protected:
    void SetUp() override {
        PreconnectTest::SetUp();
        env.config().connectFlowAnswerTimeout = 500ms;
        env.config().connectFlowFallbackTimeout = 2s;
        PcsuiteInterface::setLoop(&loop);
    }
    void TearDown() override {
        PcsuiteInterface::setLoop(nullptr);
        PreconnectTest::TearDown();
    }

    // A phone that answers a connection request on its held link as `held` says and one on
    // a fresh link as `fresh` says; its entry is held and in the registry.
    std::shared_ptr<DeviceWaitForPreConnect> holdPhone(std::unique_ptr<phonesim::Listener>& phone,
                                                       std::optional<phonesim::Answer> held,
                                                       phonesim::Answer fresh = phonesim::Answer::Silent) {
        auto options = phoneOptions();
        options.heldAnswer = held;
        options.answer = fresh;
        phone = std::make_unique<phonesim::Listener>(options);
        EXPECT_TRUE(phone->ok());
        auto entry = entryFor(phone->port());
        EXPECT_EQ(handshake(entry), true);
        registry.addDevices(entry->getDeviceId(), entry);
        return entry;
    }

    Json connect(const std::string& id, std::string* deviceTypeSeen = nullptr) {
        std::string deviceType;
        ConnectFlow flow([deviceTypeSeen](const std::string& type) {
            if (deviceTypeSeen) *deviceTypeSeen = type;
        }, registry);
        return Json::parse(flow.start(id, deviceType, "1"));
    }

    static Json reply(int error, const std::string& message, const std::string& data, const std::string& steps) {
        return {{"error", error}, {"error_message", message}, {"data", data}, {"connection_steps", steps}};
    }

    DeviceWaitForPreConnectManager registry{&loop};
};

TEST_F(ConnectFlowTest, ThePhonesAnswerOnTheHeldLinkDecides) {
    struct Case {
        phonesim::Answer answer;
        Json expected;
    };
    const Case cases[] = {
        {phonesim::Answer::Accept, reply(0, "", "127.0.0.1", "_WFD:0_WSR:0_WRR:0_WPR:0")},
        {phonesim::Answer::Reject, reply(-10004, "phone is rejected", "3", "_WFD:0_WSR:0_WRR:0_WPR:-3")},
        {phonesim::Answer::Busy, reply(-10001, "phone is busy", "", "_WFD:0_WSR:0_WRR:0_WPR:-2")},
    };
    for (const Case& c : cases) {
        std::unique_ptr<phonesim::Listener> phone;
        const auto entry = holdPhone(phone, c.answer);
        std::string deviceType;
        EXPECT_EQ(connect(entry->getDeviceId(), &deviceType), c.expected);
        EXPECT_EQ(deviceType, "phone");

        const Json request = Json::parse(nextOfTag(*phone, 0));
        EXPECT_EQ(request["extra_info"], R"({"isAutoConnect":"1"})");
        EXPECT_EQ(request["id"], 87654321);
        EXPECT_EQ(request["open_Id"], "openid-of-pc");
        // The answer came on the held link, which stays held.
        EXPECT_EQ(phone->links(), 1u);
        EXPECT_TRUE(entry->getIsConnected());
        registry.clearAllDevices();
        entry->disconnectPreConnect();
    }
}

TEST_F(ConnectFlowTest, ASilentLinkIsEndedAndAFreshLinkTriedOnce) {
    std::unique_ptr<phonesim::Listener> phone;
    const auto entry = holdPhone(phone, phonesim::Answer::Silent, phonesim::Answer::Accept);
    EXPECT_EQ(connect(entry->getDeviceId()), reply(0, "", "127.0.0.1", "_WFD:0_WSR:0_WRR:-1_TF:0_WO:0"));
    // The held link was let go, and the fresh link carried the plain request.
    ASSERT_TRUE(notices->waitFor(1, 5s));
    EXPECT_FALSE(nextOfTag(*phone, 0).empty());
    const std::string fresh = nextOfTag(*phone, 0);
    ASSERT_FALSE(fresh.empty());
    EXPECT_FALSE(Json::parse(fresh).contains("extra_info"));
}

TEST_F(ConnectFlowTest, NoAnswerAnywhereOrNoDeviceIsAFailureNotASuccess) {
    std::unique_ptr<phonesim::Listener> phone;
    const auto entry = holdPhone(phone, phonesim::Answer::Silent, phonesim::Answer::Silent);
    EXPECT_EQ(connect(entry->getDeviceId()),
              reply(-10000, "parser phone data failed", "", "_WFD:0_WSR:0_WRR:-1_TF:0_WO:-1"));

    const Json notFound = reply(-10002, "Preconnect device not find", "", "_WFD:-1");
    EXPECT_EQ(connect("00000000"), notFound);
    // Listed but not held.
    entry->setIsConnected(false);
    EXPECT_EQ(connect(entry->getDeviceId()), notFound);
}

TEST_F(ConnectFlowTest, APhonePortThatRefusesIsAFailedStep) {
    std::unique_ptr<phonesim::Listener> phone;
    const auto entry = holdPhone(phone, phonesim::Answer::HangUp);
    env.config().phoneTcpPort = freeTcpPort();  // the fallback finds nobody listening
    EXPECT_EQ(connect(entry->getDeviceId()),
              reply(-10000, "parser phone data failed", "", "_WFD:0_WSR:0_WRR:-1_TF:-1_WO:-1"));
}

// The answer wait ends with the link, not at its time-out.
TEST_F(ConnectFlowTest, ALinkThatBreaksEndsTheWaitForTheAnswer) {
    env.config().connectFlowAnswerTimeout = 60s;
    env.config().connectFlowFallbackTimeout = 500ms;
    std::unique_ptr<phonesim::Listener> phone;
    const auto entry = holdPhone(phone, phonesim::Answer::HangUp);
    auto result = std::async(std::launch::async, [&] { return connect(entry->getDeviceId()); });
    ASSERT_EQ(result.wait_for(20s), std::future_status::ready);
    EXPECT_EQ(result.get()["connection_steps"], "_WFD:0_WSR:0_WRR:-1_TF:0_WO:-1");
}

TEST_F(ConnectFlowTest, CancelIsSeenBetweenTheSteps) {
    env.config().connectFlowAnswerTimeout = 2s;
    std::unique_ptr<phonesim::Listener> phone;
    const auto entry = holdPhone(phone, phonesim::Answer::Silent);
    auto result = std::async(std::launch::async, [&] { return connect(entry->getDeviceId()); });
    ASSERT_FALSE(nextOfTag(*phone, 0).empty());  // the request is out: the flow waits for the answer
    StateCheck::instance().setPrimaryConnectCancel(true);
    // Seen before the answer wait or after it, but never followed by a fresh link.
    const Json cancelled = result.get();
    EXPECT_EQ(cancelled["error"], -10005);
    EXPECT_EQ(cancelled["error_message"], "CANCEL");
    EXPECT_EQ(cancelled["connection_steps"].get<std::string>().rfind("_WFD:0_WSR:0", 0), 0u) << cancelled;
    EXPECT_EQ(cancelled["connection_steps"].get<std::string>().find("_TF"), std::string::npos) << cancelled;
}

TEST(ConnectFlowParser, ClassifiesByTagBusyFirstAndNeverReadsPastTheFrame) {
    EXPECT_EQ(ConnectFlow::wlanDataParser(buildPhoneFrame(R"({"bytes":[1]})")), 1);
    EXPECT_EQ(ConnectFlow::wlanDataParser(buildPhoneFrame(R"({"bytes":[2]})")), 2);
    EXPECT_EQ(ConnectFlow::wlanDataParser(buildPhoneFrame(R"({"a":"\"bytes\":[1]","bytes":[11]})")), 11);
    EXPECT_EQ(ConnectFlow::wlanDataParser(buildPhoneFrame(R"({"bytes": [1]})")), -1);
    EXPECT_EQ(ConnectFlow::wlanDataParser(buildPhoneFrame("")), -1);
    EXPECT_EQ(ConnectFlow::wlanDataParser(Bytes(5, '\0')), -1);
    EXPECT_EQ(ConnectFlow::wlanDataParser(buildPhoneFrame("\xff\xfe")), -1);
}

}  // namespace
}  // namespace kesu::test
