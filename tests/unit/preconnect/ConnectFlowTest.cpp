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

// The reply texts of every answer and the fallback are checked through the service in
// ConnectFlowE2ETest; here: the held link stays held and the device type reaches the caller.
TEST_F(ConnectFlowTest, AnAnswerOnTheHeldLinkKeepsItHeld) {
    std::unique_ptr<phonesim::Listener> phone;
    const auto entry = holdPhone(phone, phonesim::Answer::Accept);
    std::string deviceType;
    EXPECT_EQ(connect(entry->getDeviceId(), &deviceType), reply(0, "", "127.0.0.1", "_WFD:0_WSR:0_WRR:0_WPR:0"));
    EXPECT_EQ(deviceType, "phone");
    EXPECT_EQ(Json::parse(nextOfTag(*phone, 0))["id"], 87654321);
    EXPECT_EQ(phone->links(), 1u);
    EXPECT_TRUE(entry->getIsConnected());
}

TEST_F(ConnectFlowTest, NoAnswerAnywhereIsAFailureNotASuccess) {
    std::unique_ptr<phonesim::Listener> phone;
    const auto entry = holdPhone(phone, phonesim::Answer::Silent, phonesim::Answer::Silent);
    EXPECT_EQ(connect(entry->getDeviceId()),
              reply(-10000, "parser phone data failed", "", "_WFD:0_WSR:0_WRR:-1_TF:0_WO:-1"));
}

// A held link that breaks ends the wait for its answer at once, not at the time-out; the fresh
// link then finds the phone silent, or nobody listening.
TEST_F(ConnectFlowTest, ABrokenLinkEndsTheAnswerWaitAndAFailedFreshLinkIsAFailure) {
    env.config().connectFlowAnswerTimeout = 60s;
    env.config().connectFlowFallbackTimeout = 500ms;
    for (const bool refused : {false, true}) {
        SCOPED_TRACE(refused ? "nobody listening" : "silent");
        std::unique_ptr<phonesim::Listener> phone;
        const auto entry = holdPhone(phone, phonesim::Answer::HangUp);
        if (refused) env.config().phoneTcpPort = freeTcpPort();
        auto result = std::async(std::launch::async, [&] { return connect(entry->getDeviceId()); });
        ASSERT_EQ(result.wait_for(20s), std::future_status::ready);
        EXPECT_EQ(result.get(), reply(-10000, "parser phone data failed", "",
                                      refused ? "_WFD:0_WSR:0_WRR:-1_TF:-1_WO:-1" : "_WFD:0_WSR:0_WRR:-1_TF:0_WO:-1"));
        registry.clearAllDevices();
    }
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
