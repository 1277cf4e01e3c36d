// The PC-initiated connection against simulated phones on loopback: the request on the wire,
// every answer, silence, hang-up, refusal, address-less devices, a cancel that
// ends the wait, and a second request while one waits.
#include <gtest/gtest.h>

#include <future>

#include "connect/PcsuiteInterface.h"
#include "discovery/SsdpDeviceManager.h"
#include "phonesim/PhoneSimulator.h"
#include "unit/UnitHelpers.h"
#include "unit/connect/ConnectFixture.h"
#include "connect/ConnectionState.h"
#include "core/WallClock.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;
using test::control;
using Phone = phonesim::Listener;

Phone::Options answering(phonesim::Answer answer, std::string body = "") {
    Phone::Options options;
    options.answer = answer;
    options.answerBody = std::move(body);
    return options;
}
constexpr auto kAnswer = phonesim::Answer::Accept;
constexpr auto kSilent = phonesim::Answer::Silent;
constexpr auto kHangUp = phonesim::Answer::HangUp;

// Far beyond any exchange here; a wait that ends well before it ended by its event.
constexpr auto kLong = 120s;
constexpr auto kWellBeforeLong = 60s;

class ActiveConnectTest : public test::PcIdentityTest {
protected:
    void SetUp() override {
        PcIdentityTest::SetUp();
        loop.start();
        PcsuiteInterface::setLoop(&loop);
        clearTable();
        env.config().activeConnectTimeout = kLong;
    }
    void TearDown() override {
        clearTable();
        SSDPcancel() = false;
        PcsuiteInterface::setLoop(nullptr);
        PcIdentityTest::TearDown();
    }
    static void clearTable() { SsdpDeviceManager::instance().ssdpDeviceMap.clear(); }
    static void addDevice(const std::string& id, std::vector<std::string> ip, const std::string& type = "phone") {
        auto device = std::make_shared<SsdpDevice>();
        device->deviceId = id;
        device->ip = std::move(ip);
        device->deviceType = type;
        device->lastUpdate = WallClock::currentTimeStamp();
        SsdpDeviceManager::instance().ssdpDeviceMap.insert(id, device);
    }
    // A phone on loopback known to the table as "d1".
    void usePhone(const Phone& phone, const std::string& type = "phone") {
        env.config().phoneTcpPort = phone.port();
        addDevice("d1", {"127.0.0.1"}, type);
    }
    static Json connect(const std::string& id) { return Json::parse(PcsuiteInterface().ActiveConnect(id)); }
};

TEST_F(ActiveConnectTest, PhoneAgreesWithTheRequestOnTheWire) {
    Phone phone(answering(kAnswer, R"({"bytes":[1],"deviceName":"phone"})"));
    usePhone(phone, "pad");
    EXPECT_EQ(connect("d1"), (Json{{"error", 0},
                                   {"error_message", ""},
                                   {"connection_steps", "_WI:0_WF:0_TF:0_WO:0"},
                                   {"data", "127.0.0.1"}}));
    EXPECT_EQ(phone.request(5s), pcRequest().dump());  // compact JSON with exactly these members
    EXPECT_TRUE(phone.pcClosed(kWellBeforeLong));      // the link is closed after the answer
    EXPECT_EQ(ConnectionState::getConnectingDeviceType(), "pad");
    EXPECT_TRUE(ConnectionState::getWlanConnState());
}

// Answers that are no answer, silence and a hang-up; the link is closed after each. Refusal
// and busy answers are checked end to end (ConnectE2E).
TEST_F(ActiveConnectTest, OtherAnswersSilenceHangUpAndNoListener) {
    const std::string timedOut = "[SSDP search] connect timeout or phone wake up pcsuite failed.";
    struct Case {
        const char* name;
        Phone::Options phone;
        int error;
        std::string message, steps;
    };
    const std::vector<Case> cases = {
        {"other tag", answering(kAnswer, R"({"bytes":[23]})"), -10007, timedOut, "-1"},
        {"not UTF-8", answering(kAnswer, "{\"bytes\":[1],\"x\":\"\xff\"}"), -10007, timedOut, "-1"},
        {"silent", answering(kSilent), -10007, timedOut, "-1"},
        {"hang-up", answering(kHangUp), -10007, timedOut, "-1"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        env.config().activeConnectTimeout = c.phone.answer == kSilent ? 300ms : kLong;
        Phone phone(c.phone);
        usePhone(phone);
        EXPECT_EQ(connect("d1"), (Json{{"error", c.error},
                                       {"error_message", c.message},
                                       {"connection_steps", "_WI:0_WF:0_TF:0_WO:" + c.steps}}));
        if (c.phone.answer != kHangUp) {
            EXPECT_TRUE(phone.pcClosed(kWellBeforeLong));
        }
    }
    // Nothing listens on the phone's port: the connect step failed.
    env.config().phoneTcpPort = test::freeTcpPort();
    EXPECT_EQ(connect("d1"), (Json{{"error", -10007}, {"error_message", timedOut}, {"connection_steps", "_WI:0_WF:0_TF:-1"}}));
    EXPECT_FALSE(ConnectionState::getWlanConnState());
}

// An unknown device's answer is checked end to end (ConnectE2E).
TEST_F(ActiveConnectTest, DeviceWithoutAddress) {
    addDevice("quiet", {});
    EXPECT_EQ(connect("quiet"), (Json{{"error", -10002},
                                      {"error_message", "[ActiveConnect] address_ quiet ssdp device has no address"},
                                      {"connection_steps", "_WI:0_WF:-1"}}));
}

// While an attempt waits, a second one is refused at once, through the control API or
// called directly; a cancel ends the wait at once and frees the slot.
TEST_F(ActiveConnectTest, SecondRequestIsBusyAndCancelEndsTheWaitAtOnce) {
    Phone phone(answering(kSilent));
    usePhone(phone);
    auto attempt = std::async(std::launch::async, [] { return control("connectSSDP", {"d1"}); });
    ASSERT_TRUE(phone.request(kWellBeforeLong));  // the attempt now waits for the answer

    const Json busy = {{"error", -10001}, {"error_message", "STATE_BUSY"}, {"connection_steps", "_WI:-1"}};
    EXPECT_EQ(control("connectSSDP", {"d1"}), busy);
    // Called directly, past the dispatcher's slot, the attempt still refuses to interleave.
    EXPECT_EQ(connect("d1"), busy);

    EXPECT_EQ(control("cancelSSDPConnect"), (Json{{"error", 0}, {"error_message", ""}}));
    ASSERT_EQ(attempt.wait_for(kWellBeforeLong), std::future_status::ready);
    EXPECT_EQ(attempt.get(), (Json{{"error", -10005},
                                   {"error_message", ""},
                                   {"errir_message", "CANCEL"},
                                   {"connection_steps", "_WI:0_WF:0_TF:0_WO:-90"}}));
    EXPECT_TRUE(phone.pcClosed(kWellBeforeLong));
    EXPECT_TRUE(ConnectionState::getIsCanConnectDevice());  // the slot is free again

    // A cancel with no attempt running changes nothing for the next attempt.
    control("cancelSSDPConnect");
    Phone next(answering(kAnswer));
    usePhone(next);
    EXPECT_EQ(connect("d1")["error"], 0);
}

}  // namespace
}  // namespace kesu
